#pragma once

#include <string>

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
};

}  // namespace tamber
