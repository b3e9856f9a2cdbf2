#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber import SRC PARENT` copies a file or folder into a folder under a free name;
// `tamber mkdir NAME PARENT` creates a folder. Both print the new item.
class CreateItemCommand : public ProviderCommand {
public:
    enum class Verb { Import, Mkdir };
    explicit CreateItemCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;

private:
    Status checkArguments() override;
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    Verb verb_;
    std::string source_;  // the file to import, or the new folder's name
    std::string parent_;
    bool bounce_ = false;  // mkdir: a taken name becomes "name 2" instead of failing
};

}  // namespace tamber
