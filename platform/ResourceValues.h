#pragma once

#include <string>
#include <vector>

#include "platform/OpenFolder.h"
#include "platform/Url.h"
#include "platform/objects/Object.h"
#include "support/Result.h"

namespace tamber::ResourceValues {

// Resource values read from the file system, for Url. Everything goes through
// FileSystem::current(), so that tests can make it fail.

// How many keys there are, and the place of one of them among them (-1 for an unknown key):
// what a cache of values indexes by.
inline constexpr size_t kKeyCount = 17;
int indexOf(ResourceKey key);
// The key at a place.
ResourceKey keyAt(size_t index);
// Whether `key` is one of ResourceKeys.
bool isKnownKey(ResourceKey key);
// Whether the value of `key` comes from the file itself (all but the document ID).
bool isReadFromFile(ResourceKey key);

// The values of `keys` (known keys read from the file) for the file at `path`, an absolute,
// standardised path, in the order of `keys`; null where the file has no such value. One statx
// (never following a final symbolic link) serves all of them. A missing file is
// Error::fileNoSuchFile; any other failure the POSIX error. With `folder` (the open folder that
// holds the file), the calls go relative to its descriptor.
Result<std::vector<ObjectRef>> read(const std::string& path, const std::vector<ResourceKey>& keys,
                                    const OpenFolder* folder = nullptr);

// An error for a key that is not one of ResourceKeys.
Error unknownKeyError(ResourceKey key);

}  // namespace tamber::ResourceValues
