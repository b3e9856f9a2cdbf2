#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber id PATH`: prints the persistent identifier of the item at PATH.
class IdCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string path_;
    bool json_ = false;
};

}  // namespace tamber
