#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

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

// The summed size of the regular files below a directory (symbolic links not followed). The
// directory is opened inside the published trees only.
Result<uint64_t> pt_directorySizeWithError(const Url& url);

// Opens the item for attribute writes (read-only, never through a symbolic link, directories
// included), runs `body` with the descriptor and closes it. False when the open failed or
// `body` returned false; errno is then the one of the failing call, or EACCES for an item
// outside the published trees (which is never opened).
bool pt_withReadWriteAccess(const Url& url, const std::function<bool(int fd)>& body);

// The file operations below run on the calling thread and call their completion exactly once,
// before returning, with the resulting URL or the error.
//
// Every operation works only inside the published trees (see PublishedTrees): a source item,
// a destination folder or a folder to create in that lies outside them, or is reached through a
// symbolic link below a root, fails with the boundary's error before anything is touched.
// A name given by the caller that is empty, ".", "..", ".Trash", or holds "/" or NUL fails with
// the host framework's invalid-parameter error, whose description says what is wrong (see
// checkItemName); other failures are the POSIX error of the failing call.
// Names never replace an existing item: where an operation "bounces", a taken name becomes
// "name 2.ext", "name 3.ext", ... (a folder, or a name without extension: "name 2"); where it
// does not, the operation fails with EEXIST and leaves both items alone. The item operated on
// is never followed when it is a symbolic link, and walks never follow links inside a folder.
// Moves are single renames: an item is never left in two places or in none, and a move to
// another file system fails with EXDEV instead of copying.
using UrlCompletion = std::function<void(Result<Url>)>;
using ErrorCompletion = std::function<void(Status)>;

// Copies `source` (a file, a folder with everything below it, or a symbolic link as a link)
// into `folder` under its own name, bouncing. The source may lie anywhere; `folder` must be
// inside. Other kinds of file (pipes, sockets, devices), and a folder that is `folder` or one
// of its ancestors, are refused with an invalid-parameter error saying so. The copy is
// assembled under a hidden staging name (see StagingCopies) in `folder` and renamed into
// place, so the final name never holds a partial copy; on failure the staging copy is
// removed. The source is never changed.
void pt_importUnderFolder(const Url& source, const Url& folder, const UrlCompletion& completion);

// Creates the folder `name` in `folder`: a taken name fails with EEXIST, or bounces to
// "name 2", ... when `bounce`.
void pt_createSubFolder(const Url& folder, const std::string& name, bool bounce,
                        const UrlCompletion& completion);

// Gives the item a new name in its folder; fails on a taken name. The same name is a no-op.
void pt_renameWithNewName(const Url& url, const std::string& name, const UrlCompletion& completion);

// Moves the item into `folder`, under `newName` or its own name; fails on a taken name.
void pt_reparentUnderFolder(const Url& url, const Url& folder,
                            const std::optional<std::string>& newName,
                            const UrlCompletion& completion);
// (Keeps a string literal from choosing the bouncing overload below; null means no new name.)
void pt_reparentUnderFolder(const Url& url, const Url& folder, const char* newName,
                            const UrlCompletion& completion);
// Moves the item into `folder` under its own name, bouncing when `allowBouncing`.
void pt_reparentUnderFolder(const Url& url, const Url& folder, bool allowBouncing,
                            const UrlCompletion& completion);

// Moves the item into `folder` under `name`, bouncing: how a file assembled under a staging
// name (an upload) takes the name it was given.
void pt_placeUnderFolder(const Url& url, const Url& folder, const std::string& name,
                         const UrlCompletion& completion);

// Moves the item into the (existing) trash folder, bouncing.
void pt_trashUnderFolder(const Url& url, const Url& trashFolder, const UrlCompletion& completion);

// Creates the trash folder when it is missing. One that exists as a symbolic link is refused
// with the boundary's error (it would carry trashed items out of the tree); one that is not a
// folder fails with ENOTDIR.
Status pt_ensureTrashFolder(const Url& trashFolder);

// Deletes the item; a folder with everything below it. Symbolic links are removed, never
// followed. A failure part-way leaves what was not yet removed in place.
void pt_deleteWithCompletionHandler(const Url& url, const ErrorCompletion& completion);

}  // namespace tamber
