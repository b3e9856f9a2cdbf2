#include "cli/MoveItemCommand.h"

#include "cli/ItemArgument.h"
#include "runtime/ProviderCalls.h"

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
    addJsonFlag(sub, "Print the item as `tamber item --json` does");
    return sub;
}

int MoveItemCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto item = ItemArgument::resolve(provider, item_);
    if (!item.ok())
        return fail(context, item.error());
    if (verb_ == Verb::Rename) {
        return finish(context, ProviderCalls::waitForItem([&](auto done) {
                          provider.renameItemWithIdentifier(item.value(), target_, std::move(done));
                      }));
    }
    auto parent = ItemArgument::resolve(provider, target_);
    if (!parent.ok())
        return fail(context, parent.error());
    return finish(context, ProviderCalls::waitForItem([&](auto done) {
                      provider.reparentItemWithIdentifier(item.value(), parent.value(), name_,
                                                          std::move(done));
                  }));
}

}  // namespace tamber
