#pragma once

#include <string>
#include <vector>

#include "platform/apps/AppRegistry.h"

namespace tamber {

// The installed applications as freedesktop desktop entries: type kUserApplications lists
// "$XDG_DATA_HOME/applications", type kSystemApplications the "applications" folder of each
// $XDG_DATA_DIRS entry, in order. A desktop file ID found earlier (user before system, earlier
// data directory first) shadows the same ID further on, also when the earlier entry is hidden
// or unloadable. The environment is read at every call. Stateless, so safe from any thread.
class DesktopEntryRegistry : public AppRegistry {
public:
    // The applications folders of `type`, in search order; empty for an unknown type.
    static std::vector<std::string> applicationDirectories(int type);

    // Calls `block` for each entry in ID order within each folder: with an AppRecord for an
    // application, a BundleRecord for an entry of another type, and null for one that cannot
    // be read or parsed. Hidden entries and those of programs that are not installed are left
    // out.
    void enumerateApplicationsOfType(int type, const EnumerationBlock& block) override;
    // The first entry with this ID in search order; null when there is none, or when it is
    // hidden or cannot be read.
    BundleRecordRef recordForBundleIdentifier(const std::string& bundleIdentifier) override;
};

}  // namespace tamber
