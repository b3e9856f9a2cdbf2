#pragma once

#include <vector>

#include "platform/archive/ArchiveClassRegistry.h"

namespace tamber {

// How Date, Number, Array, Dictionary and Tag are archived; the registry starts with these.
// (String and Data are plain property-list scalars and need no class.)
std::vector<ArchiveClass> builtinArchiveClasses();

}  // namespace tamber
