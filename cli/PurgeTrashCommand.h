#pragma once

#include <optional>
#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber purge-trash --older-than DURATION`: deletes for good what has been in the trash
// folders for longer than DURATION (30d, 12h, 90m, 45s) and prints how many items went.
class PurgeTrashCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    Status checkArguments() override;
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    std::string olderThan_;
    double seconds_ = 0;  // olderThan_, once checked
};

}  // namespace tamber
