#include "cli/IdCommand.h"

#include <ostream>

#include "host/PublishedTrees.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* IdCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("id", "Print the persistent identifier of a file or folder");
    sub->add_option("PATH", path_, "A file or folder inside the published folders")->required();
    addJsonFlag(sub, "Print {\"id\": ..., \"path\": ...}");
    return sub;
}

int IdCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    Url url = Url::fileURLWithPath(path_);
    if (auto outside = PublishedTrees::check(url); !outside.ok())
        return fail(context, outside.error());
    auto identifier = provider.persistentIdentifierForItemAtURL(url);
    if (!identifier) {
        return fail(context, Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                                   {{"description", "no identifier for " + url.path() +
                                                        " (missing, or outside the published "
                                                        "folders)"}}));
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
