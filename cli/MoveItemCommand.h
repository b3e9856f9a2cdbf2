#pragma once

#include <optional>
#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber rename ID NAME` renames an item in place; `tamber mv ID PARENT [--name N]` moves it
// into another folder, optionally under a new name. Both print the item where it now is.
class MoveItemCommand : public ProviderCommand {
public:
    enum class Verb { Rename, Move };
    explicit MoveItemCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    Verb verb_;
    std::string item_;
    std::string target_;  // the new name (rename) or the new parent (mv)
    std::optional<std::string> name_;
};

}  // namespace tamber
