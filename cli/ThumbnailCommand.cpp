#include "cli/ThumbnailCommand.h"

#include <ostream>

#include "cli/ItemArgument.h"
#include "platform/FileContents.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

CLI::App* ThumbnailCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "thumbnail", "Write an app library's thumbnail (its app's icon) as PNG and print the item");
    sub->add_option("ID", item_, "The app library: #bundle.id or its Documents folder's path")
        ->required();
    sub->add_option("-o,--output", output_, "The PNG file to write")->required();
    addJsonFlag(sub, "Print the item as `tamber item --json` does");
    return sub;
}

int ThumbnailCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto identifier = ItemArgument::resolve(provider, item_);
    if (!identifier.ok())
        return fail(context, identifier.error());
    // An unknown identifier fails as `tamber item` would, before any thumbnail is asked for.
    auto item = provider.itemForIdentifier(identifier.value());
    if (!item.ok())
        return fail(context, item.error());

    std::optional<Bytes> png;
    Status status = ProviderCalls::waitForStatus([&](auto done) {
        provider.fetchThumbnailsForItemIdentifiers(
            {identifier.value()}, {},
            HostPorterExtension::PerThumbnailCompletion(
                [&](const HostPorterItemIdentifier&, std::optional<Bytes> data,
                    std::optional<Error>) { png = std::move(data); }),
            std::move(done));
    });
    if (!status.ok())
        return fail(context, status.error());
    if (!png)
        return fail(
            context,
            Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                  {{"description", identifier.value() + " has no thumbnail (only app libraries "
                                                        "whose app has an icon have one)"}}));
    if (auto error = FileContents::writeAtomically(Url::fileURLWithPath(output_), *png);
        !error.ok())
        return fail(context, error.error());
    if (!json_)
        context.err() << "wrote " << png->size() << " bytes to " << output_ << "\n";
    return printItem(context, *item.value());
}

}  // namespace tamber
