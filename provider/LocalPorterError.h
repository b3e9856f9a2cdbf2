#pragma once

#include <cstdint>
#include <string>
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
// The error with a description that says what failed, and with `subject` (an identifier or a
// path) when given: "no such item: did=7". The case's name is kept in the user info ("case").
Error makeLocalPorterError(LocalPorterError error, const std::string& subject = {});

}  // namespace tamber
