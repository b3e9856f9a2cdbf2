#include "cli/ChangesCommand.h"

#include <memory>
#include <ostream>

#include "cli/Base64.h"
#include "cli/ChangeCollector.h"
#include "cli/ContainerArgument.h"
#include "cli/Interrupt.h"
#include "cli/ItemJson.h"
#include "cli/JsonValues.h"
#include "cli/TextEscape.h"

namespace tamber {

CLI::App* ChangesCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("changes", "Print one batch of changes since a sync anchor");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    sub->add_option("--anchor", anchor_, "The sync anchor (base64, from anchor or changes)")
        ->required();
    sub->add_flag(
        "--json", json_,
        R"(Print {"updated": [...], "deleted": [...], "changes": [in order], "anchor": A, )"
        R"("moreComing": b})");
    return sub;
}

int ChangesCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto anchor = base64Decode(anchor_);
    if (!anchor)
        return context.fail(CliContext::usageError("--anchor is not base64: " + anchor_), json_);
    auto container = ContainerArgument::resolve(*porter.value(), container_);
    if (!container.ok())
        return context.fail(container.error(), json_);
    auto enumerator = container.value().enumerator;

    auto collector = std::make_shared<ChangeCollector>();
    catchInterrupts();
    enumerator->enumerateChangesForObserver(collector, *anchor);
    // A batch ends once the history is replayed; only an interrupt cuts it short.
    bool finished = false;
    while (!(finished = collector->wait(0.2)) && !interrupted()) {
    }
    enumerator->invalidate();
    if (!finished)
        return context.fail(CliContext::usageError("interrupted"), json_);
    if (collector->error)
        return context.fail(*collector->error, json_);

    std::string next = collector->anchor ? base64Encode(*collector->anchor) : "";
    if (json_) {
        nlohmann::json updated = nlohmann::json::array();
        nlohmann::json changes = nlohmann::json::array();
        for (const auto& change : collector->changes) {
            auto local = std::dynamic_pointer_cast<const LocalItem>(change.item);
            if (local) {
                updated.push_back(itemJson(*local));
                changes.push_back({{"updated", itemJson(*local)}});
            } else if (!change.item) {
                changes.push_back({{"deleted", change.deletedItem}});
            }
        }
        nlohmann::json result{{"updated", std::move(updated)},
                              {"deleted", collector->deleted},
                              {"changes", std::move(changes)},
                              {"anchor", next},
                              {"moreComing", collector->moreComing}};
        context.out() << jsonText(result) << "\n";
        return 0;
    }
    for (const auto& change : collector->changes) {
        if (change.item) {
            context.out() << "updated\t" << escapedText(change.item->itemIdentifier()) << "\t"
                          << escapedText(change.item->filename()) << "\n";
        } else {
            context.out() << "deleted\t" << escapedText(change.deletedItem) << "\n";
        }
    }
    context.out() << "anchor: " << next << (collector->moreComing ? " (more coming)" : "") << "\n";
    return 0;
}

}  // namespace tamber
