#include "host/HostExtensionMain.h"

#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

struct Registry {
    Mutex mutex;
    HostPrincipalClassFactory factory GUARDED_BY(mutex);
    HostRuntimeMain runtime GUARDED_BY(mutex);
};

Registry& registry() {
    static Registry r;
    return r;
}

}  // namespace

void HostRegisterPrincipalClass(HostPrincipalClassFactory factory) {
    Registry& r = registry();
    MutexLock lock(r.mutex);
    r.factory = std::move(factory);
}

void HostRegisterRuntime(HostRuntimeMain runtime) {
    Registry& r = registry();
    MutexLock lock(r.mutex);
    r.runtime = std::move(runtime);
}

int HostExtensionMain(int argc, char** argv) {
    HostPrincipalClassFactory factory;
    HostRuntimeMain runtime;
    {
        Registry& r = registry();
        MutexLock lock(r.mutex);
        factory = r.factory;
        runtime = r.runtime;
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
