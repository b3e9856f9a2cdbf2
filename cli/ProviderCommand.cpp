#include "cli/ProviderCommand.h"

#include <ostream>

#include "cli/ItemText.h"
#include "cli/RemotePorter.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

namespace tamber {

int ProviderCommand::run(CliContext& context) {
    if (auto answered = runBeforeProvider(context))
        return *answered;
    if (auto refused = checkArguments(); !refused.ok())
        return fail(context, refused.error());
    // A running server answers for its provider; the verb runs the same either way.
    if (context.server()) {
        auto remote = context.remoteProvider();
        if (!remote.ok())
            return fail(context, remote.error());
        return runWith(context, *remote.value());
    }
    auto provider = context.prepareProvider();
    if (!provider.ok())
        return fail(context, provider.error());
    return runWith(context, *provider.value());
}

void ProviderCommand::addJsonFlag(CLI::App* verb, const std::string& help) {
    verb->add_flag("--json", json_, help);
}

int ProviderCommand::printItem(CliContext& context, const HostPorterItem& item) const {
    if (json_)
        context.out() << jsonText(HostJson::item(item)) << "\n";
    else
        printItemText(context.out(), item);
    return 0;
}

int ProviderCommand::finish(CliContext& context, const Result<HostPorterItemRef>& item) const {
    if (!item.ok())
        return fail(context, item.error());
    return printItem(context, *item.value());
}

}  // namespace tamber
