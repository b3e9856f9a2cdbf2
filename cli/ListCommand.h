#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber ls ID [--page TOKEN] [--all] [--json]`: one page of a container's listing (or every
// page), with the token of the next page.
class ListCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string container_;
    std::string page_;
    bool all_ = false;
};

}  // namespace tamber
