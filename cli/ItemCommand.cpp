#include "cli/ItemCommand.h"

#include <ostream>

#include "cli/ItemArgument.h"

namespace tamber {

CLI::App* ItemCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("item", "Print the record of a file, folder or app library");
    sub->add_option("ID", item_,
                    "An identifier (fid=N, did=N, #bundle.id, root), or a path inside the "
                    "published folders")
        ->required();
    addJsonFlag(sub, "Print the record as JSON");
    return sub;
}

int ItemCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    ItemArgument argument = ItemArgument::parse(item_);
    auto item = argument.kind == ItemArgument::Kind::Path
                    ? provider.itemAtURL(argument.url)
                    : provider.itemForIdentifier(argument.identifier);
    return finish(context, item);
}

}  // namespace tamber
