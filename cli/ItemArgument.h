#pragma once

#include <string>

#include "host/HostPorterExtension.h"
#include "host/HostPorterItemIdentifier.h"
#include "platform/Url.h"

namespace tamber {

// What a verb's ID argument names: an identifier (also the words "root", "working-set",
// "all-directories" for the host's containers) or a path.
struct ItemArgument {
    enum class Kind { Identifier, Path };
    Kind kind = Kind::Identifier;
    HostPorterItemIdentifier identifier;  // Kind::Identifier
    Url url;                              // Kind::Path

    static ItemArgument parse(const std::string& text);
    // The identifier `text` names: identifiers and container words as they are, a path through
    // the provider. A path outside the published trees is refused; one the provider does not
    // know is no such item.
    static Result<HostPorterItemIdentifier> resolve(HostPorterExtension& provider,
                                                    const std::string& text);
};

}  // namespace tamber
