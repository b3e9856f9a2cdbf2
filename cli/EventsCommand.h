#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "cli/ProviderCommand.h"
#include "support/Result.h"

namespace tamber {

class RemotePorter;

// `tamber events [--since ID] [--docid] [--no-follow] [--json] PATH...`: replays the journal
// for the given trees, then follows it live until interrupted (or stops after the
// history-done event with --no-follow). A path outside every published tree is watched for
// that run, with a warning: its replay then starts with a lost-history event.
//
// `tamber events --forget PATH`: the journal stops remembering that tree (see
// TremorService::forget) and says what it dropped.
class EventsCommand : public ProviderCommand {
public:
    CLI::App* add(CLI::App& app) override;

protected:
    // --forget: the journal alone answers it.
    std::optional<int> runBeforeProvider(CliContext& context) override;
    // --since must be a whole event ID.
    Status checkArguments() override;
    int runWith(CliContext& context, HostPorterExtension& provider) override;

private:
    // Watches each of `paths` that no watched tree covers, with a warning on standard error.
    static Status watchUncovered(CliContext& context, const std::vector<std::string>& paths);
    int forget(CliContext& context);
    // The journal as the running server reads it, printed the same way.
    int runThroughServer(CliContext& context, RemotePorter& provider);

    // Nothing unless the text is a whole event ID in decimal.
    static std::optional<uint64_t> parseEventID(const std::string& text);

    std::vector<std::string> paths_;
    CLI::Option* since_ = nullptr;
    std::string sinceText_;  // parsed by checkArguments(), which can say what is wrong with it
    uint64_t sinceID_ = 0;
    std::string forget_;
    bool docid_ = false;
    bool noFollow_ = false;
};

}  // namespace tamber
