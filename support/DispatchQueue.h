#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>

#include "support/BlockingScope.h"

namespace tamber {

// A labelled queue of blocks. A serial queue runs its blocks one at a time, in the order they
// were submitted; the global queue runs them concurrently, a bounded number at once (a block
// that waits in a semaphore, group or sync does not count against the bound).
//
// Blocks run on threads of an elastic pool, so a block that waits never keeps another queue
// from running. Pending blocks keep their queue alive. An exception escaping an async block is
// logged and dropped; one escaping a sync block reaches the caller of sync.
class DispatchQueue final : public std::enable_shared_from_this<DispatchQueue>,
                            private BlockingScope::Slot {
    struct Private {};

public:
    using Clock = std::chrono::steady_clock;

    static std::shared_ptr<DispatchQueue> makeSerial(std::string label);
    // The process-wide concurrent queue.
    static const std::shared_ptr<DispatchQueue>& global();

    DispatchQueue(Private, std::string label, size_t width);
    ~DispatchQueue();
    DispatchQueue(const DispatchQueue&) = delete;
    DispatchQueue& operator=(const DispatchQueue&) = delete;

    const std::string& label() const { return label_; }
    bool isSerial() const { return width_ == 1; }
    // How many blocks it runs at once, not counting blocks that wait.
    size_t width() const { return width_; }

    void async(std::function<void()> block);
    // Submits `block` once `delaySeconds` have passed (right away when not positive).
    void asyncAfter(double delaySeconds, std::function<void()> block);
    void asyncAt(Clock::time_point deadline, std::function<void()> block);

    // Runs `block` on the calling thread once the queue is exclusively ours (after everything
    // submitted before it) and returns its result. For the global queue it just runs the block.
    // Calling it for a serial queue from a block of that queue is a fatal error: it could never
    // proceed.
    template <class F>
    std::invoke_result_t<F&> sync(F&& block);

    // Whether the current thread runs a block of this queue, directly or further down a chain
    // of sync calls.
    bool isCurrent() const;
    void assertCurrent() const;
    void assertNotCurrent() const;

private:
    using Invoke = void (*)(void*);
    void syncInvoke(Invoke invoke, void* context);

    // Serial queues.
    void drainSerial();
    void releaseSerial(std::unique_lock<std::mutex>& lock);
    // The global queue.
    void startConcurrent(std::unique_lock<std::mutex>& lock, std::function<void()> block);
    void runConcurrent(std::function<void()> block);
    void watchStalls();
    void release() override;
    void reacquire() override;

    void runBlock(std::function<void()>& block);

    struct SyncWaiter {
        std::condition_variable granted;
        bool ownsQueue = false;
    };
    struct Item {
        std::function<void()> block;
        SyncWaiter* waiter = nullptr;  // a sync caller waiting for its turn, or null
    };

    const std::string label_;
    const size_t width_;

    std::mutex mutex_;
    std::deque<Item> items_;
    // Serial: a drain is scheduled or running, or a sync caller owns the queue.
    bool busy_ = false;
    // Concurrent: running blocks that are not waiting, how many finished, and the stall watch.
    size_t active_ = 0;
    uint64_t finished_ = 0;
    bool watching_ = false;
    std::condition_variable stallTick_;
};

template <class F>
std::invoke_result_t<F&> DispatchQueue::sync(F&& block) {
    using R = std::invoke_result_t<F&>;
    if constexpr (std::is_void_v<R>) {
        syncInvoke([](void* f) { (*static_cast<std::remove_reference_t<F>*>(f))(); },
                   const_cast<void*>(static_cast<const void*>(std::addressof(block))));
    } else {
        using Stored = std::conditional_t<std::is_reference_v<R>, std::remove_reference_t<R>*, R>;
        struct Context {
            std::remove_reference_t<F>& block;
            std::optional<Stored> result;
        } context{block, std::nullopt};
        syncInvoke(
            [](void* c) {
                auto& ctx = *static_cast<Context*>(c);
                if constexpr (std::is_reference_v<R>) {
                    ctx.result.emplace(std::addressof(ctx.block()));
                } else {
                    ctx.result.emplace(ctx.block());
                }
            },
            &context);
        if constexpr (std::is_reference_v<R>) {
            return static_cast<R>(**context.result);
        } else {
            return std::move(*context.result);
        }
    }
}

}  // namespace tamber
