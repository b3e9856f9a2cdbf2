#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber thumbnail ID -o FILE.png`: writes the thumbnail the file browser would show (app
// libraries only: their app's icon) and prints the item.
class ThumbnailCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string item_;
    std::string output_;
};

}  // namespace tamber
