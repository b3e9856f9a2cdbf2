#include "host/UrlOperations.h"

#include <linux/fs.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <random>
#include <vector>

#include "host/FileTree.h"
#include "host/ScopedFd.h"
#include "platform/FileSystem.h"
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
    int root = fs.open(url.path(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
    if (root < 0)
        return Error::errorWithPOSIXCode(errno);

    uint64_t total = 0;
    std::vector<int> pending{root};  // descriptors still to read; depth-first, bounded by depth
    std::vector<FileSystem::DirectoryEntry> entries;
    std::optional<Error> failure;
    while (!pending.empty()) {
        int dir = pending.back();
        pending.pop_back();
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
                    pending.push_back(child);
                } else if (errno != ENOENT) {
                    failure = Error::errorWithPOSIXCode(errno);
                    break;
                }
            }
        }
        fs.close(dir);
    }
    if (failure)
        return *failure;
    return total;
}

bool pt_withReadWriteAccess(const Url& url, const std::function<bool(int fd)>& body) {
    FileSystem& fs = FileSystem::current();
    int fd = fs.open(url.path(), O_RDONLY | O_NOFOLLOW);
    if (fd < 0)
        return false;
    bool ok = body(fd);
    int saved = errno;
    fs.close(fd);
    errno = saved;
    return ok;
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
constexpr std::string_view kImportPrefix = ".tamber-import-";

Error lastError() {
    return Error::errorWithPOSIXCode(errno);
}

bool isAcceptableName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

// The folder holding the item and the item's name in it.
struct Placement {
    Url parent;
    std::string name;
};

std::optional<Placement> placementOf(const Url& url) {
    if (!url.isFileURL() || url.path() == "/")
        return std::nullopt;
    return Placement{url.deletingLastPathComponent(), url.lastPathComponent()};
}

// Folders named by the caller are opened following links: they are where the caller works.
int openFolder(const Url& folder) {
    return FileSystem::current().open(folder.path(), O_PATH | O_DIRECTORY);
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

Result<Url> moveItem(const Url& url, const Url& folder, const std::optional<std::string>& newName,
                     bool bounce) {
    auto from = placementOf(url);
    if (!from)
        return Error::invalidParameter("url", url.absoluteString());
    std::string name = newName.value_or(from->name);
    if (!isAcceptableName(name))
        return Error::invalidParameter("name", name);
    if (!folder.isFileURL())
        return Error::invalidParameter("folder", folder.absoluteString());

    ScopedFd fromDir(openFolder(from->parent));
    if (!fromDir.ok())
        return lastError();
    auto type = itemTypeAt(fromDir.get(), from->name);
    if (!type)
        return lastError();
    if (folder.appendingPathComponent(name) == url)
        return url;  // already there
    ScopedFd toDir(openFolder(folder));
    if (!toDir.ok())
        return lastError();
    auto placed = placeUnderFreeName(
        name, keepsExtension(name, type->mode), bounce, [&](const std::string& candidate) {
            return renameNoReplace(fromDir.get(), from->name, toDir.get(), candidate);
        });
    if (!placed.ok())
        return placed.error();
    return folder.appendingPathComponent(*placed);
}

// Reserves a hidden name for a copy in progress: `make` creates the item under the name it is
// given (failing with EEXIST when the name is taken).
Result<std::string> reserveTemporaryName(const std::function<int(const std::string&)>& make) {
    static thread_local std::mt19937_64 random(std::random_device{}());
    for (int attempt = 0; attempt < 100; ++attempt) {
        char suffix[17];
        std::snprintf(suffix, sizeof suffix, "%016llx", static_cast<unsigned long long>(random()));
        std::string name = std::string(kImportPrefix) + suffix;
        if (make(name) == 0)
            return name;
        if (errno != EEXIST)
            return lastError();
    }
    return Error::posix(EEXIST);
}

// Makes the copy of the item under a temporary name in `toDir`; returns that name.
Result<std::string> copyToTemporary(int fromDir, const std::string& from, const ItemType& type,
                                    int toDir) {
    FileSystem& fs = FileSystem::current();
    Result<std::string> temporary = Error::posix(ENOTSUP);
    Status filled;
    if (S_ISREG(type.mode)) {
        int out = -1;
        temporary = reserveTemporaryName([&](const std::string& name) {
            out = fs.openat(toDir, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW,
                            copyMode(type.mode));
            return out < 0 ? -1 : 0;
        });
        ScopedFd closer(out);
        if (temporary.ok())
            filled = copyFileInto(fromDir, from, out);
    } else if (S_ISDIR(type.mode)) {
        temporary = reserveTemporaryName([&](const std::string& name) {
            return fs.mkdirat(toDir, name, copyMode(type.mode) | S_IRWXU);
        });
        if (temporary.ok())
            filled = copyFolderInto(fromDir, from, toDir, *temporary);
    } else if (S_ISLNK(type.mode)) {
        auto target = readLink(fromDir, from);
        if (!target.ok())
            return target.error();
        temporary = reserveTemporaryName(
            [&](const std::string& name) { return fs.symlinkat(*target, toDir, name); });
    }
    if (temporary.ok() && filled) {
        removeItem(toDir, *temporary);
        return *filled;
    }
    return temporary;
}

Result<Url> importItem(const Url& source, const Url& folder) {
    auto from = placementOf(source);
    if (!from)
        return Error::invalidParameter("url", source.absoluteString());
    if (!folder.isFileURL())
        return Error::invalidParameter("folder", folder.absoluteString());
    ScopedFd fromDir(openFolder(from->parent));
    if (!fromDir.ok())
        return lastError();
    auto type = itemTypeAt(fromDir.get(), from->name);
    if (!type)
        return lastError();
    ScopedFd toDir(openFolder(folder));
    if (!toDir.ok())
        return lastError();

    auto temporary = copyToTemporary(fromDir.get(), from->name, *type, toDir.get());
    if (!temporary.ok())
        return temporary.error();
    auto placed = placeUnderFreeName(from->name, keepsExtension(from->name, type->mode), true,
                                     [&](const std::string& candidate) {
                                         return renameNoReplace(toDir.get(), *temporary,
                                                                toDir.get(), candidate);
                                     });
    if (!placed.ok()) {
        removeItem(toDir.get(), *temporary);
        return placed.error();
    }
    return folder.appendingPathComponent(*placed);
}

Result<Url> createFolder(const Url& folder, const std::string& name) {
    if (!isAcceptableName(name))
        return Error::invalidParameter("name", name);
    if (!folder.isFileURL())
        return Error::invalidParameter("folder", folder.absoluteString());
    ScopedFd dir(openFolder(folder));
    if (!dir.ok())
        return lastError();
    auto placed = placeUnderFreeName(name, false, true, [&](const std::string& candidate) {
        return FileSystem::current().mkdirat(dir.get(), candidate, 0777);
    });
    if (!placed.ok())
        return placed.error();
    return folder.appendingPathComponent(*placed);
}

Status deleteItem(const Url& url) {
    auto at = placementOf(url);
    if (!at)
        return Error::invalidParameter("url", url.absoluteString());
    ScopedFd dir(openFolder(at->parent));
    if (!dir.ok())
        return lastError();
    return removeItem(dir.get(), at->name);
}

void finish(Result<Url> result, const UrlCompletion& completion) {
    if (!completion)
        return;
    if (result.ok())
        completion(std::move(result).value(), std::nullopt);
    else
        completion(std::nullopt, result.error());
}

}  // namespace

void pt_importUnderFolder(const Url& source, const Url& folder, const UrlCompletion& completion) {
    finish(importItem(source, folder), completion);
}

void pt_createSubFolder(const Url& folder, const std::string& name,
                        const UrlCompletion& completion) {
    finish(createFolder(folder, name), completion);
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

void pt_trashUnderFolder(const Url& url, const Url& trashFolder, const UrlCompletion& completion) {
    finish(moveItem(url, trashFolder, std::nullopt, true), completion);
}

void pt_deleteWithCompletionHandler(const Url& url, const ErrorCompletion& completion) {
    Status status = deleteItem(url);
    if (completion)
        completion(std::move(status));
}

}  // namespace tamber
