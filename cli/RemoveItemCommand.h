#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber rm ID`: deletes an item (a folder with everything in it) for good. There is no item
// left to print: it prints the identifier that is gone.
class RemoveItemCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string item_;
    bool json_ = false;
};

}  // namespace tamber
