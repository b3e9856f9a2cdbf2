#pragma once

#include <functional>
#include <memory>

#include "support/DispatchQueue.h"

namespace tamber {

// Tracks a set of unfinished tasks: enter() adds one, leave() ends one. Notifications run once,
// each on its queue, when the count drops to zero; a notification asked for while nothing is
// unfinished is submitted right away. Leaving more often than entering is a fatal error.
// Blocks submitted through the group keep what they need alive on their own, so the group
// object may go away before they finish.
class DispatchGroup {
public:
    DispatchGroup();
    ~DispatchGroup();
    DispatchGroup(const DispatchGroup&) = delete;
    DispatchGroup& operator=(const DispatchGroup&) = delete;

    void enter();
    void leave();

    // Runs `block` on `queue` as one task of the group; it leaves the group however it ends.
    void async(const std::shared_ptr<DispatchQueue>& queue, std::function<void()> block);
    void notify(const std::shared_ptr<DispatchQueue>& queue, std::function<void()> block);

    void wait();
    // Whether the group became empty before `timeoutSeconds` passed.
    bool wait(double timeoutSeconds);

private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace tamber
