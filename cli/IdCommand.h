#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber id PATH`: prints the persistent identifier of the item at PATH.
class IdCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string path_;
};

}  // namespace tamber
