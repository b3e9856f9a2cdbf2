#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/apps/BundleRecord.h"

namespace tamber {

// The installed applications. The default instance reads the desktop entries of the XDG data
// directories; tests install their own.
class AppRegistry {
public:
    // Registry types: 0 lists the user's own applications, 2 the system's.
    static constexpr int kUserApplications = 0;
    static constexpr int kSystemApplications = 2;

    // Receives one record (null when the registry has an entry it cannot describe) and may set
    // `stop` to end the enumeration.
    using EnumerationBlock = std::function<void(const BundleRecordRef& record, bool& stop)>;

    virtual ~AppRegistry() = default;

    static std::shared_ptr<AppRegistry> defaultRegistry();
    // Installs `registry` as the default (null restores the desktop-entry registry); returns
    // the previous one.
    static std::shared_ptr<AppRegistry> setDefaultRegistry(std::shared_ptr<AppRegistry> registry);

    virtual void enumerateApplicationsOfType(int type, const EnumerationBlock& block) = 0;
    // The installed application with this bundle identifier, or null.
    virtual BundleRecordRef recordForBundleIdentifier(const std::string& bundleIdentifier) = 0;
};

}  // namespace tamber
