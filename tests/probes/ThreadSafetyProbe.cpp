// Compiled, not run: the clang flavour of the build checks that the thread-safety analysis
// accepts correct locking (scoped locks, early unlock, condition-variable waits) and rejects a
// guarded member touched without its mutex. Were the attributes lost (the macros emptied, the
// flag dropped), the second check would fail.
#include <condition_variable>

#include "support/Mutex.h"
#include "support/MutexLock.h"
#include "support/ThreadAnnotations.h"

namespace {

class Counter {
public:
    void add() {
        tamber::MutexLock lock(mutex_);
        ++value_;
        changed_.notify_all();
    }

    int takeWhenPositive() {
        tamber::MutexLock lock(mutex_);
        changed_.wait(lock.native(), [&] {
            mutex_.assertHeld();
            return value_ > 0;
        });
        int taken = value_;
        value_ = 0;
        lock.unlock();
        notifyOutside();
        return taken;
    }

    int addLocked() REQUIRES(mutex_) { return ++value_; }
    int viaRequires() {
        tamber::MutexLock lock(mutex_);
        return addLocked();
    }

#ifdef TAMBER_PROBE_VIOLATION
    int racy() {
        return value_;
    }
#endif

private:
    void notifyOutside() EXCLUDES(mutex_) {}

    tamber::Mutex mutex_;
    std::condition_variable changed_;
    int value_ GUARDED_BY(mutex_) = 0;
};

}  // namespace

int main() {
    Counter counter;
    counter.add();
    return counter.takeWhenPositive() + counter.viaRequires() == 2 ? 0 : 1;
}
