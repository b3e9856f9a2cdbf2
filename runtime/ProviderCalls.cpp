#include "runtime/ProviderCalls.h"

#include <memory>

#include "runtime/CompletionWaiter.h"

namespace tamber {

Result<HostPorterItemRef> ProviderCalls::waitForItem(const ItemStarter& start) {
    using ItemResult = Result<HostPorterItemRef>;
    auto waiter = std::make_shared<CompletionWaiter<ItemResult>>();
    start([waiter](Result<HostPorterItemRef> item) {
        if (!item.ok()) {
            waiter->finish(item.error());
            return;
        }
        HostPorterItemRef value = item.value();
        if (!value)  // a provider's bug: no item and no error
            waiter->finish(Error::porterErrorForNonExistentItemWithIdentifier(""));
        else
            waiter->finish(ItemResult(std::move(value)));
    });
    return waiter->wait();
}

Status ProviderCalls::waitForStatus(const ErrorStarter& start) {
    auto waiter = std::make_shared<CompletionWaiter<Status>>();
    start([waiter](Status status) { waiter->finish(std::move(status)); });
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
