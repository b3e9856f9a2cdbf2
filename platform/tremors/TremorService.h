#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/tremors/FileChange.h"
#include "platform/tremors/InotifyApi.h"
#include "platform/tremors/InotifyBackend.h"
#include "platform/tremors/JournalEvent.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorStore.h"
#include "support/Result.h"

namespace tamber {

// The file-system event journal of this process: it watches the trees asked for in this run
// (the published folders, and what streams ask for), journals their changes in one store per
// volume, and keeps the inode index and document IDs of those trees.
//
// Trees remembered from earlier runs are neither watched nor crawled until asked for again: a
// tree that this run does not publish must not answer paths nor cost a crawl. One that was
// watched until the last run stopped goes on with its history (what changed meanwhile is
// journaled when it is asked for); one that a run left aside starts its history anew, so that
// a replay from before reports the gap.
//
// Two threads: one reads inotify into memory and never touches the database (the kernel queue
// is a fraction of a second of a burst), the other journals what it read, in one append per
// batch, and then tells the listeners.
class TremorService {
public:
    // Changes read but not journaled yet; above this the reader drops and journals a loss.
    static constexpr size_t kDefaultQueueLimit = 1 << 20;

    // In a burst of changes, those read within this window of the last write are written
    // together, up to this many at a time.
    static constexpr std::chrono::milliseconds kGroupWindow{2};
    static constexpr size_t kGroupChanges = 8192;

    using Listener = std::function<void(uint32_t device, const std::vector<JournalEvent>&)>;

    // Where shared() keeps its state (and, for tests, which inotify calls it makes); tests call
    // this before the first shared().
    static void configure(std::string stateDir,
                          std::shared_ptr<InotifyApi> api = InotifyApi::system());
    // How long shared() waits for another process that holds a store (default: not at all).
    static void setLockWait(TremorStoreDirectory::LockWait lockWait);
    static std::string defaultStateDir();
    // The process's service, started on first use. Fails when the state cannot be opened, for
    // example because another process holds it; reporting that is the caller's business.
    static Result<std::shared_ptr<TremorService>> shared();
    // The process's service when it is running; never starts one.
    static std::shared_ptr<TremorService> sharedIfRunning();
    // Shuts the process's service down; the next shared() starts a fresh one.
    static void stopShared();
    static void resetForTesting() { stopShared(); }
    // Makes `service` the process's service, and its document IDs the current ones, while its
    // owner (a runtime) lives. Fails with EBUSY when another one is running.
    static Status installShared(std::shared_ptr<TremorService> service);
    // Undoes installShared when `service` is still the process's service; does not stop it.
    static void uninstallShared(const std::shared_ptr<TremorService>& service);

    // A service on `stateDir`: opens every store found there (waiting for other processes as
    // `lockWait` says) and forgets the remembered trees whose folder is gone (an info line
    // each). It watches nothing until asked.
    static Result<std::shared_ptr<TremorService>> create(
        const std::string& stateDir, std::shared_ptr<InotifyApi> api = InotifyApi::system(),
        size_t queueLimit = kDefaultQueueLimit, TremorStoreDirectory::LockWait lockWait = {});
    ~TremorService();
    TremorService(const TremorService&) = delete;
    TremorService& operator=(const TremorService&) = delete;

    // Stops both threads after journaling what was read; later calls change nothing.
    void shutdown();

    // Watches the directory tree at `path`, remembers it, and indexes it. A tree watched until
    // the last run stopped goes on with its history and journals what changed meanwhile.
    Status watchTree(const std::string& path);
    // watchTree() for several trees, whose changes while no run watched them are journaled in
    // one pass: a document moved from one of them to another meanwhile keeps its ID. Returns
    // the trees that could not be watched, with why; the others are watched all the same.
    std::vector<std::pair<std::string, Error>> watchTrees(const std::vector<std::string>& paths);
    bool isWatched(const std::string& path) const;
    // Watches every tree that was watched until the last run stopped, as asking for each would
    // (for a process that serves whatever earlier runs published). Returns the first failure;
    // the other trees are watched all the same.
    Status watchRemembered();
    // Marks every remembered tree that this service does not watch as unwatched, and returns
    // them: called when a run ends, so that the next run that asks for one reports the gap.
    std::vector<std::string> retireUnwatched();
    // Stops journaling the tree at `path` (exactly a remembered root), marks it forgotten and
    // drops its index entries and document IDs, so that its identifiers no longer resolve. Its
    // events stay in the journal. Fails with ENOENT when `path` is not remembered.
    Result<TremorStore::Forgotten> forget(const std::string& path);

    // Returns once every event the kernel queued before the call has been journaled.
    void sync();
    // sync(), after rescanning the folders that could not be watched (past the kernel's watch
    // limit): for a client about to read the journal, so that what changed in them is there.
    void catchUp();
    // The last event ID handed out (after catchUp), over every volume.
    uint64_t currentEventId();
    // The UUID of the store of `device` (after sync); empty when no tree of it is watched.
    std::string uuidForDevice(uint32_t device);
    // False while the index is being rebuilt.
    bool indexReady() const { return indexReady_.load(); }

    // The store of a device, valid while the service lives; null when none.
    TremorStore* storeForDevice(uint32_t device) const;
    // The device number of the volume that holds `path`, when one of its trees is watched.
    std::optional<uint32_t> deviceForPath(const std::string& path) const;

    // Calls `listener` on the journaling thread after each append, in ID order. It must not
    // block nor call sync().
    uint64_t addListener(Listener listener);
    void removeListener(uint64_t token);

private:
    struct Volume {
        uint64_t fsid = 0;
        // Read by the journaling thread while a watch on another thread may set it again; 0
        // until a tree of the volume is watched.
        std::atomic<uint32_t> device{0};
        std::unique_ptr<TremorStore> store;
        // Made (once, under volumesMutex_) when the device is known.
        std::unique_ptr<JournalWriter> writer;
        // Touched by the journaling thread only, under writeMutex_:
        // history was lost and the journal could not yet say so (a full disk, say);
        bool lossOwed = false;
        // the folders (by inode) that could not be watched, rescanned when changes are asked for.
        std::vector<uint64_t> unwatched;
    };
    struct Item {
        // Recheck: a journal owes a loss, or has folders that are rescanned rather than watched.
        enum class Kind { Batch, Barrier, Dropped, Recheck } kind = Kind::Batch;
        std::vector<FileChange> changes;
        uint64_t barrier = 0;
    };
    struct Private {};
    using Clock = std::chrono::steady_clock;

public:
    TremorService(Private, std::string stateDir, std::unique_ptr<InotifyBackend> backend,
                  size_t queueLimit, TremorStoreDirectory::LockWait lockWait);

private:
    Status openExistingStores();
    // Forgets the remembered trees of `store` whose folder is gone.
    static void pruneVanishedRoots(TremorStore& store);
    Result<Volume*> volumeFor(const std::string& path);
    Result<Volume*> openVolume(uint64_t fsid, uint32_t device);
    Result<Volume*> addVolume(uint64_t fsid, std::unique_ptr<TremorStore> store);
    // Watches and indexes one tree. With `resumedLater`, a resumed tree is not reconciled but
    // added there, for one pass over all of them.
    using Resumed = std::map<Volume*, std::vector<std::string>>;
    Status watch(const std::string& path, Resumed* resumedLater = nullptr);
    void reconcileResumed(const Resumed& resumed);
    // The volumes that journal (their device is known), with their writers.
    std::vector<std::pair<Volume*, JournalWriter*>> journalingVolumes() const;
    Volume* ownerOf(const std::string& path) const;
    std::vector<std::string> rootPaths(const Volume& volume) const;
    void enqueue(std::vector<FileChange> changes);
    void readLoop();
    void journalLoop();
    void journal(Item& item);
    void publish(const Volume& volume, Result<std::vector<JournalEvent>> events);
    // Journals that history under every root was lost and brings the index back in step; what
    // the journal cannot take now stays owed and is settled before anything else is journaled.
    void settleLoss(Volume& volume, uint32_t flags);
    // False when the journal refused a write (a tree that vanished is not a failure).
    bool reconcileAll(Volume& volume);
    // A folder that could not be watched: its changes are found by rescans instead.
    void noteUnwatched(Volume& volume, const FileChange& change);
    void rescanUnwatched(Volume& volume);
    // sync(), first settling owed losses and, with `rescan`, rescanning unwatched folders.
    void flush(bool rescan);

    const std::string stateDir_;
    const std::unique_ptr<InotifyBackend> backend_;
    const size_t queueLimit_;
    const TremorStoreDirectory::LockWait lockWait_;
    std::atomic<bool> indexReady_{false};
    // Whether any volume owes a loss or has unwatched folders (read without writeMutex_).
    std::atomic<bool> lossOwed_{false};
    std::atomic<size_t> unwatchedFolders_{0};
    std::atomic<bool> stopped_{false};

    // Guards volumes_ and roots_.
    mutable std::mutex volumesMutex_;
    std::vector<std::unique_ptr<Volume>> volumes_;
    std::vector<std::pair<std::string, Volume*>> roots_;  // watched roots and their volume

    // Held while changes go from the backend to the queue, so a barrier lands after them.
    std::mutex readMutex_;
    // Guards queue_ down to journaling_.
    std::mutex queueMutex_;
    std::condition_variable queueChanged_;
    std::deque<Item> queue_;
    size_t queuedChanges_ = 0;
    bool stopJournaling_ = false;
    uint64_t nextBarrier_ = 0;
    uint64_t passedBarrier_ = 0;
    bool journaling_ = false;  // the journaling thread is writing a batch it took off the queue
    bool grouping_ = false;    // the journaling thread waits for more of a burst
    std::condition_variable barrierPassed_;

    // Serialises every use of the writers and the stores' index.
    std::recursive_mutex writeMutex_;
    // Guards listeners_ and nextListener_.
    std::mutex listenersMutex_;
    std::map<uint64_t, Listener> listeners_;
    uint64_t nextListener_ = 1;

    std::thread reader_;
    std::thread journaler_;
    std::thread::id journalerId_;
};

}  // namespace tamber
