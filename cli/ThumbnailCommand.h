#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber thumbnail ID -o FILE.png`: writes the thumbnail the file browser would show (app
// libraries only: their app's icon) and prints the item.
class ThumbnailCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    std::string item_;
    std::string output_;
    bool json_ = false;
};

}  // namespace tamber
