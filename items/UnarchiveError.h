#pragma once

#include "support/Error.h"

namespace tamber {

// Raised when an archive decodes but its root object is not of the type asked for.
enum class UnarchiveError { invalidResultingClass };

Error makeError(UnarchiveError error);

}  // namespace tamber
