#pragma once

#include <string>
#include <vector>

#include "cli/Command.h"

namespace tamber {

// The metadata verbs, through the provider as the file browser sets them:
// `tamber tag ID [TAG...]` replaces the tags (none clears them), `tamber rank ID N|none` sets
// or clears the favourite rank, `tamber touch ID [--clear]` sets the last-used date to now or
// clears it. Each prints the item as it now is.
class ItemMetadataCommand : public Command {
public:
    enum class Verb { Tag, Rank, Touch };
    explicit ItemMetadataCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

private:
    Verb verb_;
    std::string item_;
    std::vector<std::string> tags_;
    std::string rank_;
    bool clear_ = false;
    bool json_ = false;
};

}  // namespace tamber
