#include "cli/AppsCommand.h"

#include <cerrno>
#include <ostream>

#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "items/LocalAppLibraryItem.h"
#include "runtime/HostJson.h"
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

int AppsCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    bool rootChanged = false;
    auto listing = dynamic_cast<RemotePorter*>(&provider)
                       ? remoteListing(*dynamic_cast<RemotePorter*>(&provider), rootChanged)
                       : localListing(context, rootChanged);
    if (!listing.ok())
        return fail(context, listing.error());
    const nlohmann::json& answer = listing.value();
    if (refresh_ && !json_)
        context.err() << (rootChanged ? "app list changed" : "app list unchanged") << "\n";
    if (json_) {
        context.out() << jsonText(answer) << "\n";
        return 0;
    }
    context.out() << "version token " << answer["versionToken"].get<uint64_t>() << "\n";
    for (const auto& library : answer["libraries"])
        context.out() << library["identifier"].get<std::string>() << "\t"
                      << library["name"].get<std::string>() << "\t"
                      << library["root"].get<std::string>() << "\n";
    return 0;
}

Result<nlohmann::json> AppsCommand::localListing(CliContext& context, bool& rootChanged) const {
    // Preparing the provider already refreshes from the registry, as every verb does.
    rootChanged = context.appRefreshOutcome().rootChanged;
    return HostJson::appLibraries();
}

Result<nlohmann::json> AppsCommand::remoteListing(RemotePorter& provider, bool& rootChanged) const {
    auto answer = refresh_ ? provider.client().post("apps/refresh", nlohmann::json::object())
                           : provider.client().get("apps");
    if (!answer.ok())
        return answer.error();
    const nlohmann::json& body = answer.value();
    if (!body.is_object() || !body.contains("versionToken") ||
        !body["versionToken"].is_number_unsigned() || !body.contains("libraries") ||
        !body["libraries"].is_array())
        return Error(kPosixErrorDomain, EPROTO,
                     {{"description", "the Tamber server sent a malformed list of apps"}});
    for (const auto& library : body["libraries"]) {
        if (!library.is_object() || !library.value("identifier", nlohmann::json()).is_string() ||
            !library.value("name", nlohmann::json()).is_string() ||
            !library.value("root", nlohmann::json()).is_string())
            return Error(kPosixErrorDomain, EPROTO,
                         {{"description", "the Tamber server sent a malformed app library"}});
    }
    // Whether the refresh changed the list, when the server says so.
    rootChanged = body.value("rootChanged", false);
    return nlohmann::json{{"versionToken", body["versionToken"]}, {"libraries", body["libraries"]}};
}

}  // namespace tamber
