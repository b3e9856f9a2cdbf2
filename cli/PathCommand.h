#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber path ID`: prints the path of the item an identifier names.
class PathCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string identifier_;
    bool json_ = false;
};

}  // namespace tamber
