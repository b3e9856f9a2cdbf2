#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tamber {

// The canonical upper-case 8-4-4-4-12 form of a UUID written in hexadecimal (either case), or
// nothing when the text is not one.
std::optional<std::string> canonicalUUIDText(std::string_view text);

}  // namespace tamber
