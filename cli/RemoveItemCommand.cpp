#include "cli/RemoveItemCommand.h"

#include <ostream>

#include "cli/ItemAction.h"
#include "cli/JsonValues.h"

namespace tamber {

CLI::App* RemoveItemCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("rm", "Delete an item for good (not into the trash)");
    sub->add_option("ID", item_, "The item: an identifier or a path")->required();
    sub->add_flag("--json", json_, "Print {\"deleted\": ID}");
    return sub;
}

int RemoveItemCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto& provider = *porter.value();
    auto item = ItemAction::identifierFor(provider, item_);
    if (!item.ok())
        return context.fail(item.error(), json_);
    Status status = ItemAction::waitForStatus(
        [&](auto done) { provider.deleteItemWithIdentifier(item.value(), std::move(done)); });
    if (!status.ok())
        return context.fail(status.error(), json_);
    if (json_)
        context.out() << jsonText(nlohmann::json{{"deleted", item.value()}}) << "\n";
    else
        context.out() << "deleted " << item.value() << "\n";
    return 0;
}

}  // namespace tamber
