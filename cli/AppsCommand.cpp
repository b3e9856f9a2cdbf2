#include "cli/AppsCommand.h"

#include <algorithm>
#include <ostream>

#include "applibraries/LocalAppLibraryManager.h"
#include "items/LocalAppLibraryItem.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* AppsCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("apps", "List the app libraries (installed apps' Documents)");
    sub->add_flag("--refresh", refresh_,
                  "Report whether reading the installed applications changed the list");
    addJsonFlag(sub,
                "Print {\"versionToken\": N, \"libraries\": [{\"identifier\", \"name\", "
                "\"bundleIdentifier\", \"root\"}]}");
    return sub;
}

int AppsCommand::runWith(CliContext& context, HostPorterExtension&) {
    // Preparing the provider already refreshes from the registry, as every verb does.
    auto manager = LocalAppLibraryManager::shared();
    auto items = manager->allItems();
    std::sort(items.begin(), items.end(), [](const auto& a, const auto& b) {
        return a->itemIdentifier() < b->itemIdentifier();
    });
    if (refresh_ && !json_) {
        context.err() << (context.appRefreshOutcome().rootChanged ? "app list changed"
                                                                  : "app list unchanged")
                      << "\n";
    }
    nlohmann::json libraries = nlohmann::json::array();
    for (const auto& item : items) {
        // The record's own bundle identifier: null when it has none, not "(null)".
        const auto& bundle = item->pt_appContainerBundleIdentifier();
        libraries.push_back({{"identifier", item->itemIdentifier()},
                             {"name", item->filename()},
                             {"bundleIdentifier", bundle ? nlohmann::json(*bundle) : nullptr},
                             {"root", item->fileURL().path()}});
    }
    uint64_t token = manager->versionToken();
    if (json_) {
        context.out() << jsonText(nlohmann::json{{"versionToken", token}, {"libraries", libraries}})
                      << "\n";
        return 0;
    }
    context.out() << "version token " << token << "\n";
    for (const auto& library : libraries)
        context.out() << library["identifier"].get<std::string>() << "\t"
                      << library["name"].get<std::string>() << "\t"
                      << library["root"].get<std::string>() << "\n";
    return 0;
}

}  // namespace tamber
