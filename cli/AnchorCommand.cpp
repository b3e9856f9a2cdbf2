#include "cli/AnchorCommand.h"

#include <cerrno>
#include <optional>
#include <ostream>

#include "cli/ContainerArgument.h"
#include "runtime/Base64.h"
#include "runtime/JsonValues.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

CLI::App* AnchorCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("anchor", "Print a container's current sync anchor (base64)");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    addJsonFlag(sub, R"(Print {"anchor": A})");
    return sub;
}

int AnchorCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto container = ContainerArgument::resolve(provider, container_);
    if (!container.ok())
        return fail(context, container.error());
    auto enumerator = container.value().enumerator;
    std::optional<HostPorterSyncAnchor> anchor;
    DispatchSemaphore done;
    enumerator->currentSyncAnchorWithCompletionHandler(
        [&](std::optional<HostPorterSyncAnchor> value) {
            anchor = std::move(value);
            done.signal();
        });
    done.wait();
    enumerator->invalidate();
    if (!anchor) {
        return fail(context, Error(kPosixErrorDomain, EIO,
                                   {{"description",
                                     "no sync anchor: the container's volume has "
                                     "no event journal"}}));
    }
    if (json_)
        context.out() << jsonText(nlohmann::json{{"anchor", base64Encode(*anchor)}}) << "\n";
    else
        context.out() << base64Encode(*anchor) << "\n";
    return 0;
}

}  // namespace tamber
