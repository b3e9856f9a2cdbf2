#include "platform/ResourceValues.h"

#include <sys/sysmacros.h>

#include <algorithm>
#include <cerrno>
#include <iterator>
#include <optional>

#include "platform/FileSystem.h"
#include "platform/TypeIdentifiers.h"
#include "platform/UrlPath.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"

namespace tamber::ResourceValues {

namespace {

namespace K = ResourceKeys;

constexpr ResourceKey kAllKeys[] = {
    K::kName,
    K::kLocalizedName,
    K::kParentDirectoryURL,
    K::kTypeIdentifier,
    K::kFileSize,
    K::kCreationDate,
    K::kContentModificationDate,
    K::kIsReadable,
    K::kIsWritable,
    K::kIsDirectory,
    K::kIsPackage,
    K::kIsSymbolicLink,
    K::kLinkCount,
    K::kFileID,
    K::kVolumeIdentifier,
    K::kIsRegularFile,
    K::kDocumentID,
};

// The statx fields a key needs. Every fetch asks for the file type, which also tells whether
// the file exists.
unsigned int maskFor(ResourceKey key) {
    if (key == K::kFileSize)
        return STATX_SIZE;
    if (key == K::kCreationDate)
        return STATX_BTIME;
    if (key == K::kContentModificationDate)
        return STATX_MTIME;
    if (key == K::kLinkCount)
        return STATX_NLINK;
    if (key == K::kFileID)
        return STATX_INO;
    return 0;
}

Error errorFor(int error, const std::string& path) {
    if (error == ENOENT || error == ENOTDIR)
        return Error::fileNoSuchFile(path);
    return Error::posix(error);
}

ObjectRef dateFrom(const struct statx_timestamp& t) {
    return Date::make(static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) / 1e9);
}

// Where a file's calls go: its path, or its name in an open folder.
struct Location {
    int dirfd;
    std::string relative;
};

Location locate(const std::string& path, const OpenFolder* folder) {
    if (folder && folder->fd() >= 0)
        return {folder->fd(), std::string(UrlPath::lastComponent(path))};
    return {AT_FDCWD, path};
}

// Whether the file at `path` grants `mode` to this process; an error when the check fails
// for another reason than the answer being no.
Result<bool> access(const std::string& path, const Location& at, int mode, bool isSymbolicLink) {
    FileSystem& fs = FileSystem::current();
    if (fs.faccessat(at.dirfd, at.relative, mode, AT_EACCESS | AT_SYMLINK_NOFOLLOW) == 0)
        return true;
    int error = errno;
    if (error == EINVAL) {
        // No kernel support for checking a link itself. Linux never checks a link's own
        // permissions, so a link is accessible; anything else is not a link and can be
        // checked without the flag.
        if (isSymbolicLink)
            return true;
        if (fs.faccessat(at.dirfd, at.relative, mode, AT_EACCESS) == 0)
            return true;
        error = errno;
    }
    switch (error) {
        case EACCES:
        case EPERM:
        case EROFS:
        case ETXTBSY:
            return false;
        default:
            return errorFor(error, path);
    }
}

ObjectRef unsignedValue(uint64_t value) {
    return Number::fromUInt64(value);
}

}  // namespace

static_assert(std::size(kAllKeys) == kKeyCount);

int indexOf(ResourceKey key) {
    for (size_t i = 0; i < kKeyCount; ++i) {
        // The constants themselves come first: a key is nearly always one of them.
        if (kAllKeys[i].data() == key.data() || kAllKeys[i] == key)
            return static_cast<int>(i);
    }
    return -1;
}

ResourceKey keyAt(size_t index) {
    return kAllKeys[index];
}

bool isKnownKey(ResourceKey key) {
    return indexOf(key) >= 0;
}

bool isReadFromFile(ResourceKey key) {
    return key != K::kDocumentID && isKnownKey(key);
}

Error unknownKeyError(ResourceKey key) {
    return Error(kPosixErrorDomain, EINVAL,
                 {{"description", "Unknown resource key " + std::string(key) + "."},
                  {"key", std::string(key)}});
}

Result<std::vector<ObjectRef>> read(const std::string& path, const std::vector<ResourceKey>& keys,
                                    const OpenFolder* folder) {
    unsigned int mask = STATX_TYPE | STATX_MODE;
    for (ResourceKey key : keys) {
        if (!isReadFromFile(key))
            return unknownKeyError(key);
        mask |= maskFor(key);
    }

    const Location at = locate(path, folder);
    struct statx st {};
    if (FileSystem::current().statx(at.dirfd, at.relative, AT_SYMLINK_NOFOLLOW, mask, &st) != 0) {
        return errorFor(errno, path);
    }
    const bool isDirectory = S_ISDIR(st.stx_mode);
    const bool isSymbolicLink = S_ISLNK(st.stx_mode);
    const std::string_view name = UrlPath::lastComponent(path);
    auto has = [&](unsigned int field) { return (st.stx_mask & field) != 0; };

    // Asked for both, one check answers both in the usual case: readable and writable.
    std::optional<bool> readableAndWritable;
    if (std::find(keys.begin(), keys.end(), K::kIsReadable) != keys.end() &&
        std::find(keys.begin(), keys.end(), K::kIsWritable) != keys.end()) {
        Result<bool> both = access(path, at, R_OK | W_OK, isSymbolicLink);
        if (both.ok() && *both)
            readableAndWritable = true;
    }

    std::vector<ObjectRef> values;
    values.reserve(keys.size());
    ObjectRef nameValue;
    for (ResourceKey key : keys) {
        ObjectRef value;
        if (key == K::kName || key == K::kLocalizedName) {
            // Immutable: the name and the localized name may share one.
            if (!nameValue)
                nameValue = String::make(std::string(name));
            value = nameValue;
        } else if (key == K::kParentDirectoryURL) {
            if (path != "/") {
                value = std::make_shared<UrlObject>(
                    Url::fileURLWithPath(UrlPath::deletingLastComponent(path)));
            }
        } else if (key == K::kTypeIdentifier) {
            std::string type;
            if (isSymbolicLink) {
                type = TypeIdentifiers::kSymbolicLink;
            } else if (isDirectory || S_ISREG(st.stx_mode)) {
                type = TypeIdentifierForName(name, isDirectory);
            } else {
                type = TypeIdentifiers::kItem;  // sockets, pipes, devices
            }
            value = String::make(std::move(type));
        } else if (key == K::kFileSize) {
            if (!isDirectory && has(STATX_SIZE))
                value = unsignedValue(st.stx_size);
        } else if (key == K::kCreationDate) {
            if (has(STATX_BTIME))
                value = dateFrom(st.stx_btime);
        } else if (key == K::kContentModificationDate) {
            if (has(STATX_MTIME))
                value = dateFrom(st.stx_mtime);
        } else if ((key == K::kIsReadable || key == K::kIsWritable) && readableAndWritable) {
            value = Number::fromBool(true);
        } else if (key == K::kIsReadable || key == K::kIsWritable) {
            Result<bool> allowed =
                access(path, at, key == K::kIsReadable ? R_OK : W_OK, isSymbolicLink);
            if (!allowed.ok())
                return allowed.error();
            value = Number::fromBool(*allowed);
        } else if (key == K::kIsDirectory) {
            value = Number::fromBool(isDirectory);
        } else if (key == K::kIsSymbolicLink) {
            value = Number::fromBool(isSymbolicLink);
        } else if (key == K::kIsPackage) {
            value = Number::fromBool(isDirectory && IsPackageName(name));
        } else if (key == K::kLinkCount) {
            if (has(STATX_NLINK))
                value = unsignedValue(st.stx_nlink);
        } else if (key == K::kFileID) {
            if (has(STATX_INO))
                value = unsignedValue(st.stx_ino);
        } else if (key == K::kVolumeIdentifier) {
            value = unsignedValue(makedev(st.stx_dev_major, st.stx_dev_minor));
        } else if (key == K::kIsRegularFile) {
            value = Number::fromBool(S_ISREG(st.stx_mode));
        }
        values.push_back(std::move(value));
    }
    return values;
}

}  // namespace tamber::ResourceValues
