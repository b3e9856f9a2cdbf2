#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/HostPorterItemIdentifier.h"
#include "server/HostReplica.h"

namespace tamber {

// Hands what happens (batches the replica applied, containers the provider signalled) to the
// clients of `GET events`, each through a bounded queue of its own: a client that falls
// `queueLimit` events behind is dropped, so that no client can hold up the replica or the
// others.
class EventHub {
public:
    static constexpr size_t kDefaultQueueLimit = 1024;

    // One event, already in the text/event-stream form ("id: ...\nevent: ...\ndata: ...\n\n").
    struct Event {
        uint64_t sequence = 0;  // the batch's sequence number; 0 for events without one
        std::string text;
    };

    // One connected client.
    class Subscriber {
    public:
        // The next events, waiting up to `timeout` for one. Empty when none came, the client
        // was dropped, or the hub closed (see open()).
        std::vector<Event> next(std::chrono::milliseconds timeout);
        // False once the client was dropped or the hub closed.
        bool open();

    private:
        friend class EventHub;
        std::mutex mutex;
        std::condition_variable wake;
        std::deque<Event> queue;  // guarded by mutex
        bool closed = false;      // guarded by mutex
    };

    explicit EventHub(size_t queueLimit = kDefaultQueueLimit);

    std::shared_ptr<Subscriber> subscribe();
    void unsubscribe(const std::shared_ptr<Subscriber>& subscriber);

    void publishBatch(const ReplicaBatch& batch);
    void publishSignal(const HostPorterItemIdentifier& container);
    // Ends every stream and refuses new ones (the server stops).
    void close();
    bool closed();

    static Event batchEvent(const ReplicaBatch& batch);
    static Event resetEvent();
    static Event signalEvent(const HostPorterItemIdentifier& container);

private:
    void publish(const Event& event);

    const size_t queueLimit_;
    std::mutex mutex_;
    std::vector<std::shared_ptr<Subscriber>> subscribers_;  // guarded by mutex_
    bool closed_ = false;                                   // guarded by mutex_
};

}  // namespace tamber
