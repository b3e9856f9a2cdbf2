#include "cli/TrashItemCommand.h"

#include "cli/ItemAction.h"

namespace tamber {

CLI::App* TrashItemCommand::add(CLI::App& app) {
    CLI::App* sub = nullptr;
    if (verb_ == Verb::Trash) {
        sub = app.add_subcommand("trash", "Move an item into its library's trash and print it");
    } else {
        sub = app.add_subcommand(
            "untrash", "Put a trashed item back where it came from (or into --to) and print it");
        sub->add_option("--to", to_, "The folder to put it into: an identifier or a path");
    }
    sub->add_option("ID", item_, "The item: an identifier or a path")->required();
    sub->add_flag("--json", json_, "Print the item as `tamber item --json` does");
    return sub;
}

int TrashItemCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto& provider = *porter.value();
    auto item = ItemAction::identifierFor(provider, item_);
    if (!item.ok())
        return context.fail(item.error(), json_);
    if (verb_ == Verb::Trash) {
        return ItemAction::finish(context, ItemAction::waitForItem([&](auto done) {
                                      provider.trashItemWithIdentifier(item.value(),
                                                                       std::move(done));
                                  }),
                                  json_);
    }
    std::optional<HostPorterItemIdentifier> parent;
    if (to_) {
        auto resolved = ItemAction::identifierFor(provider, *to_);
        if (!resolved.ok())
            return context.fail(resolved.error(), json_);
        parent = resolved.value();
    }
    return ItemAction::finish(context, ItemAction::waitForItem([&](auto done) {
                                  provider.untrashItemWithIdentifier(item.value(), parent,
                                                                     std::move(done));
                              }),
                              json_);
}

}  // namespace tamber
