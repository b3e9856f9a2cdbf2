#include "cli/MoveItemCommand.h"

#include "cli/ItemAction.h"

namespace tamber {

CLI::App* MoveItemCommand::add(CLI::App& app) {
    CLI::App* sub = nullptr;
    if (verb_ == Verb::Rename) {
        sub = app.add_subcommand("rename", "Rename an item in its folder and print it");
        sub->add_option("ID", item_, "The item: an identifier or a path")->required();
        sub->add_option("NAME", target_, "The new name")->required();
    } else {
        sub = app.add_subcommand("mv", "Move an item into another folder and print it");
        sub->add_option("ID", item_, "The item: an identifier or a path")->required();
        sub->add_option("PARENT", target_, "The folder to move it into: an identifier or a path")
            ->required();
        sub->add_option("--name", name_, "Also give the item this name");
    }
    sub->add_flag("--json", json_, "Print the item as `tamber item --json` does");
    return sub;
}

int MoveItemCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto& provider = *porter.value();
    auto item = ItemAction::identifierFor(provider, item_);
    if (!item.ok())
        return context.fail(item.error(), json_);
    if (verb_ == Verb::Rename) {
        return ItemAction::finish(context, ItemAction::waitForItem([&](auto done) {
                                      provider.renameItemWithIdentifier(item.value(), target_,
                                                                        std::move(done));
                                  }),
                                  json_);
    }
    auto parent = ItemAction::identifierFor(provider, target_);
    if (!parent.ok())
        return context.fail(parent.error(), json_);
    return ItemAction::finish(context, ItemAction::waitForItem([&](auto done) {
                                  provider.reparentItemWithIdentifier(item.value(), parent.value(),
                                                                      name_, std::move(done));
                              }),
                              json_);
}

}  // namespace tamber
