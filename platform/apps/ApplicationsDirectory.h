#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace tamber {

// The desktop files of one XDG applications directory ("<data dir>/applications"), walked
// recursively through FileSystem::current(). A file at "a/b.desktop" has the desktop file ID
// "a-b.desktop", and the bundle identifier "a-b".
class ApplicationsDirectory {
public:
    struct DesktopFile {
        std::string bundleIdentifier;  // the desktop file ID without ".desktop"
        std::string path;
    };

    // Sub-folders deeper than this are not walked (a symbolic link may point back up).
    static constexpr size_t kMaxDepth = 8;

    // Regular files (or links to them) named "*.desktop", sorted by bundle identifier, one file
    // per identifier: when two paths give the same ID the one that sorts first by path wins. A
    // folder that cannot be read adds nothing; unless it is missing, that is logged at debug
    // level.
    static std::vector<DesktopFile> list(const std::string& path);
};

}  // namespace tamber
