#include "cli/PurgeTrashCommand.h"
#include "runtime/Duration.h"

#include "cli/RemotePorter.h"

#include <ostream>

#include "platform/objects/Date.h"
#include "runtime/JsonValues.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

CLI::App* PurgeTrashCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "purge-trash", "Delete for good what has been in the trash longer than a duration");
    sub->add_option("--older-than", olderThan_,
                    "How long an item must have been trashed: N followed by s, m, h or d "
                    "(30d, 12h, 90m, 45s)")
        ->required();
    addJsonFlag(sub, "Print {\"removed\": N}");
    return sub;
}

Status PurgeTrashCommand::checkArguments() {
    auto seconds = Duration::parse(olderThan_);
    if (!seconds)
        return CliContext::usageError(
            "--older-than takes a duration such as 30d, 12h, 90m or "
            "45s, not \"" +
            olderThan_ + "\"");
    seconds_ = *seconds;
    return Status::OK();
}

int PurgeTrashCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto reference = Date::make(Date::now()->timeIntervalSince1970() - seconds_);
    size_t removed = ProviderCalls::waitForCount(
        [&](auto done) { provider.removeTrashedItemsOlderThanDate(reference, std::move(done)); });
    // Through a server the count comes with a request that may have failed.
    if (auto* remote = dynamic_cast<RemotePorter*>(&provider); remote && remote->lastError())
        return fail(context, *remote->lastError());
    if (json_)
        context.out() << jsonText(nlohmann::json{{"removed", removed}}) << "\n";
    else
        context.out() << "removed " << removed << (removed == 1 ? " item" : " items") << "\n";
    return 0;
}

}  // namespace tamber
