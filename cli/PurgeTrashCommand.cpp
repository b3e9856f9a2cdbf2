#include "cli/PurgeTrashCommand.h"

#include "cli/RemotePorter.h"

#include <charconv>
#include <ostream>

#include "platform/objects/Date.h"
#include "runtime/JsonValues.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

std::optional<double> PurgeTrashCommand::parseDuration(const std::string& text) {
    if (text.size() < 2)
        return std::nullopt;
    double unit = 0;
    switch (text.back()) {
        case 's':
            unit = 1;
            break;
        case 'm':
            unit = 60;
            break;
        case 'h':
            unit = 3600;
            break;
        case 'd':
            unit = 86400;
            break;
        default:
            return std::nullopt;
    }
    uint64_t amount = 0;
    const char* end = text.data() + text.size() - 1;
    auto [stop, ec] = std::from_chars(text.data(), end, amount);
    if (ec != std::errc() || stop != end)
        return std::nullopt;
    return static_cast<double>(amount) * unit;
}

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
    auto seconds = parseDuration(olderThan_);
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
