#include "server/ReplicaSync.h"

#include <cerrno>

#include "host/HostPorterItemIdentifier.h"
#include "runtime/CompletionWaiter.h"
#include "runtime/PageCollector.h"
#include "support/Log.h"

namespace tamber {

namespace {

// A catch-up that failed (the provider could not answer) is tried again after this long,
// unless a signal comes first.
constexpr auto kRetryAfterFailure = std::chrono::seconds(5);
// How often a wait for the provider looks whether the catch-up is to be abandoned.
constexpr double kStopPollSeconds = 0.2;

Error abandoned() {
    return Error::posix(ECANCELED);
}

bool isExpired(const Status& status) {
    return !status.ok() && status.error().is(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired);
}

}  // namespace

ReplicaSync::ReplicaSync(std::shared_ptr<HostPorterExtension> provider, Sink& sink, Hooks hooks)
    : provider_(std::move(provider)), sink_(sink), hooks_(std::move(hooks)) {}

ReplicaSync::~ReplicaSync() {
    stop();
}

void ReplicaSync::start() {
    MutexLock lock(mutex_);
    if (started_ || stopping_)
        return;
    started_ = true;
    pending_ = true;
    thread_ = std::thread([this] { run(); });
}

void ReplicaSync::signal() {
    {
        MutexLock lock(mutex_);
        pending_ = true;
    }
    changed_.notify_all();
}

bool ReplicaSync::waitUntilReady(std::chrono::milliseconds timeout) {
    MutexLock lock(mutex_);
    changed_.wait_for(lock.native(), timeout, [&] {
        mutex_.assertHeld();
        return caughtUpOnce_ || stopping_;
    });
    return caughtUpOnce_;
}

bool ReplicaSync::ready() {
    MutexLock lock(mutex_);
    return caughtUpOnce_ && !catchingUp_;
}

bool ReplicaSync::catchingUp() {
    MutexLock lock(mutex_);
    return catchingUp_;
}

uint64_t ReplicaSync::catchUps() {
    MutexLock lock(mutex_);
    return catchUps_;
}

void ReplicaSync::stop() {
    HostPorterEnumeratorRef enumerator;
    {
        MutexLock lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    if (thread_.joinable())
        thread_.join();
    {
        MutexLock lock(mutex_);
        enumerator = std::move(enumerator_);
    }
    if (enumerator)
        enumerator->invalidate();
}

bool ReplicaSync::shouldGoOn() {
    {
        MutexLock lock(mutex_);
        if (stopping_)
            return false;
    }
    return !hooks_.beforeBatch || hooks_.beforeBatch();
}

void ReplicaSync::run() {
    bool retry = false;
    for (;;) {
        {
            MutexLock lock(mutex_);
            auto wake = [&] {
                mutex_.assertHeld();
                return pending_ || stopping_;
            };
            if (retry)
                changed_.wait_for(lock.native(), kRetryAfterFailure, wake);
            else
                changed_.wait(lock.native(), wake);
            if (stopping_)
                return;
            // Signals that come from here on ask for one more catch-up after this one.
            pending_ = false;
            catchingUp_ = true;
            ++catchUps_;
        }
        changed_.notify_all();
        if (hooks_.catchUpStarted)
            hooks_.catchUpStarted();
        Status status = catchUp();
        if (!status.ok() && !status.error().is(kPosixErrorDomain, ECANCELED))
            logError("replica catch-up failed; " + status.error().description());
        {
            MutexLock lock(mutex_);
            catchingUp_ = false;
            if (status.ok())
                caughtUpOnce_ = true;
            retry = !status.ok();
        }
        changed_.notify_all();
    }
}

Result<HostPorterEnumeratorRef> ReplicaSync::enumerator() {
    {
        MutexLock lock(mutex_);
        if (enumerator_)
            return enumerator_;
    }
    auto made = provider_->enumeratorForContainerItemIdentifier(
        HostPorterWorkingSetContainerItemIdentifier);
    if (!made.ok())
        return made.error();
    MutexLock lock(mutex_);
    enumerator_ = made.value();
    return enumerator_;
}

Status ReplicaSync::catchUp() {
    auto made = enumerator();
    if (!made.ok())
        return made.error();
    HostPorterEnumerator& working = *made.value();
    auto stored = sink_.storedAnchor();
    if (!stored.ok())
        return stored.error();
    if (stored.value()) {
        Status status = changesSince(working, *stored.value());
        if (!isExpired(status))
            return status;
        logInfo("replica anchor expired; listing the working set again");
        sink_.anchorExpired();
    }
    return listEverything(working);
}

Result<HostPorterSyncAnchor> ReplicaSync::currentAnchor(HostPorterEnumerator& working) {
    auto waiter = std::make_shared<CompletionWaiter<std::optional<HostPorterSyncAnchor>>>();
    working.currentSyncAnchorWithCompletionHandler(
        [waiter](std::optional<HostPorterSyncAnchor> anchor) {
            waiter->finish(std::move(anchor));
        });
    for (;;) {
        if (auto anchor = waiter->waitFor(kStopPollSeconds)) {
            if (!*anchor)
                return Error::syncAnchorExpired();
            return std::move(**anchor);
        }
        MutexLock lock(mutex_);
        if (stopping_)
            return abandoned();
    }
}

Status ReplicaSync::listEverything(HostPorterEnumerator& working, bool mayListAgain) {
    // The anchor comes first: what changes while the pages are read is caught up after.
    auto anchor = currentAnchor(working);
    if (!anchor.ok())
        return anchor.error();
    std::vector<HostPorterItemRef> items;
    HostPorterPage page = HostPorterInitialPageSortedByName();
    for (;;) {
        if (!shouldGoOn())
            return abandoned();
        auto collector = std::make_shared<PageCollector>();
        working.enumerateItemsForObserver(collector, page);
        PageCollector::Page listed = collector->wait();
        if (listed.error)
            return *listed.error;
        items.insert(items.end(), listed.items.begin(), listed.items.end());
        if (!listed.nextPage)
            break;
        page = std::move(*listed.nextPage);
    }
    if (Status s = sink_.replaceAll(items, anchor.value()); !s.ok())
        return s;
    logInfo("replica listed " + std::to_string(items.size()) + " items of the working set");
    return changesSince(working, std::move(anchor).value(), mayListAgain);
}

Status ReplicaSync::changesSince(HostPorterEnumerator& working, HostPorterSyncAnchor anchor,
                                 bool mayList) {
    bool newLibrary = false;
    for (;;) {
        if (!shouldGoOn())
            return abandoned();
        auto collector = std::make_shared<ChangeCollector>();
        working.enumerateChangesForObserver(collector, anchor);
        std::optional<ChangeCollector::Batch> batch;
        while (!(batch = collector->waitFor(kStopPollSeconds))) {
            MutexLock lock(mutex_);
            if (stopping_)
                return abandoned();
        }
        if (batch->error)
            return *batch->error;
        if (!batch->anchor)
            return Error::syncAnchorExpired();
        auto applied = sink_.apply(*batch);
        if (!applied.ok())
            return applied.error();
        newLibrary = newLibrary || applied.value();
        if (!batch->moreComing)
            break;
        anchor = *batch->anchor;
    }
    if (!newLibrary || !mayList)
        return Status::OK();
    logInfo("an app library appeared; listing the working set again");
    return listEverything(working, false);
}

}  // namespace tamber
