#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber changes ID --anchor A [--json]`: one batch of the changes since a sync anchor, with
// the anchor to continue from.
class ChangesCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string container_;
    std::string anchor_;
    bool json_ = false;
};

}  // namespace tamber
