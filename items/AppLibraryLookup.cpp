#include "items/AppLibraryLookup.h"

#include <atomic>
#include <mutex>

#include "host/PublishedTrees.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

std::shared_ptr<AppLibraryLookup>& slot() {
    static ProcessWide<std::shared_ptr<AppLibraryLookup>> lookup;
    return *lookup;
}

}  // namespace

std::shared_ptr<AppLibraryLookup> AppLibraryLookup::current() {
    return std::atomic_load(&slot());
}

std::shared_ptr<AppLibraryLookup> AppLibraryLookup::setCurrent(
    std::shared_ptr<AppLibraryLookup> lookup) {
    // The libraries this lookup knows are the published trees besides the storage.
    static std::once_flag hooked;
    std::call_once(hooked, [] {
        PublishedTrees::setAppLibraryRootsSource([] {
            auto current = AppLibraryLookup::current();
            return current ? current->rootURLsForAppLibraries() : std::vector<Url>{};
        });
    });
    return std::atomic_exchange(&slot(), std::move(lookup));
}

}  // namespace tamber
