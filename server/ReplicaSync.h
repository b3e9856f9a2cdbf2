#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterExtension.h"
#include "host/HostPorterItem.h"
#include "host/HostPorterPage.h"
#include "runtime/ChangeCollector.h"
#include "support/Mutex.h"
#include "support/MutexLock.h"
#include "support/Result.h"

namespace tamber {

// The replica's catch-up thread: it asks the provider's working set for the changes since the
// replica's anchor until no more are coming, or lists the whole working set when there is no
// anchor or the provider says it expired, and hands what it got to its sink one batch at a
// time. Signals coalesce: however many arrive during a catch-up, one more follows it.
//
// It talks to the provider only through the host interface, and holds no lock of its own while
// the provider works, so that the provider may call the host back (index deletions) from the
// thread this one waits on.
class ReplicaSync {
public:
    // Where a catch-up writes: each call is one committed transaction.
    class Sink {
    public:
        virtual ~Sink() = default;
        virtual Result<std::optional<HostPorterSyncAnchor>> storedAnchor() = 0;
        virtual Status replaceAll(const std::vector<HostPorterItemRef>& items,
                                  const HostPorterSyncAnchor& anchor) = 0;
        // True when the batch brought an app library the replica did not hold: its files
        // predate the anchor, so no change will ever report them.
        virtual Result<bool> apply(const ChangeCollector::Batch& batch) = 0;
        // The provider refused the stored anchor: the replica is listed again.
        virtual void anchorExpired() = 0;
    };
    // For tests: watch catch-ups start, and abandon one between batches (false) as a crash or a
    // shutdown would.
    struct Hooks {
        std::function<void()> catchUpStarted;
        std::function<bool()> beforeBatch;
    };

    ReplicaSync(std::shared_ptr<HostPorterExtension> provider, Sink& sink, Hooks hooks = {});
    ~ReplicaSync();
    ReplicaSync(const ReplicaSync&) = delete;
    ReplicaSync& operator=(const ReplicaSync&) = delete;

    // Starts the thread and the first catch-up. Later calls change nothing.
    void start();
    // Schedules a catch-up: the next one, or one more after the one running.
    void signal();
    // Waits until the first catch-up is done; false when `timeout` passed first or it stopped.
    bool waitUntilReady(std::chrono::milliseconds timeout);
    bool ready();
    bool catchingUp();
    // Catch-ups run so far (finished or abandoned).
    uint64_t catchUps();
    // Abandons the catch-up between batches, joins the thread and lets the enumerator go.
    // Harmless to call twice.
    void stop();

private:
    void run();
    // One catch-up; an error leaves the replica at its last committed batch.
    Status catchUp();
    Result<HostPorterEnumeratorRef> enumerator();
    Result<HostPorterSyncAnchor> currentAnchor(HostPorterEnumerator& enumerator);
    // Lists the working set from its first page; nothing when abandoned.
    Status listEverything(HostPorterEnumerator& enumerator, bool mayListAgain = true);
    // Catches up from `anchor` until no more are coming; the expired error when it is. Lists
    // everything again (once) when an app library appeared, so that its files are held too.
    Status changesSince(HostPorterEnumerator& enumerator, HostPorterSyncAnchor anchor,
                        bool mayList = true);
    bool shouldGoOn();

    const std::shared_ptr<HostPorterExtension> provider_;
    Sink& sink_;
    const Hooks hooks_;

    Mutex mutex_;
    std::condition_variable changed_;
    bool started_ GUARDED_BY(mutex_) = false;
    bool stopping_ GUARDED_BY(mutex_) = false;
    bool pending_ GUARDED_BY(mutex_) = false;
    bool catchingUp_ GUARDED_BY(mutex_) = false;
    bool caughtUpOnce_ GUARDED_BY(mutex_) = false;
    uint64_t catchUps_ GUARDED_BY(mutex_) = 0;
    // Kept for the whole run: its change notifier is what signals the replica.
    HostPorterEnumeratorRef enumerator_ GUARDED_BY(mutex_);
    std::thread thread_;
};

}  // namespace tamber
