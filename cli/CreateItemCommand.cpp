#include "cli/CreateItemCommand.h"

#include "cli/ItemArgument.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

CLI::App* CreateItemCommand::add(CLI::App& app) {
    CLI::App* sub = nullptr;
    if (verb_ == Verb::Import) {
        sub = app.add_subcommand("import",
                                 "Copy a file or folder into a folder (a taken name becomes "
                                 "\"name 2\", \"name 3\", ...) and print the new item");
        sub->add_option("SRC", source_, "The file or folder to copy")->required();
    } else {
        sub = app.add_subcommand("mkdir",
                                 "Create a folder and print it (a taken name fails unless "
                                 "--bounce)");
        sub->add_option("NAME", source_, "The new folder's name")->required();
        sub->add_flag("--bounce", bounce_,
                      "Use \"NAME 2\", \"NAME 3\", ... when the name is taken");
    }
    sub->add_option("PARENT", parent_,
                    "The folder to create it in: an identifier (fid=N, #bundle.id) or a path")
        ->required();
    addJsonFlag(sub, "Print the item as `tamber item --json` does");
    return sub;
}

Status CreateItemCommand::checkArguments() {
    if (verb_ == Verb::Import && source_.empty())
        return Error(
            kHostPorterErrorDomain, kHostPorterInvalidParameter,
            {{"parameter", "source"}, {"description", "the source path must not be empty"}});
    return Status::OK();
}

int CreateItemCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto parent = ItemArgument::resolve(provider, parent_);
    if (!parent.ok())
        return fail(context, parent.error());
    return finish(context, ProviderCalls::waitForItem([&](auto done) {
                      if (verb_ == Verb::Import)
                          provider.importDocumentAtURL(Url::fileURLWithPath(source_),
                                                       parent.value(), std::move(done));
                      else
                          provider.createDirectoryWithName(source_, parent.value(), bounce_,
                                                           std::move(done));
                  }));
}

}  // namespace tamber
