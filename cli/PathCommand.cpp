#include "cli/PathCommand.h"

#include <ostream>

#include "cli/JsonValues.h"
#include "items/TBFileObjectIdentifier.h"

namespace tamber {

CLI::App* PathCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("path", "Print the path of the item an identifier names");
    sub->add_option("ID", identifier_, "An identifier: fid=N, did=N or the root container")
        ->required();
    sub->add_flag("--json", json_, "Print {\"id\": ..., \"path\": ...}");
    return sub;
}

int PathCommand::run(CliContext& context) {
    if (auto porter = context.prepareProvider(); !porter.ok())
        return context.fail(porter.error(), json_);
    auto url = TBFileObjectIdentifier::fileURLWithItemIdentifier(identifier_);
    if (!url) {
        return context.fail(Error::porterErrorForNonExistentItemWithIdentifier(identifier_), json_);
    }
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
