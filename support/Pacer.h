#pragma once

#include <functional>
#include <memory>
#include <string>

#include "support/DispatchQueue.h"

namespace tamber {

// Coalesces signals into runs of an event handler on a queue. The handler runs once for any
// number of signals received since its previous run started, never sooner than the minimum
// interval after that start, and never sooner than the minimum interval after the first of
// those signals. A signal that arrives while the handler runs causes one more run later.
//
// Destroying the pacer cancels a pending run. A run already under way on another thread is
// waited for, so the handler may use whatever its owner holds; do not destroy the pacer while
// holding something the handler waits for.
class Pacer {
public:
    Pacer(std::string name, std::shared_ptr<DispatchQueue> queue, double minimumIntervalSeconds);
    ~Pacer();
    Pacer(const Pacer&) = delete;
    Pacer& operator=(const Pacer&) = delete;

    const std::string& name() const;
    std::string description() const;

    void setEventHandler(std::function<void()> handler);
    // Cheap and never waits for the handler; callable from any thread.
    void signal();

private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace tamber
