#include "host/HostExtensionMain.h"

#include <mutex>

#include "support/Log.h"

namespace tamber {

namespace {

struct Registry {
    std::mutex mutex;
    HostPrincipalClassFactory factory;
    HostRuntimeMain runtime;
};

Registry& registry() {
    static Registry r;
    return r;
}

}  // namespace

void HostRegisterPrincipalClass(HostPrincipalClassFactory factory) {
    std::lock_guard lock(registry().mutex);
    registry().factory = std::move(factory);
}

void HostRegisterRuntime(HostRuntimeMain runtime) {
    std::lock_guard lock(registry().mutex);
    registry().runtime = std::move(runtime);
}

int HostExtensionMain(int argc, char** argv) {
    HostPrincipalClassFactory factory;
    HostRuntimeMain runtime;
    {
        std::lock_guard lock(registry().mutex);
        factory = registry().factory;
        runtime = registry().runtime;
    }
    if (!factory || !runtime) {
        logError("no extension principal class or host runtime registered");
        return 70;
    }
    auto extension = factory();
    if (!extension) {
        logError("the extension's principal class could not be instantiated");
        return 70;
    }
    return runtime(argc, argv, std::move(extension));
}

}  // namespace tamber
