#include "cli/IdCommand.h"

#include <ostream>

#include "cli/JsonValues.h"
#include "host/PublishedTrees.h"
#include "items/TBFileObjectIdentifier.h"

namespace tamber {

CLI::App* IdCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("id", "Print the persistent identifier of a file or folder");
    sub->add_option("PATH", path_, "A file or folder inside the published folders")->required();
    sub->add_flag("--json", json_, "Print {\"id\": ..., \"path\": ...}");
    return sub;
}

int IdCommand::run(CliContext& context) {
    if (auto porter = context.prepareProvider(); !porter.ok())
        return context.fail(porter.error(), json_);
    Url url = Url::fileURLWithPath(path_);
    if (auto outside = PublishedTrees::check(url); !outside.ok())
        return context.fail(outside.error(), json_);
    auto identifier = TBFileObjectIdentifier::itemIdentifier(url);
    if (!identifier) {
        return context.fail(Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                                  {{"description", "no identifier for " + url.path() +
                                                       " (missing, or outside the published "
                                                       "folders)"}}),
                            json_);
    }
    if (json_) {
        nlohmann::json result{{"id", *identifier}};
        setTextWithBytes(result, "path", "pathBytes", url.path());
        context.out() << jsonText(result) << "\n";
    } else {
        context.out() << *identifier << "\n";
    }
    return 0;
}

}  // namespace tamber
