#pragma once

#include <string>

#include "cli/Command.h"

namespace tamber {

// `tamber import SRC PARENT` copies a file or folder into a folder under a free name;
// `tamber mkdir NAME PARENT` creates a folder. Both print the new item.
class CreateItemCommand : public Command {
public:
    enum class Verb { Import, Mkdir };
    explicit CreateItemCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    Verb verb_;
    std::string source_;  // the file to import, or the new folder's name
    std::string parent_;
    bool json_ = false;
    bool bounce_ = false;  // mkdir: a taken name becomes "name 2" instead of failing
};

}  // namespace tamber
