#include "platform/imaging/IconTheme.h"

#include <charconv>
#include <cstdlib>
#include <string_view>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"

namespace tamber {

namespace {

constexpr const char* kDefaultIconDataDirs = "/usr/local/share:/usr/share";
constexpr std::string_view kHicolor = "icons/hicolor";
constexpr uint32_t kLargestSize = 4096;

std::string under(std::string dataDir) {
    while (dataDir.size() > 1 && dataDir.back() == '/') dataDir.pop_back();
    if (dataDir != "/")
        dataDir.push_back('/');
    return dataDir.append(kHicolor);
}

// The size of a folder named "<n>x<n>", or nothing.
std::optional<uint32_t> folderSize(std::string_view name) {
    size_t x = name.find('x');
    if (x == std::string_view::npos || name.substr(0, x) != name.substr(x + 1))
        return std::nullopt;
    uint32_t size = 0;
    auto [end, ec] = std::from_chars(name.data(), name.data() + x, size);
    if (ec != std::errc() || end != name.data() + x || size == 0 || size > kLargestSize)
        return std::nullopt;
    return size;
}

uint32_t distance(uint32_t a, uint32_t b) {
    return a > b ? a - b : b - a;
}

}  // namespace

// Read with getenv rather than GLib's helpers, which cache the environment for the life of the
// process. Relative paths are invalid in these variables and are ignored.
std::vector<std::string> IconTheme::hicolorFolders() {
    std::vector<std::string> folders;
    const char* dataHome = std::getenv("XDG_DATA_HOME");
    const char* home = std::getenv("HOME");
    if (dataHome && dataHome[0] == '/')
        folders.push_back(under(dataHome));
    else if (home && home[0] == '/')
        folders.push_back(under(std::string(home) + "/.local/share"));
    const char* dataDirs = std::getenv("XDG_DATA_DIRS");
    std::string_view list = dataDirs && *dataDirs ? dataDirs : kDefaultIconDataDirs;
    while (!list.empty()) {
        size_t colon = list.find(':');
        std::string_view dir = list.substr(0, colon);
        if (dir.starts_with('/'))
            folders.push_back(under(std::string(dir)));
        list = colon == std::string_view::npos ? std::string_view() : list.substr(colon + 1);
    }
    return folders;
}

std::optional<std::string> IconTheme::pathForIcon(const std::string& iconName, uint32_t pixelSize) {
    std::string name = iconName;
    if (name.ends_with(".png"))
        name.resize(name.size() - 4);
    if (name.empty() || name.find('/') != std::string::npos || name == "." || name == "..")
        return std::nullopt;

    FileSystem& fs = FileSystem::current();
    std::optional<std::string> best;
    uint32_t bestSize = 0;
    std::vector<FileSystem::DirectoryEntry> entries;
    for (const std::string& folder : hicolorFolders()) {
        ScopedFd fd(fs.open(folder, O_RDONLY | O_DIRECTORY));
        if (!fd.ok())
            continue;  // a data folder without icons is the common case
        entries.clear();
        bool listed = fs.readDirectory(fd.get(), entries);
        for (const auto& entry : listed ? entries : std::vector<FileSystem::DirectoryEntry>{}) {
            auto size = folderSize(entry.name);
            if (!size)
                continue;
            // Strictly better only: an equal size found in an earlier folder wins.
            if (best && (distance(*size, pixelSize) > distance(bestSize, pixelSize) ||
                         (distance(*size, pixelSize) == distance(bestSize, pixelSize) &&
                          *size <= bestSize)))
                continue;
            std::string relative = entry.name + "/apps/" + name + ".png";
            struct statx st {};
            // Themes link icons to each other; a link to a file is as good as the file.
            if (fs.statx(fd.get(), relative, 0, STATX_TYPE, &st) != 0 || !S_ISREG(st.stx_mode))
                continue;
            best = folder + "/" + relative;
            bestSize = *size;
        }
    }
    return best;
}

}  // namespace tamber
