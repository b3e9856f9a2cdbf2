#pragma once

#include <memory>

#include "host/HostPorterManager.h"
#include "platform/FileSystem.h"

namespace tamber {

// What the provider is given by the host that runs it, rather than reaching for process-wide
// slots: the manager it signals and whose storage folder it serves, and the file system.
struct ProviderServices {
    std::shared_ptr<HostPorterManager> manager;
    FileSystem* fileSystem = nullptr;

    // The process's current choices, for hosts (and tests) that install them as slots.
    static ProviderServices fromCurrentSlots() {
        return {HostPorterManager::defaultManager(), &FileSystem::current()};
    }
};

}  // namespace tamber
