#pragma once

#include <sys/inotify.h>

#include <atomic>
#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "platform/tremors/FileChange.h"
#include "platform/tremors/InotifyApi.h"
#include "platform/tremors/InotifyTranslator.h"
#include "support/Mutex.h"
#include "support/Result.h"

namespace tamber {

// Watches directory trees with one inotify instance and hands their changes to the caller.
//
// The reading side never waits for anything but the kernel: consume() reads what is queued into
// memory and returns it; journaling is the caller's business, on another thread. Directories
// are listed through FileSystem::current() and every system call goes through InotifyApi, so
// that tests can make either fail.
//
// watchTree, consume and drain may be called from different threads; they take turns.
// requestStop may be called from any thread at any time.
class InotifyBackend {
public:
    // What every directory is watched for.
    static constexpr uint32_t kWatchMask =
        IN_CREATE | IN_DELETE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB | IN_MOVED_FROM |
        IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_DONT_FOLLOW | IN_EXCL_UNLINK;
    // How much one read takes; consume stops after a few of these so that a storm of events
    // cannot keep it from returning.
    static constexpr size_t kReadBufferSize = 64 * 1024;
    static constexpr size_t kReadsPerConsume = 16;
    // The kernel queues the two halves of a rename one after the other, so a read can end
    // between them: a first half that ends the queue waits this long for its second before it
    // is taken for a move out of the trees.
    static constexpr int kMovePartnerWaitMs = 1;

    static Result<std::unique_ptr<InotifyBackend>> start(
        std::shared_ptr<InotifyApi> api = InotifyApi::system());
    ~InotifyBackend();
    InotifyBackend(const InotifyBackend&) = delete;
    InotifyBackend& operator=(const InotifyBackend&) = delete;

    // Watches the directory `root` (absolute, not a symbolic link) and every directory below
    // it, never following symbolic links. A directory that cannot be watched is logged as an
    // error and reported in `discovered` as WatchFailed; its tree is left out and the rest
    // is watched. Fails (and reports WatchFailed) when `root` itself cannot be watched.
    Status watchTree(const std::string& root, std::vector<FileChange>& discovered);

    // Waits up to `timeoutMs` (negative: forever) for events. Returns false once a stop was
    // requested, true otherwise (events queued, or the time ran out).
    bool wait(int timeoutMs);
    // Appends the changes queued by the kernel without waiting: it reads until the queue is
    // empty, or until it has read kReadsPerConsume buffers, in which case the next wait()
    // returns at once. A directory that appeared is watched and then listed, and everything
    // found inside is reported as Created, so that nothing created in it before the watch
    // existed is missed (some may be reported twice).
    void consume(std::vector<FileChange>& out);
    // Like consume, but returns only once every event queued before the call has been read:
    // each is in `out`, or in the output of a consume that was running on another thread.
    void drain(std::vector<FileChange>& out);
    // Makes wait() return false, now and from then on.
    void requestStop();
    bool stopRequested() const { return stopRequested_.load(); }

    size_t watchCount() const;

private:
    struct Private {};

public:
    InotifyBackend(Private, std::shared_ptr<InotifyApi> api, int inotifyFd, int stopFd,
                   bool watchThroughDescriptors);

private:
    // Reads and handles one buffer; false when nothing more was queued.
    bool readOnce(std::vector<FileChange>& out, size_t& bytesRead) REQUIRES(mutex_);
    // With the first half of a rename read and the queue empty: whether more events came
    // within kMovePartnerWaitMs.
    bool awaitMovePartner() REQUIRES(mutex_);
    // Hands out what the translator still holds; `queueEmpty` when the last read found nothing.
    void finishReading(std::vector<FileChange>& out, bool queueEmpty) REQUIRES(mutex_);
    // Removes the kernel watches of directories that left the trees.
    void dropOrphanedWatches() REQUIRES(mutex_);
    // Passes translated changes on, watching and listing the directories that appeared.
    void handle(std::vector<FileChange>& changes, std::vector<FileChange>& out) REQUIRES(mutex_);
    // Watches `top` and the directories below it. With `reportContents`, every entry found in
    // a directory that was not watched yet is reported as Created. With `refresh`, directories
    // watched before are listed again too, so that every watch below `top` gets its path now.
    // Returns the errno value that kept `top` from being watched, 0 when it is watched.
    int watchDirectories(const std::string& top, bool reportContents, std::vector<FileChange>& out,
                         bool refresh = false) REQUIRES(mutex_);
    // Opens the directory, watches it through that descriptor and lists it. Returns the errno
    // value on failure.
    int watchOne(const std::string& path, std::vector<std::string>& subdirectories,
                 bool reportContents, std::vector<FileChange>& out, bool refresh) REQUIRES(mutex_);
    // `watchLimit`: the kernel refused the watch for want of watches (ENOSPC from
    // inotify_add_watch), which is logged once with how to raise the limit.
    void reportUnwatched(const std::string& path, int error, std::vector<FileChange>& out,
                         bool watchLimit = false) REQUIRES(mutex_);
    // Lists again, at their new place, directories that vanished before they could be watched
    // because `from` (or a directory above them) was renamed to `to`.
    void rewatchMoved(const std::string& from, const std::string& to, std::vector<FileChange>& out)
        REQUIRES(mutex_);

    const std::shared_ptr<InotifyApi> api_;
    const int inotifyFd_;
    const int stopFd_;
    // Watch "/proc/self/fd/N/." of the descriptor that is listed, rather than the path.
    const bool watchThroughDescriptors_;
    std::atomic<bool> stopRequested_{false};
    // consume() left events queued on purpose; wait() must not block.
    std::atomic<bool> readingCutShort_{false};

    mutable Mutex mutex_;
    InotifyTranslator translator_ GUARDED_BY(mutex_);
    std::vector<char> buffer_ GUARDED_BY(mutex_);
    // Directories that appeared but were gone when they were to be watched; a rename read
    // later may say where they went. Forgotten once the queue is empty.
    std::vector<std::string> vanished_ GUARDED_BY(mutex_);
    // The trees asked for, walked again after the kernel dropped events.
    std::vector<std::string> roots_ GUARDED_BY(mutex_);
    // The watch limit is logged once: past it, every further folder fails alike.
    std::atomic<bool> watchLimitLogged_{false};
};

}  // namespace tamber
