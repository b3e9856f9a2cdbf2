#include "cli/ItemAction.h"

#include <memory>
#include <mutex>
#include <optional>
#include <ostream>

#include "cli/ItemArgument.h"
#include "cli/ItemJson.h"
#include "cli/JsonValues.h"
#include "host/PublishedTrees.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

namespace {

// Shared with the completion, which may outlive the wait if the provider calls it late.
template <class T>
struct Outcome {
    std::mutex mutex;
    bool done = false;
    std::optional<T> value;
    DispatchSemaphore finished;

    void deliver(T result) {
        {
            std::lock_guard lock(mutex);
            if (done)
                return;
            done = true;
            value.emplace(std::move(result));
        }
        finished.signal();
    }
    T wait() {
        finished.wait();
        std::lock_guard lock(mutex);
        return std::move(*value);
    }
};

}  // namespace

Result<HostPorterItemIdentifier> ItemAction::identifierFor(LocalPorter& porter,
                                                           const std::string& text) {
    ItemArgument argument = ItemArgument::parse(text);
    if (argument.kind == ItemArgument::Kind::Identifier)
        return argument.identifier;
    if (auto outside = PublishedTrees::check(argument.url); !outside.ok())
        return outside.error();
    auto identifier = porter._persistentIdentifierForItemAt(argument.url);
    if (!identifier)
        return Error::porterErrorForNonExistentItemWithIdentifier(argument.url.path());
    return *identifier;
}

Result<LocalPorter::LocalItemRef> ItemAction::waitForItem(const ItemStarter& start) {
    using ItemResult = Result<LocalPorter::LocalItemRef>;
    auto outcome = std::make_shared<Outcome<ItemResult>>();
    start([outcome](ItemResult item) {
        if (item.ok() && !item.value())
            return outcome->deliver(Error::porterErrorForNonExistentItemWithIdentifier(""));
        outcome->deliver(std::move(item));
    });
    return outcome->wait();
}

Status ItemAction::waitForStatus(const ErrorStarter& start) {
    auto outcome = std::make_shared<Outcome<Status>>();
    start([outcome](Status status) { outcome->deliver(std::move(status)); });
    return outcome->wait();
}

void ItemAction::waitFor(const std::function<void(std::function<void()>)>& start) {
    auto outcome = std::make_shared<Outcome<bool>>();
    start([outcome] { outcome->deliver(true); });
    outcome->wait();
}

int ItemAction::printItem(CliContext& context, const LocalItem& item, bool json) {
    if (json)
        context.out() << jsonText(itemJson(item)) << "\n";
    else
        printItemText(context.out(), item);
    return 0;
}

int ItemAction::finish(CliContext& context, const Result<LocalPorter::LocalItemRef>& item,
                       bool json) {
    if (!item.ok())
        return context.fail(item.error(), json);
    return printItem(context, *item.value(), json);
}

}  // namespace tamber
