#pragma once

#include <cstdint>
#include <string_view>

#include "support/Error.h"

namespace tamber {

inline constexpr const char* kLocalPorterErrorDomain = "LocalPorter.Error";

// The provider's own failures; the codes are the cases' positions.
enum class LocalPorterError : int64_t {
    invalidItemIdentifier = 0,
    invalidItemURL = 1,
    itemNotFound = 2,
    unableToGetDeviceUUID = 3,
};

std::string_view localPorterErrorName(LocalPorterError error);
Error makeLocalPorterError(LocalPorterError error);

}  // namespace tamber
