#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber changes ID --anchor A [--json]`: one batch of the changes since a sync anchor, with
// the anchor to continue from.
class ChangesCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string container_;
    std::string anchor_;
};

}  // namespace tamber
