#include "support/Pacer.h"
#include "support/MutexLock.h"

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <optional>
#include <thread>

#include "support/BlockingScope.h"
#include "support/Log.h"

namespace tamber {

struct Pacer::State : std::enable_shared_from_this<State> {
    using Clock = DispatchQueue::Clock;

    State(std::string n, std::shared_ptr<DispatchQueue> q, Clock::duration i)
        : name(std::move(n)), queue(std::move(q)), interval(i) {}

    const std::string name;
    const std::shared_ptr<DispatchQueue> queue;
    const Clock::duration interval;

    Mutex mutex;
    std::condition_variable runEnded;
    std::shared_ptr<const std::function<void()>> handler GUARDED_BY(mutex);
    // A signal not yet served by a run that started after it.
    bool pending GUARDED_BY(mutex) = false;
    bool scheduled GUARDED_BY(mutex) = false;  // a run is waiting for its time
    bool running GUARDED_BY(mutex) = false;
    bool cancelled GUARDED_BY(mutex) = false;
    Clock::time_point firstPendingAt GUARDED_BY(mutex);
    std::optional<Clock::time_point> lastRunStart GUARDED_BY(mutex);
    std::thread::id runner GUARDED_BY(mutex);

    // With a signal pending: the run's earliest allowed time.
    Clock::time_point nextRunTime() const REQUIRES(mutex) {
        auto at = firstPendingAt + interval;
        if (lastRunStart)
            at = std::max(at, *lastRunStart + interval);
        return at;
    }

    // Called without the lock. The callback holds only a weak reference so that a pending run
    // neither keeps the pacer's state alive nor runs after the pacer is gone.
    void schedule(Clock::time_point at) {
        queue->asyncAt(at, [weak = weak_from_this()] {
            if (auto self = weak.lock())
                self->fire();
        });
    }

    void fire() {
        std::shared_ptr<const std::function<void()>> h;
        {
            MutexLock lock(mutex);
            scheduled = false;
            if (cancelled || !pending)
                return;
            pending = false;
            running = true;
            runner = std::this_thread::get_id();
            lastRunStart = Clock::now();
            h = handler;
        }
        struct RunEnd {
            State& state;
            ~RunEnd() { state.endRun(); }
        } end{*this};
        if (h && *h)
            (*h)();
    }

    void endRun() {
        std::optional<Clock::time_point> again;
        {
            MutexLock lock(mutex);
            running = false;
            runner = {};
            runEnded.notify_all();
            if (pending && !cancelled) {
                scheduled = true;
                again = nextRunTime();
            }
        }
        if (again)
            schedule(*again);
    }
};

Pacer::Pacer(std::string name, std::shared_ptr<DispatchQueue> queue,
             double minimumIntervalSeconds) {
    if (!queue)
        fatalError("pacer " + name + " needs a queue");
    auto interval = std::chrono::ceil<State::Clock::duration>(
        std::chrono::duration<double>(std::max(0.0, minimumIntervalSeconds)));
    state_ = std::make_shared<State>(std::move(name), std::move(queue), interval);
}

Pacer::~Pacer() {
    MutexLock lock(state_->mutex);
    state_->cancelled = true;
    if (state_->running && state_->runner != std::this_thread::get_id()) {
        BlockingScope waiting;
        state_->runEnded.wait(lock.native(), [&] {
            state_->mutex.assertHeld();
            return !state_->running;
        });
    }
}

const std::string& Pacer::name() const {
    return state_->name;
}

std::string Pacer::description() const {
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(state_->interval).count();
    return "Pacer(" + state_->name + ", every " + std::to_string(ms) + " ms on " +
           state_->queue->label() + ")";
}

void Pacer::setEventHandler(std::function<void()> handler) {
    auto shared = std::make_shared<const std::function<void()>>(std::move(handler));
    MutexLock lock(state_->mutex);
    state_->handler = std::move(shared);
}

void Pacer::signal() {
    State::Clock::time_point at;
    {
        MutexLock lock(state_->mutex);
        if (state_->pending || state_->cancelled)
            return;
        state_->pending = true;
        state_->firstPendingAt = State::Clock::now();
        // A run under way schedules the next one when it ends.
        if (state_->scheduled || state_->running)
            return;
        state_->scheduled = true;
        at = state_->nextRunTime();
    }
    state_->schedule(at);
}

}  // namespace tamber
