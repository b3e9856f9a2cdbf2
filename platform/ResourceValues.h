#pragma once

#include <string>
#include <vector>

#include "platform/Url.h"
#include "platform/objects/Object.h"
#include "support/Result.h"

namespace tamber::ResourceValues {

// Resource values read from the file system, for Url. Everything goes through
// FileSystem::current(), so that tests can make it fail.

// Whether `key` is one of ResourceKeys.
bool isKnownKey(ResourceKey key);
// Whether the value of `key` comes from the file itself (all but the document ID).
bool isReadFromFile(ResourceKey key);

// The values of `keys` (known keys read from the file) for the file at `path`, an absolute,
// standardised path, in the order of `keys`; null where the file has no such value. One statx
// (never following a final symbolic link) serves all of them. A missing file is
// Error::fileNoSuchFile; any other failure the POSIX error.
Result<std::vector<ObjectRef>> read(const std::string& path, const std::vector<ResourceKey>& keys);

// An error for a key that is not one of ResourceKeys.
Error unknownKeyError(ResourceKey key);

}  // namespace tamber::ResourceValues
