#pragma once

#include <cstdint>
#include <string>

#include "support/Error.h"

namespace tamber {

// Codes of kArchiveErrorDomain. Every error also carries a "description" user-info entry that
// says what exactly was wrong.
enum class ArchiveErrorCode : int64_t {
    // Not a binary property list, truncated, or a top level of the wrong shape.
    InvalidData = 1,
    InputTooLarge = 2,
    UidOutOfRange = 3,
    ReferenceCycle = 4,
    TooDeep = 5,
    TooManyObjects = 6,
    // A "$class" reference or class description that is not what it should be.
    MalformedClass = 7,
    UnknownClass = 8,
    ClassNotAllowed = 9,
    // An object whose fields its class cannot make sense of.
    InvalidValue = 10,
    // Archiving: an object of a class that is not registered.
    UnregisteredClass = 11,
    // The root is not of the class the caller asked for.
    WrongClass = 12,
    // Archiving: a value a binary property list cannot hold faithfully.
    UnencodableValue = 13,
};

inline Error archiveError(ArchiveErrorCode code, std::string description) {
    return Error(kArchiveErrorDomain, static_cast<int64_t>(code),
                 {{"description", std::move(description)}});
}

}  // namespace tamber
