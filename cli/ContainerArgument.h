#pragma once

#include <string>

#include "cli/CliContext.h"
#include "host/HostPorterEnumerator.h"

namespace tamber {

// The container a listing verb names (an identifier, a path, or "root", "working-set",
// "all-directories") and its enumerator from the provider.
struct ContainerArgument {
    HostPorterItemIdentifier identifier;
    HostPorterEnumeratorRef enumerator;

    static Result<ContainerArgument> resolve(LocalPorter& porter, const std::string& text);
};

}  // namespace tamber
