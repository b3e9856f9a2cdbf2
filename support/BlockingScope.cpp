#include "support/BlockingScope.h"

namespace tamber {

namespace {

thread_local BlockingScope::Slot* tSlot = nullptr;
thread_local int tWaitDepth = 0;

}  // namespace

BlockingScope::SlotHolder::SlotHolder(Slot* slot) : previous_(tSlot) {
    tSlot = slot;
}

BlockingScope::SlotHolder::~SlotHolder() {
    tSlot = previous_;
}

// Only the outermost wait on a thread gives the slot back; it is one slot per thread.
BlockingScope::BlockingScope() : released_(tWaitDepth == 0 ? tSlot : nullptr) {
    ++tWaitDepth;
    if (released_)
        released_->release();
}

BlockingScope::~BlockingScope() {
    --tWaitDepth;
    if (released_)
        released_->reacquire();
}

}  // namespace tamber
