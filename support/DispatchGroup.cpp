#include "support/DispatchGroup.h"

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <utility>
#include <vector>

#include "support/BlockingScope.h"
#include "support/DispatchTimer.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

struct DispatchGroup::State {
    Mutex mutex;
    std::condition_variable emptied;
    uint64_t count GUARDED_BY(mutex) = 0;
    std::vector<std::pair<std::shared_ptr<DispatchQueue>, std::function<void()>>> notifications
        GUARDED_BY(mutex);

    void enter() {
        MutexLock lock(mutex);
        ++count;
    }

    void leave() {
        decltype(notifications) due;
        {
            MutexLock lock(mutex);
            if (count == 0)
                fatalError("DispatchGroup::leave without a matching enter");
            if (--count > 0)
                return;
            due.swap(notifications);
            emptied.notify_all();
        }
        for (auto& [queue, block] : due) queue->async(std::move(block));
    }
};

DispatchGroup::DispatchGroup() : state_(std::make_shared<State>()) {}

DispatchGroup::~DispatchGroup() = default;

void DispatchGroup::enter() {
    state_->enter();
}

void DispatchGroup::leave() {
    state_->leave();
}

void DispatchGroup::async(const std::shared_ptr<DispatchQueue>& queue,
                          std::function<void()> block) {
    state_->enter();
    queue->async([state = state_, b = std::move(block)] {
        struct Leave {
            State& state;
            ~Leave() { state.leave(); }
        } leave{*state};
        b();
    });
}

void DispatchGroup::notify(const std::shared_ptr<DispatchQueue>& queue,
                           std::function<void()> block) {
    {
        MutexLock lock(state_->mutex);
        if (state_->count > 0) {
            state_->notifications.emplace_back(queue, std::move(block));
            return;
        }
    }
    queue->async(std::move(block));
}

void DispatchGroup::wait() {
    MutexLock lock(state_->mutex);
    if (state_->count == 0)
        return;
    BlockingScope waiting;
    state_->emptied.wait(lock.native(), [&] {
        state_->mutex.assertHeld();
        return state_->count == 0;
    });
}

bool DispatchGroup::wait(double timeoutSeconds) {
    auto deadline = DispatchTimer::deadlineAfter(timeoutSeconds);
    MutexLock lock(state_->mutex);
    if (state_->count == 0)
        return true;
    BlockingScope waiting;
    return state_->emptied.wait_until(lock.native(), deadline, [&] {
        state_->mutex.assertHeld();
        return state_->count == 0;
    });
}

}  // namespace tamber
