#include "runtime/ProviderCalls.h"

#include <memory>

#include "runtime/CompletionWaiter.h"

namespace tamber {

Result<HostPorterItemRef> ProviderCalls::waitForItem(const ItemStarter& start) {
    using ItemResult = Result<HostPorterItemRef>;
    auto waiter = std::make_shared<CompletionWaiter<ItemResult>>();
    start([waiter](HostPorterItemRef item, std::optional<Error> error) {
        if (error)
            waiter->finish(*error);
        else if (!item)
            waiter->finish(Error::porterErrorForNonExistentItemWithIdentifier(""));
        else
            waiter->finish(std::move(item));
    });
    return waiter->wait();
}

Status ProviderCalls::waitForStatus(const ErrorStarter& start) {
    auto waiter = std::make_shared<CompletionWaiter<Status>>();
    start([waiter](std::optional<Error> error) { waiter->finish(std::move(error)); });
    return waiter->wait();
}

size_t ProviderCalls::waitForCount(const CountStarter& start) {
    auto waiter = std::make_shared<CompletionWaiter<size_t>>();
    start([waiter](size_t count) { waiter->finish(count); });
    return waiter->wait();
}

void ProviderCalls::waitFor(const DoneStarter& start) {
    auto waiter = std::make_shared<CompletionWaiter<bool>>();
    start([waiter] { waiter->finish(true); });
    waiter->wait();
}

}  // namespace tamber
