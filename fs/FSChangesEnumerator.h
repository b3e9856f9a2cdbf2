#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "fs/FSChangeToken.h"
#include "fs/TremorReader.h"
#include "host/HostPorterChangeObserver.h"
#include "support/Mutex.h"

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

    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override;
    void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                         const std::optional<Url>& url) override;
    void readerDidProcessHistory(TremorReader& reader) override;
    void readerMustRescan(TremorReader& reader) override;
    void readerDidFinishBatch(TremorReader& reader) override;

private:
    // What the gate decided for one change that passed the filters.
    struct Passage {
        bool send = false;                               // new for the host: forward it
        std::optional<HostPorterSyncAnchor> pageAnchor;  // it filled the page: close with this
        TremorReaderRef reader;  // the reader to stop when the page is closed
    };
    // Counts a change and decides, in one step, whether it is sent and whether it closes a page.
    Passage pass();
    void forwardUpdate(const LocalItemRef& item, const std::optional<Url>& url);
    void forwardDeletion(const HostPorterItemIdentifier& identifier);
    bool pageIsFull() const REQUIRES(mutex_);
    // Whether a report comes from the reader of the current pass of an unfinished request.
    bool accepts(const TremorReader& reader) const;
    void reportLibraryRootDeletion(const Url& url);
    TremorReaderRef currentReader() const;
    static void stopAsync(TremorReader& reader);

    // The counters and the token are changed on the current reader's queue; the lock keeps a
    // late task of an earlier pass and the owner's stop() from racing with it.
    mutable Mutex mutex_;
    // No report is forwarded after the request finished.
    bool finished_ GUARDED_BY(mutex_) = false;
    // Checks of vanished folders queued for later on the reader's queue: their changes come
    // after other events', so a page they touch has no single event to resume from.
    uint64_t deferredChecks_ GUARDED_BY(mutex_) = 0;
    FSChangeToken currentToken_ GUARDED_BY(mutex_);
    uint64_t numberOfChanges_ GUARDED_BY(mutex_) = 0;
    // Set once at construction, read-only afterwards.
    const HostPorterItemIdentifier container_;
    const std::vector<Url> urls_;
    const std::shared_ptr<HostPorterChangeObserver> observer_;
    const uint64_t sinceTremorID_;
    TremorReaderRef reader_ GUARDED_BY(mutex_);
    bool shouldProcessedTremorsDocIDBased_ GUARDED_BY(mutex_) = true;
    uint64_t maxTremorID_ GUARDED_BY(mutex_);
};

using FSChangesEnumeratorRef = std::shared_ptr<FSChangesEnumerator>;

}  // namespace tamber
