#include "server/EventHub.h"

#include <algorithm>

#include "runtime/JsonValues.h"

namespace tamber {

std::vector<EventHub::Event> EventHub::Subscriber::next(std::chrono::milliseconds timeout) {
    std::unique_lock lock(mutex);
    wake.wait_for(lock, timeout, [&] { return closed || !queue.empty(); });
    std::vector<Event> events;
    if (closed)
        return events;
    events.assign(std::make_move_iterator(queue.begin()), std::make_move_iterator(queue.end()));
    queue.clear();
    return events;
}

bool EventHub::Subscriber::open() {
    std::lock_guard lock(mutex);
    return !closed;
}

EventHub::EventHub(size_t queueLimit) : queueLimit_(queueLimit) {}

std::shared_ptr<EventHub::Subscriber> EventHub::subscribe() {
    auto subscriber = std::make_shared<Subscriber>();
    std::lock_guard lock(mutex_);
    if (closed_)
        subscriber->closed = true;
    else
        subscribers_.push_back(subscriber);
    return subscriber;
}

void EventHub::unsubscribe(const std::shared_ptr<Subscriber>& subscriber) {
    std::lock_guard lock(mutex_);
    std::erase(subscribers_, subscriber);
}

void EventHub::publishBatch(const ReplicaBatch& batch) {
    publish(batchEvent(batch));
}

void EventHub::publishSignal(const HostPorterItemIdentifier& container) {
    publish(signalEvent(container));
}

void EventHub::publish(const Event& event) {
    std::lock_guard lock(mutex_);
    for (auto it = subscribers_.begin(); it != subscribers_.end();) {
        auto& subscriber = **it;
        bool dropped = false;
        {
            std::lock_guard clientLock(subscriber.mutex);
            if (subscriber.queue.size() >= queueLimit_) {
                subscriber.closed = true;
                subscriber.queue.clear();
                dropped = true;
            } else {
                subscriber.queue.push_back(event);
            }
        }
        subscriber.wake.notify_all();
        it = dropped ? subscribers_.erase(it) : it + 1;
    }
}

void EventHub::close() {
    std::vector<std::shared_ptr<Subscriber>> subscribers;
    {
        std::lock_guard lock(mutex_);
        closed_ = true;
        subscribers.swap(subscribers_);
    }
    for (auto& subscriber : subscribers) {
        {
            std::lock_guard lock(subscriber->mutex);
            subscriber->closed = true;
        }
        subscriber->wake.notify_all();
    }
}

bool EventHub::closed() {
    std::lock_guard lock(mutex_);
    return closed_;
}

EventHub::Event EventHub::batchEvent(const ReplicaBatch& batch) {
    // The replica listed everything again: what clients hold may be stale, they start over.
    if (batch.changes.is_object() && batch.changes.value("reset", false))
        return {batch.sequence,
                "id: " + std::to_string(batch.sequence) + "\nevent: reset\ndata: {}\n\n"};
    return {batch.sequence, "id: " + std::to_string(batch.sequence) +
                                "\nevent: changes\ndata: " + jsonText(batch.changes) + "\n\n"};
}

EventHub::Event EventHub::resetEvent() {
    return {0, "event: reset\ndata: {}\n\n"};
}

EventHub::Event EventHub::signalEvent(const HostPorterItemIdentifier& container) {
    return {0,
            "event: signal\ndata: " + jsonText(nlohmann::json{{"container", container}}) + "\n\n"};
}

}  // namespace tamber
