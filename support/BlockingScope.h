#pragma once

namespace tamber {

// Marks the current thread as waiting (in a semaphore, a group, a sync) for the lifetime of
// the object. A width-limited queue lends each of its running blocks a slot; a block that waits
// gives the slot back meanwhile, so blocks waiting on each other cannot use up the width and
// starve that queue. Internal to the dispatch layer.
class BlockingScope {
public:
    // What a width-limited queue installs on the thread that runs one of its blocks.
    class Slot {
    public:
        virtual void release() = 0;
        virtual void reacquire() = 0;

    protected:
        ~Slot() = default;
    };

    // Installs `slot` for the current thread for the lifetime of the object.
    class SlotHolder {
    public:
        explicit SlotHolder(Slot* slot);
        ~SlotHolder();
        SlotHolder(const SlotHolder&) = delete;
        SlotHolder& operator=(const SlotHolder&) = delete;

    private:
        Slot* previous_;
    };

    BlockingScope();
    ~BlockingScope();
    BlockingScope(const BlockingScope&) = delete;
    BlockingScope& operator=(const BlockingScope&) = delete;

private:
    Slot* released_;
};

}  // namespace tamber
