#include "cli/Interrupt.h"

#include <atomic>
#include <csignal>

namespace tamber {

namespace {

// Set from the signal handler: only a lock-free store is safe there.
std::atomic<bool> gInterrupted{false};

void onSignal(int) {
    gInterrupted.store(true);
}

}  // namespace

void catchInterrupts() {
    gInterrupted.store(false);
    std::signal(SIGINT, onSignal);
    std::signal(SIGTERM, onSignal);
}

bool interrupted() {
    return gInterrupted.load();
}

}  // namespace tamber
