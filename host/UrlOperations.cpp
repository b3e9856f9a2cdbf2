#include "host/UrlOperations.h"

#include <cerrno>
#include <vector>

#include "platform/FileSystem.h"
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

}  // namespace tamber
