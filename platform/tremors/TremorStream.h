#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/objects/Object.h"
#include "platform/tremors/JournalEvent.h"
#include "support/DispatchQueue.h"
#include "support/Mutex.h"

namespace tamber {

class TremorService;
class TremorStream;
using TremorStreamRef = TremorStream*;

struct TremorStreamContext {
    void* info = nullptr;
    void* (*retain)(void*) = nullptr;
    void (*release)(void*) = nullptr;
};

using TremorStreamCallback = void (*)(TremorStreamRef stream, void* info, size_t numEvents,
                                      const ObjectRef& paths, const uint32_t* flags,
                                      const uint64_t* ids);

// One client's view of the journal: the events after its since-when ID under its paths, then
// one history-done event, then live events, delivered on its queue in batches at most once per
// latency. It listens before it replays, so that nothing falls between the two and nothing
// arrives twice.
//
// Stopped and started again, it goes on after the last event it delivered: what was journaled
// meanwhile is replayed (the history-done event is not sent twice), then live events follow.
class TremorStream : public std::enable_shared_from_this<TremorStream> {
public:
    static constexpr uint64_t kSinceNow = UINT64_MAX;
    static constexpr size_t kReplayBatch = 1000;
    // The first replayed batch is smaller, and each one after it twice as large up to
    // kReplayBatch: a client that stops after a page of changes has not had the journal read
    // and decoded far past it.
    static constexpr size_t kFirstReplayBatch = 250;

    // The typed form of the callback, for the program's own consumers of the journal.
    using EventsCallback = std::function<void(const std::vector<JournalEvent>& events)>;

    struct Options {
        TremorStreamCallback callback = nullptr;
        EventsCallback events;  // used instead of `callback` when set
        TremorStreamContext context;
        std::vector<std::string> paths;  // absolute, or relative to `device`
        std::optional<uint32_t> device;  // set for streams relative to a device
        uint64_t since = kSinceNow;
        double latency = 0;
        uint32_t flags = 0;
    };

    static std::shared_ptr<TremorStream> create(std::shared_ptr<TremorService> service,
                                                Options options);
    TremorStream(std::shared_ptr<TremorService> service, Options options);
    ~TremorStream();
    TremorStream(const TremorStream&) = delete;
    TremorStream& operator=(const TremorStream&) = delete;

    void setDispatchQueue(std::shared_ptr<DispatchQueue> queue);
    bool start();
    void stop();
    void invalidate();

    // The handle given to callers holds the stream until they release it.
    void retainHandle(std::shared_ptr<TremorStream> self) { handle_ = std::move(self); }
    void releaseHandle();

private:
    bool matches(const JournalEvent& event) const;
    void onAppended(uint32_t device, const std::vector<JournalEvent>& events);
    void replay(uint64_t since, uint64_t ceiling, uint64_t run);
    void scheduleFlush() REQUIRES(mutex_);
    void flush(uint64_t run);
    // Calls the client unless the run is over; false when it is.
    bool deliver(const std::vector<JournalEvent>& events, uint64_t run);

    // Not owned: a stream its client never released must not keep a stopped journal (its
    // databases and their lock) alive. Once the service is gone the stream does nothing.
    const std::weak_ptr<TremorService> service_;
    Options options_;
    std::shared_ptr<TremorStream> handle_;

    // Set by the first start before the listener is added, read-only afterwards.
    uint32_t device_ = 0;

    Mutex mutex_;
    std::shared_ptr<DispatchQueue> queue_ GUARDED_BY(mutex_);
    bool everStarted_ GUARDED_BY(mutex_) = false;
    bool running_ GUARDED_BY(mutex_) = false;
    bool invalidated_ GUARDED_BY(mutex_) = false;
    bool replaying_ GUARDED_BY(mutex_) = false;
    // The history-done event is still to be sent.
    bool historyOwed_ GUARDED_BY(mutex_) = false;
    bool flushScheduled_ GUARDED_BY(mutex_) = false;
    // Each start and stop begins a new run; work queued by an earlier run then does nothing.
    uint64_t run_ GUARDED_BY(mutex_) = 0;
    // Replayed up to here; live events start after it.
    uint64_t ceiling_ GUARDED_BY(mutex_) = 0;
    // Every event up to here was delivered or passed over.
    uint64_t position_ GUARDED_BY(mutex_) = 0;
    uint64_t listener_ GUARDED_BY(mutex_) = 0;
    std::vector<JournalEvent> live_ GUARDED_BY(mutex_);
    DispatchQueue::Clock::time_point lastDelivery_ GUARDED_BY(mutex_){};
};

}  // namespace tamber
