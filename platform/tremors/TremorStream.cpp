#include "platform/tremors/TremorStream.h"

#include <algorithm>
#include <chrono>
#include <map>
#include <utility>

#include "platform/objects/Array.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

std::shared_ptr<TremorStream> TremorStream::create(std::shared_ptr<TremorService> service,
                                                   Options options) {
    if (!service || (!options.callback && !options.events) || options.paths.empty())
        return nullptr;
    for (auto& path : options.paths) path = WatchedRoots::normalised(path);
    if (options.context.retain && options.context.info)
        options.context.info = options.context.retain(options.context.info);
    return std::make_shared<TremorStream>(std::move(service), std::move(options));
}

TremorStream::TremorStream(std::shared_ptr<TremorService> service, Options options)
    : service_(std::move(service)), options_(std::move(options)) {}

TremorStream::~TremorStream() {
    if (options_.context.release && options_.context.info)
        options_.context.release(options_.context.info);
}

void TremorStream::setDispatchQueue(std::shared_ptr<DispatchQueue> queue) {
    MutexLock lock(mutex_);
    queue_ = std::move(queue);
}

bool TremorStream::start() {
    bool first;
    {
        MutexLock lock(mutex_);
        if (running_ || invalidated_ || !queue_)
            return false;
        first = !everStarted_;
    }
    std::shared_ptr<TremorService> service = service_.lock();
    if (!service)
        return false;
    if (first && options_.device) {
        if (!service->storeForDevice(*options_.device)) {
            logError("No watched tree on device " + std::to_string(*options_.device));
            return false;
        }
        device_ = *options_.device;
    } else if (first) {
        for (const auto& path : options_.paths) {
            // A stream for a tree nobody watched yet makes the service watch it.
            if (auto status = service->watchTree(path); !status.ok()) {
                logError("Cannot watch " + path + ": " + status.error().description());
                return false;
            }
        }
        device_ = service->deviceForPath(options_.paths.front()).value_or(0);
    }
    TremorStore* store = service->storeForDevice(device_);
    if (!store)
        return false;
    service->catchUp();  // what completed before the start is in the history
    std::weak_ptr<TremorStream> weak = weak_from_this();
    uint64_t token =
        service->addListener([weak](uint32_t device, const std::vector<JournalEvent>& events) {
            if (auto self = weak.lock())
                self->onAppended(device, events);
        });
    uint64_t ceiling = store->lastEventId();
    std::shared_ptr<DispatchQueue> queue;
    uint64_t since;
    uint64_t run;
    bool replaying;
    {
        MutexLock lock(mutex_);
        if (first) {
            everStarted_ = true;
            historyOwed_ = options_.since != kSinceNow;
            position_ = historyOwed_ ? options_.since : ceiling;
        }
        since = position_;
        running_ = true;
        run = ++run_;
        listener_ = token;
        ceiling_ = ceiling;
        replaying_ = historyOwed_ || since < ceiling;
        replaying = replaying_;
        queue = queue_;
        // Live events heard before the ceiling was read are in the history already.
        std::erase_if(live_, [&](const JournalEvent& e) { return e.id <= ceiling; });
    }
    auto self = shared_from_this();
    if (replaying)
        queue->async([self, since, ceiling, run] { self->replay(since, ceiling, run); });
    return true;
}

bool TremorStream::matches(const JournalEvent& event) const {
    for (const auto& path : options_.paths) {
        if (WatchedRoots::isAtOrBelow(event.path, path))
            return true;
    }
    return false;
}

void TremorStream::onAppended(uint32_t device, const std::vector<JournalEvent>& events) {
    if (device != device_)
        return;
    MutexLock lock(mutex_);
    if (!running_)
        return;
    for (const auto& event : events) {
        if (event.id > ceiling_ && matches(event))
            live_.push_back(event);
    }
    if (!replaying_ && !live_.empty())
        scheduleFlush();
}

void TremorStream::replay(uint64_t since, uint64_t ceiling, uint64_t run) {
    std::shared_ptr<TremorService> service = service_.lock();
    if (!service)
        return;
    TremorStore* store = service->storeForDevice(device_);
    if (!store)
        return;
    auto check = store->replayability(since, options_.paths);
    if (!check.complete) {
        // Lost history is never hidden: the client rescans.
        logInfo("Replay for a stream is incomplete: " + check.reason);
        if (!deliver({{0, options_.paths.front(), 0, kTremorUserDropped | kTremorMustScanSubdirs}},
                     run))
            return;
    }
    std::vector<JournalEvent> batch;
    size_t batchSize = kFirstReplayBatch;
    bool going = true;
    auto status =
        store->replay(since, options_.paths, kReplayBatch, [&](const JournalEvent& event) {
            if (event.id > ceiling)
                return false;  // it comes live
            batch.push_back(event);
            if (batch.size() >= batchSize) {
                going = deliver(batch, run);
                batch.clear();
                batchSize = std::min(batchSize * 2, kReplayBatch);
            }
            return going;
        });
    if (!status.ok())
        logError("Replay failed: " + status.error().description());
    if (!going || !deliver(batch, run))
        return;
    bool owed;
    {
        MutexLock lock(mutex_);
        owed = historyOwed_;
    }
    if (owed && !deliver({{ceiling, options_.paths.front(), 0, kTremorHistoryDone}}, run))
        return;
    MutexLock lock(mutex_);
    if (run != run_)
        return;
    replaying_ = false;
    position_ = std::max(position_, ceiling);
    if (!live_.empty())
        scheduleFlush();
}

void TremorStream::scheduleFlush() {
    if (flushScheduled_ || !queue_)
        return;
    flushScheduled_ = true;
    auto due = lastDelivery_ + std::chrono::duration_cast<DispatchQueue::Clock::duration>(
                                   std::chrono::duration<double>(options_.latency));
    auto self = shared_from_this();
    uint64_t run = run_;
    queue_->asyncAt(std::max(due, DispatchQueue::Clock::now()), [self, run] { self->flush(run); });
}

void TremorStream::flush(uint64_t run) {
    std::vector<JournalEvent> events;
    {
        MutexLock lock(mutex_);
        if (run != run_)
            return;
        flushScheduled_ = false;
        if (replaying_)
            return;  // the replay's end flushes them, after the history
        events = std::move(live_);
        live_.clear();
    }
    deliver(events, run);
}

bool TremorStream::deliver(const std::vector<JournalEvent>& events, uint64_t run) {
    {
        MutexLock lock(mutex_);
        if (!running_ || run != run_)
            return false;
        if (events.empty())
            return true;
        lastDelivery_ = DispatchQueue::Clock::now();
        // Counted as delivered now: a stop from here on no longer keeps the call from happening.
        for (const auto& event : events) {
            position_ = std::max(position_, event.id);  // 0 for a lost-history notice
            if (event.flags & kTremorHistoryDone)
                historyOwed_ = false;
        }
    }
    if (options_.events) {
        options_.events(events);
        return true;
    }
    bool extended = (options_.flags & kTremorCreateUseExtendedData) != 0;
    std::vector<ObjectRef> paths;
    std::vector<uint32_t> flags;
    std::vector<uint64_t> ids;
    for (const auto& event : events) {
        if (extended) {
            std::map<std::string, ObjectRef> entry{{"path", String::make(event.path)}};
            if (event.fileID != 0)
                entry["fileID"] = Number::fromUInt64(event.fileID);
            paths.push_back(Dictionary::make(std::move(entry)));
        } else {
            paths.push_back(String::make(event.path));
        }
        flags.push_back(event.flags);
        ids.push_back(event.id);
    }
    ObjectRef array = Array::make(std::move(paths));
    options_.callback(this, options_.context.info, events.size(), array, flags.data(), ids.data());
    return true;
}

void TremorStream::stop() {
    uint64_t token = 0;
    {
        MutexLock lock(mutex_);
        running_ = false;
        ++run_;
        replaying_ = false;
        flushScheduled_ = false;
        token = listener_;
        listener_ = 0;
        live_.clear();  // not delivered: a restart replays them
    }
    if (auto service = service_.lock(); token && service)
        service->removeListener(token);
}

void TremorStream::invalidate() {
    stop();
    MutexLock lock(mutex_);
    invalidated_ = true;
    queue_.reset();
}

void TremorStream::releaseHandle() {
    stop();
    handle_.reset();
}

}  // namespace tamber
