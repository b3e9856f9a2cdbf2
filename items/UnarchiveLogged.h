#pragma once

#include <memory>

#include "platform/objects/Data.h"

namespace tamber {

// Unarchives with no class restriction and casts the root to T. Empty data yields nothing
// silently; any other failure (including a root of another class) logs one error line that
// begins "got " and yields nothing. Instantiated for Date and Dictionary.
template <class T>
std::shared_ptr<const T> UnarchiveLogged(const Bytes& data);

}  // namespace tamber
