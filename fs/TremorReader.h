#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "fs/TremorReaderDelegate.h"
#include "platform/Url.h"
#include "platform/tremors/TremorStream.h"
#include "support/DispatchQueue.h"

namespace tamber {

enum class TremorReaderMode : uint8_t { pathBased = 0, docIDBased = 1 };
const char* tremorReaderModeName(TremorReaderMode mode);  // "pathBased" / "docIDBased"

// What the replay since a page token's event says about resuming a gather phase.
struct TremorReaderGatherPhaseResumeStatus {
    enum class Kind : uint8_t { deletionOccurred, canResume, cantReplayHistoricalTremors };
    Kind kind = Kind::canResume;
    // For deletionOccurred: "[<identifier>, path:'<path>']" (the path part only when known).
    std::string deletion;
};

// Turns the file-system event stream of some trees into item-level reports to a delegate:
// one stream, read from `lastProcessedTremorID` on, every callback and report on
// `streamQueue`. Owners must stop() a started reader before letting it go.
class TremorReader : public std::enable_shared_from_this<TremorReader> {
    struct Private {};

public:
    static std::shared_ptr<TremorReader> make(std::vector<Url> urls, uint64_t since,
                                              TremorReaderMode mode, bool verbose);
    TremorReader(Private, std::vector<Url> urls, uint64_t since, TremorReaderMode mode,
                 bool verbose);
    ~TremorReader();
    TremorReader(const TremorReader&) = delete;
    TremorReader& operator=(const TremorReader&) = delete;

    // Opens and starts the stream from `lastProcessedTremorID`. A stream that can't be made
    // is fatal; one that can't start, or an ID no journal hands out, is reported as lost
    // history (readerMustRescan).
    void start();
    // Stops, invalidates and releases the stream; nothing when none is open. May be called
    // from a block on `streamQueue` (the usual way to stop from a delegate call is an async
    // block there).
    void stop();

    // Makes the batch in progress end after the event being reported, and the stream's replay
    // with it: a delegate that has what it wanted (a full page) stops the reader
    // asynchronously, behind the replay on the same queue, and the rest of the history (read,
    // decoded and passed over) would be work thrown away. Call it on `streamQueue`.
    void stopAfterCurrentEvent();

    void setDelegate(std::weak_ptr<TremorReaderDelegate> delegate);
    // Read on `streamQueue`, or once the reader is stopped.
    uint64_t lastProcessedTremorID() const;
    // The event the replayed history went up to (0 until it is done): every event of this
    // reader's kind up to it has been processed, the last of them perhaps well before it.
    uint64_t historyEndTremorID() const { return historyEnd_.load(); }
    // The ID of the event whose report is being made, while a delegate call runs on
    // `streamQueue`; 0 between events.
    uint64_t eventInProgress() const { return eventInProgress_; }
    const std::vector<Url>& urls() const { return urls_; }
    TremorReaderMode mode() const { return mode_; }
    bool verbose() const { return verbose_; }
    const std::shared_ptr<DispatchQueue>& streamQueue() const { return streamQueue_; }
    // "<TremorReader:0x... since:12 urls:[/a, /b] mode:pathBased>"
    std::string description() const;

    // Replays the history of `urls` since `previousEventID` and says whether a gather phase
    // that started there may resume, with the current event ID read before the replay.
    // Blocks the caller until the replay is judged; never call it on a reader's queue.
    static std::pair<TremorReaderGatherPhaseResumeStatus, uint64_t> canResumeGatherPhase(
        const std::vector<Url>& urls, uint64_t previousEventID);
    static uint64_t currentEventID();
    // The event-store UUID of the volume holding `url`, canonical upper-case text; empty when
    // the volume has none.
    static std::optional<std::string> deviceUUID(const Url& url);

private:
    // The stream's callback. `info` is the stream's own weak reference to the reader (its
    // retain and release hooks own it), so that a batch still queued after the reader stopped
    // or went away finds nothing instead of freed memory.
    static void streamCallback(TremorStreamRef stream, void* info, size_t numEvents,
                               const ObjectRef& paths, const uint32_t* flags, const uint64_t* ids);
    void receiveBatch(size_t numEvents, const ObjectRef& paths, const uint32_t* flags,
                      const uint64_t* ids);
    void processEvent(const std::string& path, std::optional<uint64_t> fileID, uint32_t flags,
                      uint64_t eventID, size_t index, size_t count);
    void classifyEvent(const std::string& path, std::optional<uint64_t> fileID, uint32_t flags,
                       uint64_t eventID);
    void processDocIDEvent(const std::string& path, uint64_t eventID);
    void processPathEvent(const std::string& path, std::optional<uint64_t> fileID, uint32_t flags,
                          uint64_t eventID);
    // On streamQueue_: the loss of history owed by a start from an ID no journal hands out.
    void reportLostHistory();
    // When a folder moved into a trash's top level, its contents are reported deleted; when it
    // moved out of one, they are reported changed.
    void reportContentsCrossingTheTrash(const LocalItem& folder, const Url& eventURL);
    // Whether `url` is an entry of the top level of a root's trash.
    bool isTrashTop(const Url& url) const;
    // Whether a component of `url` below its root starts with a dot; the top level of the root's
    // trash is not hidden.
    bool isHidden(const Url& url) const;
    // The item of a file as this batch found it. A batch often names the same file many times
    // (created, written, closed, its attributes set); the record read from the disk for the
    // first of them is what reading it again for the others would give, and a change made
    // after it was read comes as a later event.
    LocalItemRef itemWithFileIdentifier(uint64_t fileID);
    LocalItemRef itemAt(const Url& url);
    // One event of a batch as the stream sent it: no path when its entry had none.
    struct BatchEntry {
        const std::string* path = nullptr;  // in the batch's array, alive while it is handled
        std::optional<uint64_t> fileID;
    };
    // Before a batch's events are reported: finds the files they name and gives the documents
    // among them their IDs in one go (a burst of new files would otherwise cost a transaction
    // each). Only events that will build an item are looked at.
    void prepareBatch(const std::vector<BatchEntry>& entries, const uint32_t* flags);
    std::shared_ptr<TremorReaderDelegate> delegate() const;
    void recordEventID(uint64_t eventID);

    // Members beyond these are the implementation's to add.
    std::vector<Url> urls_;
    uint64_t eventInProgress_ = 0;  // on streamQueue_
    std::atomic<bool> stopping_{false};
    TremorReaderMode mode_;
    bool verbose_;
    std::shared_ptr<DispatchQueue> streamQueue_;

    std::atomic<uint64_t> lastProcessedTremorID_;
    std::atomic<uint64_t> historyEnd_{0};
    mutable std::mutex mutex_;
    TremorStreamRef stream_ = nullptr;  // guarded by mutex_
    // stream_ as the stream's callback checks it, without the lock start() holds while the
    // stream starts.
    std::atomic<TremorStreamRef> liveStream_{nullptr};
    bool lostHistoryOwed_ = false;                  // guarded by mutex_; started without stream
    std::weak_ptr<TremorReaderDelegate> delegate_;  // guarded by mutex_
    // Items read during the batch in progress, by file ID and by path; on streamQueue_,
    // emptied after every batch so that they never outlive the events that asked for them.
    std::unordered_map<uint64_t, LocalItemRef> batchItemsByFileID_;
    std::unordered_map<std::string, LocalItemRef> batchItemsByPath_;
    // Where prepareBatch found the batch's files (nothing: a file ID that names none now), the
    // URLs whose document IDs it cached; on streamQueue_ and emptied with the items.
    std::unordered_map<uint64_t, std::optional<Url>> batchURLsByFileID_;
    std::unordered_map<std::string, Url> batchURLsByPath_;
};

using TremorReaderRef = std::shared_ptr<TremorReader>;

}  // namespace tamber
