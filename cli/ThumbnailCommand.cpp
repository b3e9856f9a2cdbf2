#include "cli/ThumbnailCommand.h"

#include <ostream>

#include "cli/ItemAction.h"
#include "platform/FileContents.h"

namespace tamber {

CLI::App* ThumbnailCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "thumbnail", "Write an app library's thumbnail (its app's icon) as PNG and print the item");
    sub->add_option("ID", item_, "The app library: #bundle.id or its Documents folder's path")
        ->required();
    sub->add_option("-o,--output", output_, "The PNG file to write")->required();
    sub->add_flag("--json", json_, "Print the item as `tamber item --json` does");
    return sub;
}

int ThumbnailCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto& provider = *porter.value();
    auto identifier = ItemAction::identifierFor(provider, item_);
    if (!identifier.ok())
        return context.fail(identifier.error(), json_);
    // An unknown identifier fails as `tamber item` would, before any thumbnail is asked for.
    auto item = provider.itemForIdentifierLogged(identifier.value());
    if (!item.ok())
        return context.fail(item.error(), json_);

    std::optional<Bytes> png;
    Status status = ItemAction::waitForStatus([&](LocalPorter::ErrorCompletion done) {
        provider.fetchThumbnailsForItemIdentifiers(
            {identifier.value()}, {},
            LocalPorter::PerThumbnailCompletion(
                [&](const HostPorterItemIdentifier&, std::optional<Bytes> data,
                    std::optional<Error>) { png = std::move(data); }),
            std::move(done));
    });
    if (!status.ok())
        return context.fail(status.error(), json_);
    if (!png)
        return context.fail(
            Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                  {{"description", identifier.value() + " has no thumbnail (only app libraries "
                                                        "whose app has an icon have one)"}}),
            json_);
    if (auto status = FileContents::writeAtomically(Url::fileURLWithPath(output_), *png);
        !status.ok())
        return context.fail(status.error(), json_);
    if (!json_)
        context.err() << "wrote " << png->size() << " bytes to " << output_ << "\n";
    return ItemAction::printItem(context, *item.value(), json_);
}

}  // namespace tamber
