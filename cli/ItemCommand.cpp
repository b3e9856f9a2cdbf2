#include "cli/ItemCommand.h"

#include <ostream>

#include "cli/ItemArgument.h"
#include "cli/ItemJson.h"
#include "cli/JsonValues.h"
#include "provider/LocalPorter.h"

namespace tamber {

CLI::App* ItemCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("item", "Print the record of a file, folder or app library");
    sub->add_option("ID", item_,
                    "An identifier (fid=N, did=N, #bundle.id, root), or a path inside the "
                    "published folders")
        ->required();
    sub->add_flag("--json", json_, "Print the record as JSON");
    return sub;
}

int ItemCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    ItemArgument argument = ItemArgument::parse(item_);
    auto item = argument.kind == ItemArgument::Kind::Path
                    ? porter.value()->itemForURL(argument.url)
                    : porter.value()->itemForIdentifierLogged(argument.identifier);
    if (!item.ok())
        return context.fail(item.error(), json_);
    if (json_)
        context.out() << jsonText(itemJson(*item.value())) << "\n";
    else
        printItemText(context.out(), *item.value());
    return 0;
}

}  // namespace tamber
