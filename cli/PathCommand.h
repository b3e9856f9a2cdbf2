#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber path ID`: prints the path of the item an identifier names.
class PathCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string identifier_;
};

}  // namespace tamber
