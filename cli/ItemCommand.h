#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber item ID|PATH [--json]`: prints the item record the provider hands to the host.
class ItemCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string item_;
};

}  // namespace tamber
