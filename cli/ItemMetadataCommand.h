#pragma once

#include <memory>
#include <string>
#include <vector>

#include "cli/ProviderCommand.h"
#include "platform/objects/Number.h"

namespace tamber {

// The metadata verbs, through the provider as the file browser sets them:
// `tamber tag ID [TAG...]` replaces the tags (none clears them), `tamber rank ID N|none` sets
// or clears the favourite rank, `tamber touch ID [--clear]` sets the last-used date to now or
// clears it. Each prints the item as it now is.
class ItemMetadataCommand : public ProviderCommand {
public:
    enum class Verb { Tag, Rank, Touch };
    explicit ItemMetadataCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;

private:
    Status checkArguments() override;
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    Verb verb_;
    std::string item_;
    std::vector<std::string> tags_;
    std::string rank_;
    std::shared_ptr<const Number> rankValue_;  // rank_, once checked; null for "none"
    bool clear_ = false;
};

}  // namespace tamber
