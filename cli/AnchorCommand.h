#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber anchor ID`: the container's current sync anchor, alone on a line (base64).
class AnchorCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string container_;
};

}  // namespace tamber
