#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/apps/BundleRecord.h"

namespace tamber {

// Turns one freedesktop desktop entry into a record, parsing it with GLib's key-file reader
// and GIO's GDesktopAppInfo. An Application entry becomes an AppRecord; an entry of any other
// type a plain BundleRecord.
class DesktopEntryReader {
public:
    static constexpr const char* kDataContainerKey = "X-Tamber-Data-Container";
    static constexpr const char* kFlatpakKey = "X-Flatpak";
    static constexpr const char* kSupportsOpenInPlaceKey = "X-Tamber-Supports-Open-In-Place";
    static constexpr const char* kFileSharingEnabledKey = "X-Tamber-File-Sharing-Enabled";
    static constexpr const char* kSupportsDocumentBrowserKey = "X-Tamber-Supports-Document-Browser";
    // The info-dictionary key that kSupportsDocumentBrowserKey fills.
    static constexpr const char* kHostSupportsDocumentBrowser = "HostSupportsDocumentBrowser";

    // Bigger files are not desktop entries; they are refused without being read to the end.
    static constexpr size_t kMaxEntrySize = 1u << 20;

    enum class Outcome {
        Record,
        // Present but not describable (unreadable, not a key file, refused by GIO).
        Unloadable,
        // To be treated as if it were not there: Hidden=true, a TryExec program that is not
        // installed, or a file that went away.
        Skipped,
    };
    struct Entry {
        Outcome outcome;
        BundleRecordRef record;  // only for Outcome::Record
    };

    // Reads the file through FileSystem::current(). $HOME is read now, for "~" and flatpak
    // data containers.
    static Entry readFile(const std::string& path, const std::string& bundleIdentifier);
    // `origin` names the entry in log lines.
    static Entry parse(std::string_view contents, const std::string& bundleIdentifier,
                       const std::string& origin);
};

}  // namespace tamber
