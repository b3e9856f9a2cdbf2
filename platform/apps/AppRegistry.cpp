#include "platform/apps/AppRegistry.h"

#include "platform/apps/DesktopEntryRegistry.h"
#include "support/MutexLock.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

struct DefaultRegistry {
    Mutex mutex;
    std::shared_ptr<AppRegistry> registry GUARDED_BY(mutex);  // created on first use
};

DefaultRegistry& defaultState() {
    static ProcessWide<DefaultRegistry> state;
    return *state;
}

}  // namespace

std::shared_ptr<AppRegistry> AppRegistry::defaultRegistry() {
    auto& state = defaultState();
    MutexLock lock(state.mutex);
    if (!state.registry)
        state.registry = std::make_shared<DesktopEntryRegistry>();
    return state.registry;
}

std::shared_ptr<AppRegistry> AppRegistry::setDefaultRegistry(
    std::shared_ptr<AppRegistry> registry) {
    auto& state = defaultState();
    MutexLock lock(state.mutex);
    auto previous = state.registry ? state.registry : std::make_shared<DesktopEntryRegistry>();
    state.registry = registry ? std::move(registry) : std::make_shared<DesktopEntryRegistry>();
    return previous;
}

}  // namespace tamber
