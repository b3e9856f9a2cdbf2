#pragma once

#include <optional>
#include <string>

#include "platform/objects/Data.h"

namespace tamber {

// Page tokens and anchors travel through the command line as base64 text.
std::string base64Encode(const Bytes& bytes);
// Nothing when the text holds characters outside the base64 alphabet or has a bad length.
std::optional<Bytes> base64Decode(const std::string& text);

}  // namespace tamber
