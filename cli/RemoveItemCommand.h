#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber rm ID`: deletes an item (a folder with everything in it) for good. There is no item
// left to print: it prints the identifier that is gone.
class RemoveItemCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string item_;
};

}  // namespace tamber
