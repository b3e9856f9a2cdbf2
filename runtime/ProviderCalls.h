#pragma once

#include <cstddef>
#include <functional>

#include "host/HostPorterExtension.h"
#include "support/Result.h"

namespace tamber {

// Runs one provider operation and waits for its completion, which may come on another thread,
// through one CompletionWaiter: only the first call of a completion counts; a later one (also
// one after the wait ended) is ignored. A completion that gives neither an item nor an error is
// answered as no such item.
class ProviderCalls {
public:
    using ItemStarter = std::function<void(HostPorterExtension::ItemCompletion)>;
    static Result<HostPorterItemRef> waitForItem(const ItemStarter& start);

    using ErrorStarter = std::function<void(HostPorterExtension::ErrorCompletion)>;
    static Status waitForStatus(const ErrorStarter& start);

    using CountStarter = std::function<void(std::function<void(size_t)>)>;
    static size_t waitForCount(const CountStarter& start);

    using DoneStarter = std::function<void(std::function<void()>)>;
    static void waitFor(const DoneStarter& start);
};

}  // namespace tamber
