#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>

#include "support/Result.h"

// Copying and removing whole items relative to directory descriptors, for the host's URL
// operations. Nothing here follows a symbolic link below the descriptors it is given: links
// are copied and removed as links.
namespace tamber::filetree {

// The kind and identity of an item.
struct ItemType {
    mode_t mode = 0;
    uint64_t device = 0;
    uint64_t inode = 0;
};

// What the item `name` of `dirfd` is, without following a link; nothing (errno set) on failure.
std::optional<ItemType> itemTypeAt(int dirfd, const std::string& name);

// Removes the item `name` of `dirfd`: a folder with its contents, depth first. Stops at the
// first failure, leaving what was not yet removed in place.
Status removeItem(int dirfd, const std::string& name);

// The permission bits a copy gets for a source with `mode`.
mode_t copyMode(mode_t mode);

// Copies the bytes of the file `from` of `fromDir` into the open file `out`, then flushes them
// to disk.
Status copyFileInto(int fromDir, const std::string& from, int out);

// The target of the symbolic link `name` of `dirfd`.
Result<std::string> readLink(int dirfd, const std::string& name);

// Copies what the folder `from` of `fromDir` holds into the existing empty folder `to` of
// `toDir`: folders, files and links; other kinds of file (pipes, sockets, devices) are left
// out. When the copy is made inside the folder being copied, the walk leaves the copy out.
Status copyFolderInto(int fromDir, const std::string& from, int toDir, const std::string& to);

}  // namespace tamber::filetree
