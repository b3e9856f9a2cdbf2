#pragma once

#include <functional>
#include <memory>

#include "host/HostPorterExtension.h"

namespace tamber {

// How an extension and a host meet. The extension registers its principal class (a factory);
// the host runtime registers what it runs with the instance. HostExtensionMain is the process
// entry point of an extension: it makes the principal instance and hands it to the host.
using HostPrincipalClassFactory = std::function<std::shared_ptr<HostPorterExtension>()>;
using HostRuntimeMain =
    std::function<int(int argc, char** argv, std::shared_ptr<HostPorterExtension> extension)>;

void HostRegisterPrincipalClass(HostPrincipalClassFactory factory);
void HostRegisterRuntime(HostRuntimeMain runtime);

// Returns the runtime's exit status; 70 (EX_SOFTWARE) with an error line when either side has
// not registered.
int HostExtensionMain(int argc, char** argv);

}  // namespace tamber
