#pragma once

#include <string>

#include "support/Result.h"

namespace tamber {

// The name of the trash folder of a library; no item may be given this name by a caller.
inline constexpr const char* kTrashFolderName = ".Trash";

// Nothing when `name` may be given to an item by a caller; else the host framework's
// invalid-parameter error whose description says what is wrong with it ("name must not be
// empty", "name '..' is reserved", "name must not contain '/'", "name '.Trash' is reserved").
Status checkItemName(const std::string& name);

}  // namespace tamber
