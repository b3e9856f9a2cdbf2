#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace tamber {

// Looks icons up in the freedesktop "hicolor" theme, the theme every icon theme falls back to
// and the one applications install their icons into. Only fixed-size PNG folders
// ("<size>x<size>/apps") are used: scalable icons would need an SVG renderer.
class IconTheme {
public:
    // The hicolor folders searched, in order: $XDG_DATA_HOME/icons/hicolor (by default
    // ~/.local/share/icons/hicolor), then "icons/hicolor" in each of $XDG_DATA_DIRS (by default
    // /usr/local/share and /usr/share). Read from the environment at every call.
    static std::vector<std::string> hicolorFolders();

    // The path of the PNG for the icon named `iconName` whose size is nearest to `pixelSize`; on
    // a tie the larger one (scaling down looks better than scaling up), then the folder searched
    // first. A trailing ".png" in the name is ignored. Nothing for a name with a "/" or none
    // found.
    static std::optional<std::string> pathForIcon(const std::string& iconName, uint32_t pixelSize);
};

}  // namespace tamber
