#include "cli/ListCommand.h"

#include <memory>
#include <ostream>

#include "cli/Base64.h"
#include "cli/ContainerArgument.h"
#include "cli/ItemJson.h"
#include "cli/JsonValues.h"
#include "cli/PageCollector.h"
#include "cli/TextEscape.h"

namespace tamber {

CLI::App* ListCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("ls", "List a container one page (200 items) at a time");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    sub->add_option("--page", page_, "Continue from this page token (base64, from a previous ls)");
    sub->add_flag("--all", all_, "List every page, not just one");
    sub->add_flag("--json", json_, R"(Print {"items": [...], "nextPage": TOKEN or null})");
    return sub;
}

int ListCommand::run(CliContext& context) {
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    HostPorterPage page = HostPorterInitialPageSortedByName();
    if (!page_.empty()) {
        auto decoded = base64Decode(page_);
        if (!decoded)
            return context.fail(CliContext::usageError("--page is not base64: " + page_), json_);
        page = *decoded;
    }
    auto container = ContainerArgument::resolve(*porter.value(), container_);
    if (!container.ok())
        return context.fail(container.error(), json_);
    auto enumerator = container.value().enumerator;

    nlohmann::json items = nlohmann::json::array();
    std::optional<HostPorterPage> next;
    size_t pages = 0;
    for (;;) {
        auto collector = std::make_shared<PageCollector>();
        enumerator->enumerateItemsForObserver(collector, page);
        collector->wait();
        if (collector->error) {
            enumerator->invalidate();
            return context.fail(*collector->error, json_);
        }
        for (const auto& item : collector->items) {
            auto local = std::dynamic_pointer_cast<const LocalItem>(item);
            if (!local)
                continue;
            if (json_) {
                items.push_back(itemJson(*local));
            } else {
                context.out() << escapedText(local->itemIdentifier()) << "\t"
                              << escapedText(local->filename()) << "\t" << local->typeIdentifier()
                              << "\n";
            }
        }
        next = collector->nextPage;
        ++pages;
        if (!all_ || !next)
            break;
        if (pages % 50 == 0 && !json_)
            context.err() << "tamber: listed " << pages << " pages\n";
        page = *next;
    }
    enumerator->invalidate();
    if (json_) {
        nlohmann::json result{{"items", std::move(items)},
                              {"nextPage", next ? nlohmann::json(base64Encode(*next)) : nullptr}};
        context.out() << jsonText(result) << "\n";
    } else if (next) {
        context.out() << "next page: " << base64Encode(*next) << "\n";
    }
    return 0;
}

}  // namespace tamber
