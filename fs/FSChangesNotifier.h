#pragma once

#include <memory>
#include <string>
#include <vector>

#include "fs/TremorReader.h"
#include "host/HostPorterItemIdentifier.h"

namespace tamber {

// Keeps the browser fresh while nobody enumerates changes: watches some trees from the
// current event on and, after a batch that held a published change, asks the host manager to
// signal the root container (or the working set, for a working-set notifier).
class FSChangesNotifier : public TremorReaderDelegate,
                          public std::enable_shared_from_this<FSChangesNotifier> {
    struct Private {};

public:
    // Null (after an error line) when the volume of the first URL has no event-store UUID. An
    // empty list is fatal.
    static std::shared_ptr<FSChangesNotifier> make(HostPorterItemIdentifier container,
                                                   std::vector<Url> urls);
    FSChangesNotifier(Private, HostPorterItemIdentifier container, TremorReaderRef reader,
                      std::string deviceUUID);

    void start();
    // Stops the reader; the owner calls it before letting the notifier go.
    void stop();

    // Logs "notify changes on <identifier>" and asks the default host manager to signal it.
    static void notifyChangesOnContainer(const HostPorterItemIdentifier& container);

    const HostPorterItemIdentifier& container() const { return container_; }
    const std::string& deviceUUID() const { return deviceUUID_; }
    const TremorReaderRef& reader() const { return reader_; }

    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override;
    void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                         const std::optional<Url>& url) override;
    void readerDidProcessHistory(TremorReader& reader) override;
    void readerMustRescan(TremorReader& reader) override;
    void readerDidFinishBatch(TremorReader& reader) override;

private:
    HostPorterItemIdentifier container_;
    TremorReaderRef reader_;
    std::string deviceUUID_;
    bool shouldSignalChange_ = false;  // touched on the reader's queue only
};

using FSChangesNotifierRef = std::shared_ptr<FSChangesNotifier>;

}  // namespace tamber
