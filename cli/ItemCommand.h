#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber item ID|PATH [--json]`: prints the item record the provider hands to the host.
class ItemCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string item_;
    bool json_ = false;
};

}  // namespace tamber
