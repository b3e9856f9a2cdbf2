#include "platform/apps/AppRegistry.h"

#include <mutex>

#include "platform/apps/DesktopEntryRegistry.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

struct DefaultRegistry {
    std::mutex mutex;
    std::shared_ptr<AppRegistry> registry;  // created on first use
};

DefaultRegistry& defaultState() {
    static ProcessWide<DefaultRegistry> state;
    return *state;
}

}  // namespace

std::shared_ptr<AppRegistry> AppRegistry::defaultRegistry() {
    auto& state = defaultState();
    std::lock_guard lock(state.mutex);
    if (!state.registry)
        state.registry = std::make_shared<DesktopEntryRegistry>();
    return state.registry;
}

std::shared_ptr<AppRegistry> AppRegistry::setDefaultRegistry(
    std::shared_ptr<AppRegistry> registry) {
    auto& state = defaultState();
    std::lock_guard lock(state.mutex);
    auto previous = state.registry ? state.registry : std::make_shared<DesktopEntryRegistry>();
    state.registry = registry ? std::move(registry) : std::make_shared<DesktopEntryRegistry>();
    return previous;
}

}  // namespace tamber
