#include "platform/apps/DesktopEntryRegistry.h"

#include <algorithm>
#include <cstdlib>
#include <set>

#include "platform/apps/ApplicationsDirectory.h"
#include "platform/apps/DesktopEntryReader.h"

namespace tamber {

namespace {

constexpr const char* kDefaultDataDirs = "/usr/local/share:/usr/share";

// Read with getenv rather than GLib's helpers, which cache the environment for the life of the
// process. Relative paths are invalid in these variables and are ignored.
std::string userDataDirectory() {
    const char* dataHome = std::getenv("XDG_DATA_HOME");
    if (dataHome && dataHome[0] == '/')
        return dataHome;
    const char* home = std::getenv("HOME");
    if (home && home[0] == '/')
        return std::string(home) + "/.local/share";
    return {};
}

std::vector<std::string> systemDataDirectories() {
    const char* dataDirs = std::getenv("XDG_DATA_DIRS");
    std::string_view list = dataDirs && *dataDirs ? dataDirs : kDefaultDataDirs;
    std::vector<std::string> dirs;
    while (!list.empty()) {
        size_t colon = list.find(':');
        std::string_view dir = list.substr(0, colon);
        if (dir.starts_with('/'))
            dirs.emplace_back(dir);
        list = colon == std::string_view::npos ? std::string_view() : list.substr(colon + 1);
    }
    return dirs;
}

std::string applicationsFolder(std::string dataDir) {
    while (dataDir.size() > 1 && dataDir.back() == '/') dataDir.pop_back();
    return dataDir == "/" ? "/applications" : dataDir + "/applications";
}

}  // namespace

std::vector<std::string> DesktopEntryRegistry::applicationDirectories(int type) {
    std::vector<std::string> folders;
    if (type == kUserApplications) {
        if (auto dir = userDataDirectory(); !dir.empty())
            folders.push_back(applicationsFolder(std::move(dir)));
    } else if (type == kSystemApplications) {
        for (auto& dir : systemDataDirectories()) folders.push_back(applicationsFolder(dir));
    }
    return folders;
}

void DesktopEntryRegistry::enumerateApplicationsOfType(int type, const EnumerationBlock& block) {
    // The user's own entries shadow the system's even though they are listed separately.
    std::set<std::string> seen;
    if (type == kSystemApplications) {
        for (const auto& folder : applicationDirectories(kUserApplications))
            for (auto& file : ApplicationsDirectory::list(folder))
                seen.insert(std::move(file.bundleIdentifier));
    }
    bool stop = false;
    for (const auto& folder : applicationDirectories(type)) {
        for (const auto& file : ApplicationsDirectory::list(folder)) {
            if (!seen.insert(file.bundleIdentifier).second)
                continue;
            auto entry = DesktopEntryReader::readFile(file.path, file.bundleIdentifier);
            if (entry.outcome == DesktopEntryReader::Outcome::Skipped)
                continue;
            block(entry.record, stop);
            if (stop)
                return;
        }
    }
}

BundleRecordRef DesktopEntryRegistry::recordForBundleIdentifier(
    const std::string& bundleIdentifier) {
    if (bundleIdentifier.empty())
        return nullptr;
    std::vector<std::string> folders = applicationDirectories(kUserApplications);
    for (auto& folder : applicationDirectories(kSystemApplications))
        folders.push_back(std::move(folder));
    for (const auto& folder : folders) {
        auto files = ApplicationsDirectory::list(folder);
        auto it = std::lower_bound(
            files.begin(), files.end(), bundleIdentifier,
            [](const ApplicationsDirectory::DesktopFile& file, const std::string& identifier) {
                return file.bundleIdentifier < identifier;
            });
        if (it == files.end() || it->bundleIdentifier != bundleIdentifier)
            continue;
        // The first entry with the ID decides, even when it yields nothing.
        return DesktopEntryReader::readFile(it->path, bundleIdentifier).record;
    }
    return nullptr;
}

}  // namespace tamber
