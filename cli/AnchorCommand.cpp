#include "cli/AnchorCommand.h"

#include <cerrno>
#include <optional>
#include <ostream>

#include "cli/Base64.h"
#include "cli/ContainerArgument.h"
#include "cli/JsonValues.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

CLI::App* AnchorCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("anchor", "Print a container's current sync anchor (base64)");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    sub->add_flag("--json", json_, R"(Print {"anchor": A})");
    return sub;
}

int AnchorCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto container = ContainerArgument::resolve(*porter.value(), container_);
    if (!container.ok())
        return context.fail(container.error(), json_);
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
        return context.fail(Error(kPosixErrorDomain, EIO,
                                  {{"description",
                                    "no sync anchor: the container's volume has "
                                    "no event journal"}}),
                            json_);
    }
    if (json_)
        context.out() << jsonText(nlohmann::json{{"anchor", base64Encode(*anchor)}}) << "\n";
    else
        context.out() << base64Encode(*anchor) << "\n";
    return 0;
}

}  // namespace tamber
