#include "host/UrlOperations.h"

#include <linux/fs.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <vector>

#include "host/FileTree.h"
#include "host/ItemNames.h"
#include "host/PublishedTrees.h"
#include "host/StagingCopies.h"
#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/TypeIdentifiers.h"
#include "platform/objects/Number.h"

namespace tamber {

namespace {

struct Identity {
    bool exists = false;
    bool isDirectory = false;
    uint64_t device = 0;
    uint64_t inode = 0;
};

Identity identityOf(const std::string& path) {
    struct statx st {};
    Identity id;
    if (FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_INO,
                                    &st) != 0) {
        return id;
    }
    id.exists = true;
    id.isDirectory = S_ISDIR(st.stx_mode);
    id.device = (uint64_t(st.stx_dev_major) << 32) | st.stx_dev_minor;
    id.inode = st.stx_ino;
    return id;
}

bool isStrictAncestorPath(const std::string& ancestor, const std::string& path) {
    if (path.size() <= ancestor.size() || path.compare(0, ancestor.size(), ancestor) != 0)
        return false;
    return ancestor == "/" || path[ancestor.size()] == '/';
}

}  // namespace

UrlRelationship pt_relationshipToItemAtURL(const Url& url, const Url& other) {
    if (!url.isFileURL() || !other.isFileURL())
        return UrlRelationship::Other;
    const std::string& a = url.path();
    const std::string& b = other.path();
    if (a == b)
        return UrlRelationship::Same;
    Identity ia = identityOf(a);
    if (isStrictAncestorPath(a, b)) {
        return ia.isDirectory ? UrlRelationship::Contains : UrlRelationship::Other;
    }
    if (!ia.exists)
        return UrlRelationship::Other;
    Identity ib = identityOf(b);
    if (ib.exists && ia.device == ib.device && ia.inode == ib.inode)
        return UrlRelationship::Same;
    return UrlRelationship::Other;
}

bool pt_isFolder(const Url& url) {
    auto isDirectory = url.resourceValue(ResourceKeys::kIsDirectory);
    if (!isDirectory.ok())
        return false;
    auto dir = objectCast<Number>(isDirectory.value());
    if (!dir || !dir->boolValue())
        return false;
    auto isPackage = url.resourceValue(ResourceKeys::kIsPackage);
    if (!isPackage.ok())
        return false;
    auto package = objectCast<Number>(isPackage.value());
    return !(package && package->boolValue());
}

Result<uint64_t> pt_directorySizeWithError(const Url& url) {
    FileSystem& fs = FileSystem::current();
    auto opened = PublishedTrees::openFolder(url, O_RDONLY);
    if (!opened.ok())
        return opened.error();

    uint64_t total = 0;
    // Descriptors still to read; depth-first, bounded by depth. Those left after a failure
    // close with the vector.
    std::vector<ScopedFd> pending;
    pending.emplace_back(opened.value());
    std::vector<FileSystem::DirectoryEntry> entries;
    std::optional<Error> failure;
    while (!pending.empty()) {
        ScopedFd held = std::move(pending.back());
        pending.pop_back();
        int dir = held.get();
        entries.clear();
        if (!failure && !fs.readDirectory(dir, entries))
            failure = Error::errorWithPOSIXCode(errno);
        for (const auto& entry : failure ? std::vector<FileSystem::DirectoryEntry>{} : entries) {
            struct statx st {};
            if (fs.statx(dir, entry.name, AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_SIZE, &st) != 0) {
                if (errno == ENOENT)
                    continue;  // removed while we walked
                failure = Error::errorWithPOSIXCode(errno);
                break;
            }
            if (S_ISREG(st.stx_mode)) {
                total += st.stx_size;
            } else if (S_ISDIR(st.stx_mode)) {
                int child = fs.openat(dir, entry.name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
                if (child >= 0) {
                    pending.emplace_back(child);
                } else if (errno != ENOENT) {
                    failure = Error::errorWithPOSIXCode(errno);
                    break;
                }
            }
        }
    }
    if (failure)
        return *failure;
    return total;
}

bool pt_withReadWriteAccess(const Url& url, const std::function<bool(int fd)>& body) {
    FileSystem& fs = FileSystem::current();
    auto root = PublishedTrees::rootOf(url);
    if (!root) {
        errno = EACCES;
        return false;
    }
    ScopedFd fd;
    if (root->path() == url.path()) {
        fd.reset(fs.open(url.path(), O_RDONLY));
    } else {
        auto parent = PublishedTrees::openParent(url, O_PATH);
        if (!parent.ok()) {
            const Error& error = parent.error();
            errno = error.domain() == kPosixErrorDomain ? static_cast<int>(error.code()) : EACCES;
            return false;
        }
        ScopedFd folder(parent.value().fd);
        fd.reset(fs.openat(folder.get(), parent.value().name, O_RDONLY | O_NOFOLLOW));
    }
    if (!fd.ok())
        return false;
    // The body's errno outlives the close.
    return body(fd.get());
}

// ---------------------------------------------------------------------------------------------
// File operations

namespace {

using filetree::copyFileInto;
using filetree::copyFolderInto;
using filetree::copyMode;
using filetree::ItemType;
using filetree::itemTypeAt;
using filetree::readLink;
using filetree::removeItem;

// Enough to be sure a folder is not endlessly full, far more than a person creates by hand.
constexpr int kMaxBounces = 10000;

Error lastError() {
    return Error::errorWithPOSIXCode(errno);
}

Error importError(const std::string& what) {
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                 {{"parameter", "source"}, {"description", what}});
}

// A folder inside the published trees, opened beneath its root; every folder the operations
// below write into, or take an item out of, is opened here or through openParent.
Result<int> openFolder(const Url& folder) {
    return PublishedTrees::openFolder(folder, O_PATH);
}

// The names a taken name bounces to: "a.txt", "a 2.txt", "a 3.txt", ... A number already in
// the name is left alone: "Chapter 10.txt" bounces to "Chapter 10 2.txt", not to a name that
// looks like another chapter.
class NameBouncer {
public:
    NameBouncer(const std::string& name, bool keepsExtension) : name_(name), base_(name) {
        size_t dot = name.rfind('.');
        if (keepsExtension && dot != std::string::npos && dot > 0 && dot + 1 < name.size()) {
            base_ = name.substr(0, dot);
            extension_ = name.substr(dot);
        }
    }
    // The name for attempt `i` (0 is the name itself).
    std::string candidate(int i) const {
        if (i == 0)
            return name_;
        return base_ + " " + std::to_string(i + 1) + extension_;
    }

private:
    std::string name_;
    std::string base_;
    std::string extension_;
};

// A plain folder bounces as "name 2"; a file or a package keeps its extension last.
bool keepsExtension(const std::string& name, mode_t mode) {
    return !S_ISDIR(mode) || IsPackageName(name);
}

// Tries `attempt` with the name and then, while the name is taken and `bounce` allows, with the
// bounced names. Returns the name that worked.
Result<std::string> placeUnderFreeName(const std::string& name, bool keepExtension, bool bounce,
                                       const std::function<int(const std::string&)>& attempt) {
    NameBouncer bouncer(name, keepExtension);
    for (int i = 0; i < (bounce ? kMaxBounces : 1); ++i) {
        std::string candidate = bouncer.candidate(i);
        if (attempt(candidate) == 0)
            return candidate;
        if (errno != EEXIST)
            return lastError();
    }
    return Error::posix(EEXIST);
}

// renameat2 without replacing. A file system that does not know the flag (EINVAL) gets a check
// for the name and then a plain rename: not atomic, but still never replaces an item that
// exists when we look.
int renameNoReplace(int fromDir, const std::string& from, int toDir, const std::string& to) {
    FileSystem& fs = FileSystem::current();
    if (fs.renameat2(fromDir, from, toDir, to, RENAME_NOREPLACE) == 0)
        return 0;
    if (errno != EINVAL)
        return -1;
    struct statx st {};
    if (fs.statx(toDir, to, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) == 0) {
        errno = EEXIST;
        return -1;
    }
    if (errno != ENOENT) {
        errno = EINVAL;
        return -1;
    }
    return fs.renameat2(fromDir, from, toDir, to, 0);
}

// Both ends are opened (and so checked) before anything moves.
Result<Url> moveItem(const Url& url, const Url& folder, const std::optional<std::string>& newName,
                     bool bounce) {
    if (newName) {
        if (auto bad = checkItemName(*newName); !bad.ok())
            return bad.error();
    }
    auto from = PublishedTrees::openParent(url, O_PATH);
    if (!from.ok())
        return from.error();
    ScopedFd fromDir(from.value().fd);
    const std::string& fromName = from.value().name;
    std::string name = newName.value_or(fromName);
    auto to = openFolder(folder);
    if (!to.ok())
        return to.error();
    ScopedFd toDir(to.value());
    auto type = itemTypeAt(fromDir.get(), fromName);
    if (!type)
        return lastError();
    if (folder.appendingPathComponent(name) == url)
        return url;  // already there
    auto placed = placeUnderFreeName(
        name, keepsExtension(name, type->mode), bounce, [&](const std::string& candidate) {
            return renameNoReplace(fromDir.get(), fromName, toDir.get(), candidate);
        });
    if (!placed.ok())
        return placed.error();
    return folder.appendingPathComponent(*placed);
}

// Reserves a hidden staging name in `folder` for a copy in progress: `make` creates the item
// under the name it is given (failing with EEXIST when the name is taken). The name is recorded
// in the staging ledger before the item exists, so that no kill leaves an unrecorded copy.
Result<std::string> reserveTemporaryName(const Url& folder,
                                         const std::function<int(const std::string&)>& make) {
    for (int attempt = 0; attempt < 100; ++attempt) {
        std::string name = StagingCopies::makeName();
        std::string path = folder.appendingPathComponent(name).path();
        StagingCopies::record(path);
        if (make(name) == 0)
            return name;
        int error = errno;
        StagingCopies::forget(path);
        if (error != EEXIST)
            return Error::posix(error);
    }
    return Error::posix(EEXIST);
}

// Makes the copy of the item under a staging name in `toDir` (the open `folder`), recorded in
// the staging ledger until the caller forgets it; returns that name.
Result<std::string> copyToTemporary(int fromDir, const std::string& from, const ItemType& type,
                                    int toDir, const Url& folder) {
    FileSystem& fs = FileSystem::current();
    Result<std::string> temporary = Error::posix(ENOTSUP);
    Status filled;
    if (S_ISREG(type.mode)) {
        int out = -1;
        temporary = reserveTemporaryName(folder, [&](const std::string& name) {
            out = fs.openat(toDir, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW,
                            copyMode(type.mode));
            return out < 0 ? -1 : 0;
        });
        ScopedFd closer(out);
        if (temporary.ok())
            filled = copyFileInto(fromDir, from, out);
    } else if (S_ISDIR(type.mode)) {
        temporary = reserveTemporaryName(folder, [&](const std::string& name) {
            return fs.mkdirat(toDir, name, copyMode(type.mode) | S_IRWXU);
        });
        if (temporary.ok())
            filled = copyFolderInto(fromDir, from, toDir, *temporary);
    } else if (S_ISLNK(type.mode)) {
        auto target = readLink(fromDir, from);
        if (!target.ok())
            return target.error();
        temporary = reserveTemporaryName(
            folder, [&](const std::string& name) { return fs.symlinkat(*target, toDir, name); });
    }
    if (temporary.ok() && !filled.ok()) {
        removeItem(toDir, *temporary);
        StagingCopies::forget(folder.appendingPathComponent(*temporary).path());
        return filled.error();
    }
    return temporary;
}

struct DirIdentity {
    uint64_t device = 0;
    uint64_t inode = 0;
    bool operator==(const DirIdentity&) const = default;
};

std::optional<DirIdentity> identityAt(int dirfd, const std::string& name) {
    struct statx st {};
    int flags = name.empty() ? AT_EMPTY_PATH : AT_SYMLINK_NOFOLLOW;
    if (FileSystem::current().statx(dirfd, name, flags, STATX_INO, &st) != 0)
        return std::nullopt;
    return DirIdentity{(uint64_t(st.stx_dev_major) << 32) | st.stx_dev_minor, st.stx_ino};
}

// Whether the folder `source` is the open folder `dir` or one of its ancestors, by identity
// along the real chain of ".." (so another path to the same folder is caught too).
bool isFolderOrAncestor(const ItemType& source, int dir) {
    FileSystem& fs = FileSystem::current();
    DirIdentity wanted{source.device, source.inode};
    ScopedFd current(fs.openat(dir, ".", O_PATH | O_DIRECTORY));
    bool found = false;
    for (int depth = 0; current.ok() && depth < 4096; ++depth) {
        auto here = identityAt(current.get(), "");
        if (!here)
            break;
        if (*here == wanted) {
            found = true;
            break;
        }
        current.reset(fs.openat(current.get(), "..", O_PATH | O_DIRECTORY));
        auto above = current.ok() ? identityAt(current.get(), "") : std::nullopt;
        if (!above || *above == *here)
            break;  // the top
    }
    return found;
}

Result<Url> importItem(const Url& source, const Url& folder) {
    if (!source.isFileURL() || source.path().empty())
        return importError("the source path must not be empty");
    if (source.path() == "/")
        return importError("can't import a folder into itself");
    // The source may be any file the user names; the destination must be inside.
    auto to = openFolder(folder);
    if (!to.ok())
        return to.error();
    ScopedFd toDir(to.value());
    ScopedFd fromDir(FileSystem::current().open(source.deletingLastPathComponent().path(),
                                                O_PATH | O_DIRECTORY));
    if (!fromDir.ok())
        return lastError();
    std::string fromName = source.lastPathComponent();
    auto type = itemTypeAt(fromDir.get(), fromName);
    if (!type)
        return lastError();
    if (!S_ISREG(type->mode) && !S_ISDIR(type->mode) && !S_ISLNK(type->mode))
        return importError("can only import a file, a folder or a symbolic link");
    if (S_ISDIR(type->mode) && isFolderOrAncestor(*type, toDir.get()))
        return importError("can't import a folder into itself");

    auto temporary = copyToTemporary(fromDir.get(), fromName, *type, toDir.get(), folder);
    if (!temporary.ok())
        return temporary.error();
    std::string staged = folder.appendingPathComponent(*temporary).path();
    auto placed = placeUnderFreeName(
        fromName, keepsExtension(fromName, type->mode), true, [&](const std::string& candidate) {
            return renameNoReplace(toDir.get(), *temporary, toDir.get(), candidate);
        });
    if (!placed.ok())
        removeItem(toDir.get(), *temporary);
    StagingCopies::forget(staged);
    if (!placed.ok())
        return placed.error();
    return folder.appendingPathComponent(*placed);
}

Result<Url> createFolder(const Url& folder, const std::string& name, bool bounce) {
    if (auto bad = checkItemName(name); !bad.ok())
        return bad.error();
    auto dir = openFolder(folder);
    if (!dir.ok())
        return dir.error();
    ScopedFd dirFd(dir.value());
    auto placed = placeUnderFreeName(name, false, bounce, [&](const std::string& candidate) {
        return FileSystem::current().mkdirat(dirFd.get(), candidate, 0777);
    });
    if (!placed.ok())
        return placed.error();
    return folder.appendingPathComponent(*placed);
}

Status deleteItem(const Url& url) {
    auto at = PublishedTrees::openParent(url, O_PATH);
    if (!at.ok())
        return at.error();
    ScopedFd dir(at.value().fd);
    return removeItem(dir.get(), at.value().name);
}

void finish(Result<Url> result, const UrlCompletion& completion) {
    if (!completion)
        return;
    completion(std::move(result));
}

}  // namespace

void pt_importUnderFolder(const Url& source, const Url& folder, const UrlCompletion& completion) {
    finish(importItem(source, folder), completion);
}

void pt_createSubFolder(const Url& folder, const std::string& name, bool bounce,
                        const UrlCompletion& completion) {
    finish(createFolder(folder, name, bounce), completion);
}

void pt_renameWithNewName(const Url& url, const std::string& name,
                          const UrlCompletion& completion) {
    finish(moveItem(url, url.deletingLastPathComponent(), name, false), completion);
}

void pt_reparentUnderFolder(const Url& url, const Url& folder,
                            const std::optional<std::string>& newName,
                            const UrlCompletion& completion) {
    finish(moveItem(url, folder, newName, false), completion);
}

void pt_reparentUnderFolder(const Url& url, const Url& folder, const char* newName,
                            const UrlCompletion& completion) {
    pt_reparentUnderFolder(
        url, folder, newName ? std::optional<std::string>(newName) : std::nullopt, completion);
}

void pt_reparentUnderFolder(const Url& url, const Url& folder, bool allowBouncing,
                            const UrlCompletion& completion) {
    finish(moveItem(url, folder, std::nullopt, allowBouncing), completion);
}

void pt_placeUnderFolder(const Url& url, const Url& folder, const std::string& name,
                         const UrlCompletion& completion) {
    finish(moveItem(url, folder, name, true), completion);
}

void pt_trashUnderFolder(const Url& url, const Url& trashFolder, const UrlCompletion& completion) {
    finish(moveItem(url, trashFolder, std::nullopt, true), completion);
}

Status pt_ensureTrashFolder(const Url& trashFolder) {
    auto parent = PublishedTrees::openParent(trashFolder, O_PATH);
    if (!parent.ok())
        return parent.error();
    ScopedFd dir(parent.value().fd);
    const std::string& name = parent.value().name;
    if (FileSystem::current().mkdirat(dir.get(), name, 0777) == 0)
        return Status::OK();
    if (errno != EEXIST)
        return lastError();
    auto type = itemTypeAt(dir.get(), name);
    if (!type)
        return lastError();
    // A link named like the trash would carry trashed items out of the tree.
    if (S_ISLNK(type->mode))
        return PublishedTrees::outsideError(trashFolder);
    if (!S_ISDIR(type->mode))
        return Error::posix(ENOTDIR);
    return Status::OK();
}

void pt_deleteWithCompletionHandler(const Url& url, const ErrorCompletion& completion) {
    Status status = deleteItem(url);
    if (completion)
        completion(std::move(status));
}

}  // namespace tamber
