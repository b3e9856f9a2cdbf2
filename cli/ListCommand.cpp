#include "cli/ListCommand.h"

#include <memory>
#include <ostream>

#include "cli/ContainerArgument.h"
#include "cli/TextEscape.h"
#include "runtime/Base64.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"
#include "runtime/PageCollector.h"

namespace tamber {

CLI::App* ListCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("ls", "List a container one page (200 items) at a time");
    sub->add_option("ID", container_,
                    "A folder's identifier or path, or root, working-set, all-directories")
        ->required();
    sub->add_option("--page", page_, "Continue from this page token (base64, from a previous ls)");
    sub->add_flag("--all", all_, "List every page, not just one");
    addJsonFlag(sub, R"(Print {"items": [...], "nextPage": TOKEN or null})");
    return sub;
}

int ListCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    HostPorterPage page = HostPorterInitialPageSortedByName();
    if (!page_.empty()) {
        auto decoded = base64Decode(page_);
        if (!decoded)
            return fail(context, CliContext::usageError("--page is not base64: " + page_));
        page = *decoded;
    }
    auto container = ContainerArgument::resolve(provider, container_);
    if (!container.ok())
        return fail(context, container.error());
    auto enumerator = container.value().enumerator;

    std::vector<HostPorterItemRef> items;
    std::optional<HostPorterPage> next;
    size_t pages = 0;
    for (;;) {
        auto collector = std::make_shared<PageCollector>();
        enumerator->enumerateItemsForObserver(collector, page);
        PageCollector::Page listed = collector->wait();
        if (listed.error) {
            enumerator->invalidate();
            return fail(context, *listed.error);
        }
        for (auto& item : listed.items) {
            if (!item)
                continue;
            if (json_) {
                items.push_back(std::move(item));
            } else {
                context.out() << escapedText(item->itemIdentifier()) << "\t"
                              << escapedText(item->filename()) << "\t" << item->typeIdentifier()
                              << "\n";
            }
        }
        next = listed.nextPage;
        ++pages;
        if (!all_ || !next)
            break;
        if (pages % 50 == 0 && !json_)
            context.err() << "tamber: listed " << pages << " pages\n";
        page = *next;
    }
    enumerator->invalidate();
    if (json_)
        context.out() << jsonText(HostJson::page(items, next)) << "\n";
    else if (next)
        context.out() << "next page: " << base64Encode(*next) << "\n";
    return 0;
}

}  // namespace tamber
