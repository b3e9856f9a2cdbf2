#include "items/AppLibraryLookup.h"

#include <atomic>

namespace tamber {

namespace {

std::shared_ptr<AppLibraryLookup>& slot() {
    static std::shared_ptr<AppLibraryLookup> lookup;
    return lookup;
}

}  // namespace

std::shared_ptr<AppLibraryLookup> AppLibraryLookup::current() {
    return std::atomic_load(&slot());
}

std::shared_ptr<AppLibraryLookup> AppLibraryLookup::setCurrent(
    std::shared_ptr<AppLibraryLookup> lookup) {
    return std::atomic_exchange(&slot(), std::move(lookup));
}

}  // namespace tamber
