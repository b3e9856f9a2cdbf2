#include "platform/apps/ApplicationsDirectory.h"

#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr std::string_view kDesktopSuffix = ".desktop";

void logUnreadable(const std::string& path, int error) {
    // A data directory without an applications folder is normal.
    if (error == ENOENT)
        return;
    logDebug(
        [&] { return "can't read applications directory " + path + "; " + std::strerror(error); });
}

// The type of what `path` names, following symbolic links; DT_UNKNOWN when that fails.
unsigned char resolvedType(const std::string& path) {
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, 0, STATX_TYPE, &st) != 0)
        return DT_UNKNOWN;
    if (S_ISDIR(st.stx_mode))
        return DT_DIR;
    if (S_ISREG(st.stx_mode))
        return DT_REG;
    return DT_UNKNOWN;
}

// The bundle identifier of a file called `name` in a folder whose IDs start with `prefix`, or
// nothing when it is not a desktop file. "." and ".." would turn into path components
// wherever the identifier is used to build a path.
std::optional<std::string> bundleIdentifierOf(const std::string& prefix, const std::string& name) {
    if (name.size() <= kDesktopSuffix.size() || !name.ends_with(kDesktopSuffix))
        return std::nullopt;
    std::string identifier = prefix + name.substr(0, name.size() - kDesktopSuffix.size());
    if (identifier == "." || identifier == "..")
        return std::nullopt;
    return identifier;
}

void walk(const std::string& dir, const std::string& prefix, size_t depth,
          std::vector<ApplicationsDirectory::DesktopFile>& out) {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(dir, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd.ok()) {
        logUnreadable(dir, errno);
        return;
    }
    std::vector<FileSystem::DirectoryEntry> entries;
    bool ok = fs.readDirectory(fd.get(), entries);
    int error = errno;
    fd.reset();  // not held open while the sub-folders are walked
    if (!ok) {
        logUnreadable(dir, error);
        return;
    }

    for (const auto& entry : entries) {
        std::string path = dir + "/" + entry.name;
        unsigned char type = entry.type;
        if (type == DT_UNKNOWN || type == DT_LNK)
            type = resolvedType(path);
        if (type == DT_DIR) {
            if (depth < ApplicationsDirectory::kMaxDepth)
                walk(path, prefix + entry.name + "-", depth + 1, out);
            else
                logDebug([&] { return "not walking applications directory " + path; });
        } else if (type == DT_REG) {
            if (auto identifier = bundleIdentifierOf(prefix, entry.name))
                out.push_back({std::move(*identifier), std::move(path)});
        }
    }
}

}  // namespace

std::vector<ApplicationsDirectory::DesktopFile> ApplicationsDirectory::list(
    const std::string& path) {
    std::vector<DesktopFile> files;
    walk(path, "", 0, files);
    std::sort(files.begin(), files.end(), [](const DesktopFile& a, const DesktopFile& b) {
        return a.bundleIdentifier != b.bundleIdentifier ? a.bundleIdentifier < b.bundleIdentifier
                                                        : a.path < b.path;
    });
    auto sameIdentifier = [](const DesktopFile& a, const DesktopFile& b) {
        return a.bundleIdentifier == b.bundleIdentifier;
    };
    files.erase(std::unique(files.begin(), files.end(), sameIdentifier), files.end());
    return files;
}

}  // namespace tamber
