#include "platform/strata/DocumentAttributes.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Log.h"

namespace tamber {

namespace {

// Enough for any name list a person makes; a longer one is read after asking its size.
constexpr size_t kListBuffer = 512;
constexpr int kAttempts = 4;  // the list or a value may grow between two calls

std::optional<std::vector<std::string>> listNames(FileSystem& fs, const std::string& path) {
    std::string buffer(kListBuffer, '\0');
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        ssize_t n = fs.llistxattr(path, buffer.data(), buffer.size());
        if (n >= 0) {
            std::vector<std::string> names;
            for (size_t start = 0; start < static_cast<size_t>(n);) {
                size_t end = std::min(buffer.find('\0', start), static_cast<size_t>(n));
                if (end > start)
                    names.emplace_back(buffer, start, end - start);
                start = end + 1;
            }
            return names;
        }
        if (errno != ERANGE)
            return std::nullopt;
        ssize_t needed = fs.llistxattr(path, nullptr, 0);
        if (needed < 0)
            return std::nullopt;
        buffer.assign(static_cast<size_t>(needed) + kListBuffer, '\0');
    }
    return std::nullopt;
}

// One value; nothing with errno set when it cannot be read (ENODATA: removed meanwhile).
std::optional<Bytes> readValue(FileSystem& fs, const std::string& path, const std::string& name) {
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        ssize_t size = fs.lgetxattr(path, name, nullptr, 0);
        if (size < 0)
            return std::nullopt;
        Bytes value(static_cast<size_t>(size));
        ssize_t got = fs.lgetxattr(path, name, value.data(), value.size());
        if (got >= 0) {
            value.resize(static_cast<size_t>(got));
            return value;
        }
        if (errno != ERANGE)
            return std::nullopt;
    }
    errno = ERANGE;
    return std::nullopt;
}

}  // namespace

const std::vector<std::string>& DocumentAttributes::names() {
    static const std::vector<std::string> kNames{
        "com.velk.lastuseddate#PS",
        "com.velk.metadata:_kHostItemUserTags",
        "com.velk.favorite-rank.number#PS",
        "com.velk.trash.time#PS",
        "com.velk.trash.putback#PS",
        // The desktop's tag list and Tamber's note of the list it last wrote or took in: were
        // they left behind while Tamber's tags moved on, the stale list would read as a change.
        "xdg.tags",
        "com.velk.xdg-tags.synced#PS",
    };
    return kNames;
}

bool DocumentAttributes::isKept(std::string_view name) {
    const auto& kept = names();
    return std::find(kept.begin(), kept.end(), name) != kept.end();
}

std::optional<DocumentAttributes::Values> DocumentAttributes::read(const std::string& path) {
    FileSystem& fs = FileSystem::current();
    auto present = listNames(fs, path);
    if (!present)
        return std::nullopt;
    Values values;
    for (const std::string& name : *present) {
        if (!isKept(name))
            continue;
        auto value = readValue(fs, path, name);
        if (value) {
            values.emplace(name, std::move(*value));
        } else if (errno != ENODATA) {
            return std::nullopt;
        }
    }
    return values;
}

std::optional<DocumentAttributes::Values> DocumentAttributes::restore(const std::string& path,
                                                                      uint64_t inode,
                                                                      const Values& saved) {
    FileSystem& fs = FileSystem::current();
    // Non-blocking: should the path have become a FIFO meanwhile, opening it must not hang.
    ScopedFd fd(fs.open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!fd.ok())
        return std::nullopt;
    std::optional<Values> result;
    struct statx st {};
    if (fs.statx(fd.get(), "", AT_EMPTY_PATH, STATX_INO | STATX_TYPE, &st) == 0 &&
        st.stx_ino == inode && S_ISREG(st.stx_mode)) {
        result = read(path);
    }
    if (result) {
        for (const auto& [name, value] : saved) {
            if (result->contains(name) || !isKept(name))
                continue;
            if (fs.fsetxattr(fd.get(), name, value.data(), value.size(), XATTR_CREATE) == 0) {
                result->emplace(name, value);
            } else if (errno == EEXIST) {
                // Set meanwhile by someone else: theirs is newer.
                if (auto now = readValue(fs, path, name))
                    result->emplace(name, std::move(*now));
            } else {
                logError("can't restore xattr " + name + " on " + path + "; " +
                         std::strerror(errno));
                result->emplace(name, value);  // kept, for the document's next inode
            }
        }
    }
    return result;
}

}  // namespace tamber
