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

namespace tamber {

std::shared_ptr<TremorStream> TremorStream::create(std::shared_ptr<TremorService> service,
                                                   Options options) {
    if (!service || !options.callback || options.paths.empty())
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
    std::lock_guard lock(mutex_);
    queue_ = std::move(queue);
}

bool TremorStream::start() {
    {
        std::lock_guard lock(mutex_);
        if (started_ || invalidated_ || !queue_)
            return false;
    }
    if (options_.device) {
        device_ = *options_.device;
        if (!service_->storeForDevice(device_)) {
            logError("No watched tree on device " + std::to_string(device_));
            return false;
        }
    } else {
        for (const auto& path : options_.paths) {
            // A stream for a tree nobody watched yet makes the service watch it.
            if (auto error = service_->watchTree(path)) {
                logError("Cannot watch " + path + ": " + error->description());
                return false;
            }
        }
        device_ = service_->deviceForPath(options_.paths.front()).value_or(0);
    }
    TremorStore* store = service_->storeForDevice(device_);
    if (!store)
        return false;
    service_->sync();  // what completed before the start is in the history
    std::weak_ptr<TremorStream> weak = weak_from_this();
    uint64_t token =
        service_->addListener([weak](uint32_t device, const std::vector<JournalEvent>& events) {
            if (auto self = weak.lock())
                self->onAppended(device, events);
        });
    uint64_t ceiling = store->lastEventId();
    std::shared_ptr<DispatchQueue> queue;
    {
        std::lock_guard lock(mutex_);
        started_ = true;
        listener_ = token;
        ceiling_ = ceiling;
        replaying_ = options_.since != kSinceNow;
        queue = queue_;
        // Live events heard before the ceiling was read are in the history already.
        std::erase_if(live_, [&](const JournalEvent& e) { return e.id <= ceiling; });
    }
    auto self = shared_from_this();
    if (options_.since != kSinceNow)
        queue->async([self, ceiling] { self->replay(ceiling); });
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
    std::lock_guard lock(mutex_);
    if (stopped_)
        return;
    for (const auto& event : events) {
        if ((!started_ || event.id > ceiling_) && matches(event))
            live_.push_back(event);
    }
    if (!replaying_ && started_ && !live_.empty())
        scheduleFlush();
}

void TremorStream::replay(uint64_t ceiling) {
    TremorStore* store = service_->storeForDevice(device_);
    if (!store)
        return;
    auto check = store->replayability(options_.since, options_.paths);
    if (!check.complete) {
        // Lost history is never hidden: the client rescans.
        logInfo("Replay for a stream is incomplete: " + check.reason);
        deliver({{0, options_.paths.front(), 0, kTremorUserDropped | kTremorMustScanSubdirs}});
    }
    std::vector<JournalEvent> batch;
    auto status =
        store->replay(options_.since, options_.paths, kReplayBatch, [&](const JournalEvent& event) {
            if (event.id > ceiling)
                return false;  // it comes live
            batch.push_back(event);
            if (batch.size() >= kReplayBatch) {
                deliver(batch);
                batch.clear();
            }
            return true;
        });
    if (status)
        logError("Replay failed: " + status->description());
    deliver(batch);
    deliver({{ceiling, options_.paths.front(), 0, kTremorHistoryDone}});
    std::lock_guard lock(mutex_);
    replaying_ = false;
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
    queue_->asyncAt(std::max(due, DispatchQueue::Clock::now()), [self] { self->flush(); });
}

void TremorStream::flush() {
    std::vector<JournalEvent> events;
    {
        std::lock_guard lock(mutex_);
        flushScheduled_ = false;
        events = std::move(live_);
        live_.clear();
    }
    deliver(events);
}

void TremorStream::deliver(const std::vector<JournalEvent>& events) {
    {
        std::lock_guard lock(mutex_);
        if (stopped_ || events.empty())
            return;
        lastDelivery_ = DispatchQueue::Clock::now();
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
}

void TremorStream::stop() {
    uint64_t token = 0;
    {
        std::lock_guard lock(mutex_);
        stopped_ = true;
        token = listener_;
        listener_ = 0;
        live_.clear();
    }
    if (token)
        service_->removeListener(token);
}

void TremorStream::invalidate() {
    stop();
    std::lock_guard lock(mutex_);
    invalidated_ = true;
    queue_.reset();
}

void TremorStream::releaseHandle() {
    stop();
    handle_.reset();
}

}  // namespace tamber
