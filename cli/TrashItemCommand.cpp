#include "cli/TrashItemCommand.h"

#include "cli/ItemArgument.h"
#include "runtime/ProviderCalls.h"

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
    addJsonFlag(sub, "Print the item as `tamber item --json` does");
    return sub;
}

int TrashItemCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto item = ItemArgument::resolve(provider, item_);
    if (!item.ok())
        return fail(context, item.error());
    if (verb_ == Verb::Trash) {
        return finish(context, ProviderCalls::waitForItem([&](auto done) {
                          provider.trashItemWithIdentifier(item.value(), std::move(done));
                      }));
    }
    std::optional<HostPorterItemIdentifier> parent;
    if (to_) {
        auto resolved = ItemArgument::resolve(provider, *to_);
        if (!resolved.ok())
            return fail(context, resolved.error());
        parent = resolved.value();
    }
    return finish(context, ProviderCalls::waitForItem([&](auto done) {
                      provider.untrashItemWithIdentifier(item.value(), parent, std::move(done));
                  }));
}

}  // namespace tamber
