#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "fs/FSChangeToken.h"
#include "fs/TremorReader.h"
#include "host/HostPorterChangeObserver.h"

namespace tamber {

// Answers one request for the changes since an anchor: replays the history from the anchor's
// event ID twice (path-based, then document-ID-based), sends each change to `observer` at once,
// and closes with a new anchor, or with more coming after 200 changes (the anchor's offset then
// says how many of this history the host already has).
class FSChangesEnumerator : public TremorReaderDelegate,
                            public std::enable_shared_from_this<FSChangesEnumerator> {
    struct Private {};

public:
    static constexpr uint64_t kPageSize = 200;

    // An empty URL list is fatal.
    static std::shared_ptr<FSChangesEnumerator> make(
        FSChangeToken token, HostPorterItemIdentifier container, std::vector<Url> urls,
        std::shared_ptr<HostPorterChangeObserver> observer);
    FSChangesEnumerator(Private, FSChangeToken token, HostPorterItemIdentifier container,
                        std::vector<Url> urls, std::shared_ptr<HostPorterChangeObserver> observer);

    void start();
    void stop();

    uint64_t numberOfChanges() const { return numberOfChanges_; }
    void setNumberOfChanges(uint64_t value) { numberOfChanges_ = value; }
    const HostPorterItemIdentifier& container() const { return container_; }
    const std::shared_ptr<HostPorterChangeObserver>& observer() const { return observer_; }
    bool shouldProcessedTremorsDocIDBased() const { return shouldProcessedTremorsDocIDBased_; }
    void setShouldProcessedTremorsDocIDBased(bool value) {
        shouldProcessedTremorsDocIDBased_ = value;
    }
    uint64_t sinceTremorID() const { return sinceTremorID_; }
    uint64_t maxTremorID() const { return maxTremorID_; }
    void setMaxTremorID(uint64_t value) { maxTremorID_ = value; }

    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override;
    void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                         const std::optional<Url>& url) override;
    void readerDidProcessHistory(TremorReader& reader) override;
    void readerMustRescan(TremorReader& reader) override;
    void readerDidFinishBatch(TremorReader& reader) override;

private:
    FSChangeToken currentToken_;
    uint64_t numberOfChanges_ = 0;
    HostPorterItemIdentifier container_;
    std::vector<Url> urls_;
    TremorReaderRef reader_;
    std::shared_ptr<HostPorterChangeObserver> observer_;
    bool shouldProcessedTremorsDocIDBased_ = true;
    uint64_t sinceTremorID_;
    uint64_t maxTremorID_;
};

using FSChangesEnumeratorRef = std::shared_ptr<FSChangesEnumerator>;

}  // namespace tamber
