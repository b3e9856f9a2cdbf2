#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber anchor ID`: the container's current sync anchor, alone on a line (base64).
class AnchorCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string container_;
    bool json_ = false;
};

}  // namespace tamber
