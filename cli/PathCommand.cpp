#include "cli/PathCommand.h"

#include <ostream>

#include "cli/ItemArgument.h"
#include "host/HostPorterManager.h"
#include "host/PublishedTrees.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* PathCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("path", "Print the path of the item an identifier names");
    sub->add_option("ID", identifier_,
                    "An identifier (fid=N, did=N, #bundle.id), root, working-set, or a path")
        ->required();
    addJsonFlag(sub, "Print {\"id\": ..., \"path\": ...}");
    return sub;
}

int PathCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    ItemArgument argument = ItemArgument::parse(identifier_);
    std::optional<Url> url;
    if (argument.kind == ItemArgument::Kind::Path) {
        if (auto outside = PublishedTrees::check(argument.url); !outside.ok())
            return fail(context, outside.error());
        // Only an item answers: something that exists and has an identifier.
        if (provider.persistentIdentifierForItemAtURL(argument.url))
            url = argument.url;
    } else if (argument.identifier == HostPorterWorkingSetContainerItemIdentifier ||
               argument.identifier == HostPorterRootContainerItemIdentifier) {
        // The working set gathers items from every tree; the storage is where it starts.
        url = HostPorterManager::defaultManager()->documentStorageURL();
    } else {
        // Resolution answers nothing outside the published trees.
        url = provider.URLForItemWithPersistentIdentifier(argument.identifier);
    }
    if (!url)
        return fail(context, Error::porterErrorForNonExistentItemWithIdentifier(identifier_));
    if (json_) {
        nlohmann::json result{{"id", identifier_}};
        setTextWithBytes(result, "path", "pathBytes", url->path());
        context.out() << jsonText(result) << "\n";
    } else {
        context.out() << url->path() << "\n";
    }
    return 0;
}

}  // namespace tamber
