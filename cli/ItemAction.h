#pragma once

#include <functional>
#include <string>

#include "cli/CliContext.h"
#include "provider/LocalPorter.h"
#include "support/Result.h"

namespace tamber {

// What the verbs that act on items share: turning an ID argument into an identifier, waiting
// for a provider completion (which may run on another thread), and printing the result.
class ItemAction {
public:
    // The identifier an ID argument names: identifiers and container words as they are, a
    // path through the provider. A path the provider does not know is no such item.
    static Result<HostPorterItemIdentifier> identifierFor(LocalPorter& porter,
                                                          const std::string& text);

    // Starts an operation and waits for its completion. Only the first call of the completion
    // counts; a later one (or one after the wait ended) is ignored.
    using ItemStarter = std::function<void(LocalPorter::ItemCompletion)>;
    static Result<LocalPorter::LocalItemRef> waitForItem(const ItemStarter& start);
    using ErrorStarter = std::function<void(LocalPorter::ErrorCompletion)>;
    static Status waitForStatus(const ErrorStarter& start);
    static void waitFor(const std::function<void(std::function<void()>)>& start);

    // Prints the item as `tamber item` does (with `json`, exactly its JSON); returns 0.
    static int printItem(CliContext& context, const LocalItem& item, bool json);
    // Prints a successful operation's item, or fails with its error.
    static int finish(CliContext& context, const Result<LocalPorter::LocalItemRef>& item,
                      bool json);
};

}  // namespace tamber
