#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber watch [ID] [--json]`: prints every signal the provider sends for a container's
// enumerator until interrupted.
class WatchCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string container_ = "root";
    bool json_ = false;
};

}  // namespace tamber
