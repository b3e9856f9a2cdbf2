#include "cli/ChangesCommand.h"

#include <memory>
#include <ostream>

#include "cli/ContainerArgument.h"
#include "cli/Interrupt.h"
#include "cli/TextEscape.h"
#include "runtime/Base64.h"
#include "runtime/ChangeCollector.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* ChangesCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("changes", "Print one batch of changes since a sync anchor");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    sub->add_option("--anchor", anchor_, "The sync anchor (base64, from anchor or changes)")
        ->required();
    addJsonFlag(sub,
                R"(Print {"updated": [...], "deleted": [...], "changes": [in order], "anchor": A, )"
                R"("moreComing": b})");
    return sub;
}

int ChangesCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto anchor = base64Decode(anchor_);
    if (!anchor)
        return fail(context, CliContext::usageError("--anchor is not base64: " + anchor_));
    auto container = ContainerArgument::resolve(provider, container_);
    if (!container.ok())
        return fail(context, container.error());
    auto enumerator = container.value().enumerator;

    auto collector = std::make_shared<ChangeCollector>();
    catchInterrupts();
    enumerator->enumerateChangesForObserver(collector, *anchor);
    // A batch ends once the history is replayed; only an interrupt cuts it short.
    std::optional<ChangeCollector::Batch> batch;
    while (!(batch = collector->waitFor(0.2)) && !interrupted()) {
    }
    enumerator->invalidate();
    if (!batch)
        return fail(context, CliContext::usageError("interrupted"));
    if (batch->error)
        return fail(context, *batch->error);

    if (json_) {
        context.out() << jsonText(HostJson::changeBatch(*batch)) << "\n";
        return 0;
    }
    for (const auto& change : batch->changes) {
        if (change.item) {
            context.out() << "updated\t" << escapedText(change.item->itemIdentifier()) << "\t"
                          << escapedText(change.item->filename()) << "\n";
        } else {
            context.out() << "deleted\t" << escapedText(change.deletedItem) << "\n";
        }
    }
    std::string next = batch->anchor ? base64Encode(*batch->anchor) : "";
    context.out() << "anchor: " << next << (batch->moreComing ? " (more coming)" : "") << "\n";
    return 0;
}

}  // namespace tamber
