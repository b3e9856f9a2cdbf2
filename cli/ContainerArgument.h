#pragma once

#include <string>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterExtension.h"
#include "support/Result.h"

namespace tamber {

// The container a listing verb names (an identifier, a path, or "root", "working-set",
// "all-directories") and its enumerator from the provider.
struct ContainerArgument {
    HostPorterItemIdentifier identifier;
    HostPorterEnumeratorRef enumerator;

    static Result<ContainerArgument> resolve(HostPorterExtension& provider,
                                             const std::string& text);
};

}  // namespace tamber
