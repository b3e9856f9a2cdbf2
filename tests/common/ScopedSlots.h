#pragma once

#include <memory>
#include <optional>

#include "host/HostPorterManager.h"
#include "items/AppLibraryLookup.h"
#include "platform/strata/StrataService.h"

namespace tamber::testing {

// Puts a test's host manager, document-ID service and app-library lookup into the slots the
// lower layers read, for the scope of the object, and gives back what they held before, in
// reverse order, however the test ends. Fixtures that need the whole provider use a
// ProviderRuntime instead.
class ScopedSlots {
public:
    ScopedSlots(std::shared_ptr<HostPorterManager> manager, std::shared_ptr<StrataService> strata,
                std::shared_ptr<AppLibraryLookup> lookup)
        : manager_(HostPorterManager::installDefaultManager(std::move(manager))),
          strata_(StrataService::setCurrent(std::move(strata))),
          lookup_(AppLibraryLookup::setCurrent(std::move(lookup))) {}
    ~ScopedSlots() {
        AppLibraryLookup::setCurrent(std::move(lookup_));
        StrataService::setCurrent(std::move(strata_));
        HostPorterManager::installDefaultManager(std::move(manager_));
    }
    ScopedSlots(const ScopedSlots&) = delete;
    ScopedSlots& operator=(const ScopedSlots&) = delete;

private:
    std::shared_ptr<HostPorterManager> manager_;
    std::shared_ptr<StrataService> strata_;
    std::shared_ptr<AppLibraryLookup> lookup_;
};

}  // namespace tamber::testing
