#pragma once

#include "cli/Command.h"

namespace tamber {

// `tamber status [--json]`: what the running server of the storage folder says about itself
// (ready or catching up, the items it holds, how far the journal is behind). Without a server:
// "no server running" and exit status 3.
class StatusCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    bool json_ = false;
};

}  // namespace tamber
