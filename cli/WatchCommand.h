#pragma once

#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber watch [ID] [--json]`: prints every signal the provider sends for a container's
// enumerator until interrupted.
class WatchCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;
    // Through a running server: its stream of events carries the signals.
    int watchServer(CliContext& context, HostPorterExtension& provider);
    void printSignal(CliContext& context, const std::string& container);

    std::string container_ = "root";
};

}  // namespace tamber
