#pragma once

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber apps [--refresh] [--json]`: the app libraries the provider publishes, and the version
// token of the list they came from.
class AppsCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    bool refresh_ = false;
};

}  // namespace tamber
