#pragma once

#include <optional>
#include <string>

#include "cli/ProviderCommand.h"

namespace tamber {

// `tamber trash ID` moves an item into its library's trash; `tamber untrash ID [--to PARENT]`
// puts it back where it came from, or into PARENT. Both print the item where it now is.
class TrashItemCommand : public ProviderCommand {
public:
    enum class Verb { Trash, Untrash };
    explicit TrashItemCommand(Verb verb) : verb_(verb) {}

    CLI::App* add(CLI::App& app) override;

private:
    int runWith(CliContext& context, HostPorterExtension& provider) override;

    Verb verb_;
    std::string item_;
    std::optional<std::string> to_;
};

}  // namespace tamber
