#pragma once

#include <nlohmann/json.hpp>

#include "cli/ProviderCommand.h"

namespace tamber {

class RemotePorter;

// `tamber apps [--refresh] [--json]`: the app libraries the provider publishes, and the version
// token of the list they came from.
class AppsCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;
    // {"versionToken", "libraries"} from this process's provider, or from a running server;
    // `rootChanged` says whether the refresh changed the list.
    Result<nlohmann::json> localListing(CliContext& context, bool& rootChanged) const;
    Result<nlohmann::json> remoteListing(RemotePorter& provider, bool& rootChanged) const;

    bool refresh_ = false;
};

}  // namespace tamber
