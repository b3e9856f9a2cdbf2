#include "cli/RemoveItemCommand.h"

#include <ostream>

#include "cli/ItemArgument.h"
#include "runtime/JsonValues.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

CLI::App* RemoveItemCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("rm", "Delete an item for good (not into the trash)");
    sub->add_option("ID", item_, "The item: an identifier or a path")->required();
    addJsonFlag(sub, "Print {\"deleted\": ID}");
    return sub;
}

int RemoveItemCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto item = ItemArgument::resolve(provider, item_);
    if (!item.ok())
        return fail(context, item.error());
    Status status = ProviderCalls::waitForStatus(
        [&](auto done) { provider.deleteItemWithIdentifier(item.value(), std::move(done)); });
    if (!status.ok())
        return fail(context, status.error());
    if (json_)
        context.out() << jsonText(nlohmann::json{{"deleted", item.value()}}) << "\n";
    else
        context.out() << "deleted " << item.value() << "\n";
    return 0;
}

}  // namespace tamber
