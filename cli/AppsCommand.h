#pragma once

#include "cli/Command.h"

namespace tamber {

// `tamber apps [--refresh] [--json]`: the app libraries the provider publishes, and the version
// token of the list they came from.
class AppsCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    bool refresh_ = false;
    bool json_ = false;
};

}  // namespace tamber
