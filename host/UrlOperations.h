#pragma once

#include <cstdint>
#include <functional>

#include "platform/Url.h"
#include "support/Result.h"

namespace tamber {

// How the item at one URL relates to the item at another.
enum class UrlRelationship : int { Contains = 0, Same = 1, Other = 2 };

// Same: both name the same file (same device and inode), or the same path when neither
// exists. Contains: `url` is a directory that is a strict ancestor of `other` by path
// components. Anything else is Other. Symbolic links are never followed.
UrlRelationship pt_relationshipToItemAtURL(const Url& url, const Url& other);

// A directory that is not a package.
bool pt_isFolder(const Url& url);

// The summed size of the regular files below a directory (symbolic links not followed).
Result<uint64_t> pt_directorySizeWithError(const Url& url);

// Opens the item for attribute writes (read-only, never through a final symbolic link,
// directories included), runs `body` with the descriptor and closes it. False when the open
// failed or `body` returned false; errno is then the one of the failing call.
bool pt_withReadWriteAccess(const Url& url, const std::function<bool(int fd)>& body);

}  // namespace tamber
