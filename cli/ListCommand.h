#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber ls ID [--page TOKEN] [--all] [--json]`: one page of a container's listing (or every
// page), with the token of the next page.
class ListCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string container_;
    std::string page_;
    bool all_ = false;
    bool json_ = false;
};

}  // namespace tamber
