#include "platform/tremors/TremorService.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <iterator>
#include <utility>

#include "platform/FileSystem.h"
#include "platform/Url.h"
#include "platform/strata/StrataService.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/FileStamp.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"

namespace tamber {

namespace {

struct Shared {
    std::mutex mutex;
    std::string stateDir;
    std::shared_ptr<InotifyApi> api;
    TremorStoreDirectory::LockWait lockWait;
    std::shared_ptr<TremorService> service;
    std::shared_ptr<StrataService> strata;
};

Shared& global() {
    static Shared shared;
    return shared;
}

}  // namespace

void TremorService::configure(std::string stateDir, std::shared_ptr<InotifyApi> api) {
    std::lock_guard lock(global().mutex);
    global().stateDir = std::move(stateDir);
    global().api = std::move(api);
}

void TremorService::setLockWait(TremorStoreDirectory::LockWait lockWait) {
    std::lock_guard lock(global().mutex);
    global().lockWait = std::move(lockWait);
}

std::string TremorService::defaultStateDir() {
    if (const char* state = std::getenv("XDG_STATE_HOME"); state && *state == '/')
        return std::string(state) + "/tamber";
    const char* home = std::getenv("HOME");
    return std::string(home ? home : "") + "/.local/state/tamber";
}

Result<std::shared_ptr<TremorService>> TremorService::shared() {
    Shared& g = global();
    std::lock_guard lock(g.mutex);
    if (g.service)
        return g.service;
    auto service = create(g.stateDir.empty() ? defaultStateDir() : g.stateDir,
                          g.api ? g.api : InotifyApi::system(), kDefaultQueueLimit, g.lockWait);
    if (!service.ok())
        return service.error();
    g.service = service.value();
    g.strata = std::make_shared<TremorStrataService>(g.service);
    StrataService::setCurrent(g.strata);
    TremorStrataService::installDocumentIdLookup();
    return g.service;
}

std::shared_ptr<TremorService> TremorService::sharedIfRunning() {
    std::lock_guard lock(global().mutex);
    return global().service;
}

void TremorService::stopShared() {
    Shared& g = global();
    std::shared_ptr<TremorService> service;
    {
        std::lock_guard lock(g.mutex);
        service = std::move(g.service);
        if (g.strata && StrataService::current() == g.strata) {
            StrataService::setCurrent(nullptr);
            setDocumentIdLookup(nullptr);
        }
        g.strata.reset();
    }
    if (service)
        service->shutdown();
}

Status TremorService::installShared(std::shared_ptr<TremorService> service) {
    Shared& g = global();
    std::lock_guard lock(g.mutex);
    if (g.service)
        return Error(kPosixErrorDomain, EBUSY,
                     {{"description", "another event journal is running in this process"}});
    g.service = std::move(service);
    g.strata = std::make_shared<TremorStrataService>(g.service);
    StrataService::setCurrent(g.strata);
    TremorStrataService::installDocumentIdLookup();
    return Status::OK();
}

void TremorService::uninstallShared(const std::shared_ptr<TremorService>& service) {
    Shared& g = global();
    std::lock_guard lock(g.mutex);
    if (!service || g.service != service)
        return;
    g.service.reset();
    if (g.strata && StrataService::current() == g.strata) {
        StrataService::setCurrent(nullptr);
        setDocumentIdLookup(nullptr);
    }
    g.strata.reset();
}

Result<std::shared_ptr<TremorService>> TremorService::create(
    const std::string& stateDir, std::shared_ptr<InotifyApi> api, size_t queueLimit,
    TremorStoreDirectory::LockWait lockWait) {
    auto backend = InotifyBackend::start(std::move(api));
    if (!backend.ok())
        return backend.error();
    auto service = std::make_shared<TremorService>(Private{}, stateDir, std::move(backend).value(),
                                                   queueLimit, std::move(lockWait));
    if (auto status = service->openExistingStores(); !status.ok()) {
        service->shutdown();
        return status.error();
    }
    return service;
}

TremorService::TremorService(Private, std::string stateDir, std::unique_ptr<InotifyBackend> backend,
                             size_t queueLimit, TremorStoreDirectory::LockWait lockWait)
    : stateDir_(std::move(stateDir)),
      backend_(std::move(backend)),
      queueLimit_(queueLimit),
      lockWait_(std::move(lockWait)) {
    reader_ = std::thread([this] { readLoop(); });
    journaler_ = std::thread([this] { journalLoop(); });
    journalerId_ = journaler_.get_id();
}

TremorService::~TremorService() {
    shutdown();
}

void TremorService::shutdown() {
    if (stopped_.exchange(true))
        return;
    backend_->requestStop();
    if (reader_.joinable())
        reader_.join();
    {
        std::lock_guard lock(queueMutex_);
        stopJournaling_ = true;
    }
    queueChanged_.notify_all();
    if (journaler_.joinable())
        journaler_.join();
    barrierPassed_.notify_all();
}

void TremorService::enqueue(std::vector<FileChange> changes) {
    bool wake = true;
    {
        std::lock_guard lock(queueMutex_);
        if (queuedChanges_ + changes.size() > queueLimit_) {
            // Memory must stay bounded: the loss is journaled and the trees rescanned instead.
            if (queue_.empty() || queue_.back().kind != Item::Kind::Dropped)
                queue_.push_back({Item::Kind::Dropped, {}, 0});
        } else {
            queuedChanges_ += changes.size();
            queue_.push_back({Item::Kind::Batch, std::move(changes), 0});
            // A journaling thread that groups a burst wakes at the end of its window anyway:
            // waking it for every read would cost a switch each.
            wake = !grouping_ || queuedChanges_ >= kGroupChanges;
        }
    }
    if (wake)
        queueChanged_.notify_one();
}

void TremorService::readLoop() {
    while (backend_->wait(-1)) {
        std::lock_guard read(readMutex_);
        std::vector<FileChange> changes;
        backend_->consume(changes);
        if (!changes.empty())
            enqueue(std::move(changes));
    }
}

void TremorService::sync() {
    flush(false);
}

void TremorService::catchUp() {
    flush(true);
}

void TremorService::flush(bool rescan) {
    if (stopped_ || std::this_thread::get_id() == journalerId_)
        return;
    const bool recheck = lossOwed_ || (rescan && unwatchedFolders_ > 0);
    uint64_t barrier = 0;
    {
        std::lock_guard read(readMutex_);
        std::vector<FileChange> changes;
        backend_->drain(changes);
        if (!changes.empty())
            enqueue(std::move(changes));
        std::lock_guard lock(queueMutex_);
        if (recheck)
            queue_.push_back({Item::Kind::Recheck, {}, 0});
        // Nothing read and nothing left to write: everything before this call is journaled
        // already, and a round trip through the journaling thread would only cost time (an
        // identifier asked for every file of a listing passes here).
        if (queue_.empty() && !journaling_)
            return;
        barrier = ++nextBarrier_;
        queue_.push_back({Item::Kind::Barrier, {}, barrier});
    }
    queueChanged_.notify_one();
    std::unique_lock lock(queueMutex_);
    barrierPassed_.wait(lock, [&] { return passedBarrier_ >= barrier || stopJournaling_; });
}

void TremorService::journalLoop() {
    // When the last batch was written this recently, the journal is in a burst: what arrives
    // within the window joins the next batch, so that a burst costs a commit per window rather
    // than one per read of the kernel queue (a commit is tens of microseconds of a core that
    // the program writing the files needs). A change after a quiet spell is written at once.
    Clock::time_point lastWritten = Clock::now() - kGroupWindow;
    for (;;) {
        Item item;
        {
            std::unique_lock lock(queueMutex_);
            queueChanged_.wait(lock, [&] { return !queue_.empty() || stopJournaling_; });
            if (queue_.empty())
                break;
            if (queue_.front().kind == Item::Kind::Barrier) {
                passedBarrier_ = queue_.front().barrier;
                queue_.pop_front();
                barrierPassed_.notify_all();
                continue;
            }
            if (queue_.front().kind == Item::Kind::Batch &&
                Clock::now() - lastWritten < kGroupWindow) {
                // A sync() waiting behind, a full batch or a stop ends the wait early.
                grouping_ = true;
                queueChanged_.wait_until(lock, lastWritten + kGroupWindow, [&] {
                    return stopJournaling_ || nextBarrier_ != passedBarrier_ ||
                           queuedChanges_ >= kGroupChanges;
                });
                grouping_ = false;
            }
            item = std::move(queue_.front());
            queue_.pop_front();
            queuedChanges_ -= item.changes.size();
            // Batches read one after the other are journaled as one, in their order.
            while (item.kind == Item::Kind::Batch && !queue_.empty() &&
                   queue_.front().kind == Item::Kind::Batch &&
                   item.changes.size() < kGroupChanges) {
                Item& next = queue_.front();
                queuedChanges_ -= next.changes.size();
                item.changes.insert(item.changes.end(),
                                    std::make_move_iterator(next.changes.begin()),
                                    std::make_move_iterator(next.changes.end()));
                queue_.pop_front();
            }
            journaling_ = true;
        }
        journal(item);
        lastWritten = Clock::now();
        std::lock_guard lock(queueMutex_);
        journaling_ = false;
    }
    std::lock_guard lock(queueMutex_);
    passedBarrier_ = nextBarrier_;
    barrierPassed_.notify_all();
}

std::vector<std::pair<TremorService::Volume*, JournalWriter*>> TremorService::journalingVolumes()
    const {
    std::lock_guard lock(volumesMutex_);
    std::vector<std::pair<Volume*, JournalWriter*>> volumes;
    for (auto& volume : volumes_) {
        if (volume->writer)
            volumes.emplace_back(volume.get(), volume->writer.get());
    }
    return volumes;
}

void TremorService::journal(Item& item) {
    std::lock_guard write(writeMutex_);
    auto volumes = journalingVolumes();
    if (item.kind == Item::Kind::Dropped) {
        for (auto [volume, writer] : volumes)
            settleLoss(*volume, kTremorUserDropped | kTremorMustScanSubdirs);
        return;
    }
    if (item.kind == Item::Kind::Recheck) {
        for (auto [volume, writer] : volumes) {
            if (volume->lossOwed)
                settleLoss(*volume, kTremorUserDropped | kTremorMustScanSubdirs);
            if (!volume->lossOwed)
                rescanUnwatched(*volume);
        }
        return;
    }
    // A batch that could not be journaled was rolled back whole: readers are told to look for
    // themselves, and the index is brought back in step, as after lost events. Until the
    // journal takes that notice, nothing later is journaled: the rescan that comes with the
    // notice reports those changes too.
    auto applyBatch = [this](Volume& volume, const std::vector<FileChange>& changes) {
        if (volume.lossOwed)
            settleLoss(volume, kTremorUserDropped | kTremorMustScanSubdirs);
        if (volume.lossOwed || changes.empty())
            return;
        auto events = volume.writer->apply(changes);
        const bool failed = !events.ok();
        publish(volume, std::move(events));
        if (failed)
            settleLoss(volume, kTremorUserDropped | kTremorMustScanSubdirs);
    };
    std::map<Volume*, std::vector<FileChange>> byVolume;
    bool overflow = false;
    for (auto& change : item.changes) {
        if (change.kind == FileChange::Kind::Overflow) {
            overflow = true;
            continue;
        }
        Volume* volume = ownerOf(change.kind == FileChange::Kind::Renamed && change.path.empty()
                                     ? change.fromPath
                                     : change.path);
        if (!volume)
            continue;
        if (change.kind == FileChange::Kind::WatchFailed) {
            applyBatch(*volume, byVolume[volume]);
            byVolume[volume].clear();
            noteUnwatched(*volume, change);
            if (volume->lossOwed)
                continue;  // the owed notice covers every tree
            auto dropped = volume->writer->journalDropped(
                {change.path}, kTremorUserDropped | kTremorMustScanSubdirs);
            if (!dropped.ok()) {
                volume->lossOwed = true;
                lossOwed_ = true;
            }
            publish(*volume, std::move(dropped));
            continue;
        }
        byVolume[volume].push_back(std::move(change));
    }
    for (auto& [volume, changes] : byVolume) applyBatch(*volume, changes);
    if (overflow) {
        logError("inotify dropped events; rescanning the watched trees");
        for (auto [volume, writer] : volumes)
            settleLoss(*volume, kTremorKernelDropped | kTremorMustScanSubdirs);
    }
}

void TremorService::settleLoss(Volume& volume, uint32_t flags) {
    auto dropped = volume.writer->journalDropped(rootPaths(volume), flags);
    bool settled = dropped.ok();
    // The first refusal is logged; retries while the disk stays full would only repeat it.
    if (settled || !volume.lossOwed)
        publish(volume, std::move(dropped));
    if (settled)
        settled = reconcileAll(volume);
    if (settled == !volume.lossOwed)
        return;
    volume.lossOwed = !settled;
    if (settled) {
        logInfo("The event journal " + volume.store->directory() +
                " takes events again; the lost ones were rescanned");
    }
    std::lock_guard lock(volumesMutex_);
    lossOwed_ = std::any_of(volumes_.begin(), volumes_.end(),
                            [](const auto& other) { return other->lossOwed; });
}

bool TremorService::reconcileAll(Volume& volume) {
    indexReady_ = false;
    bool journaled = true;
    // All roots in one pass: a document moved from one tree to another while events were lost
    // keeps its ID.
    auto events = volume.writer->reconcile(rootPaths(volume), true);
    if (!events.ok() && events.error().domain() == std::string_view(kSqliteErrorDomain))
        journaled = false;
    publish(volume, std::move(events));
    indexReady_ = true;
    return journaled;
}

void TremorService::noteUnwatched(Volume& volume, const FileChange& change) {
    // A tree that is gone or unmounted has nothing left to rescan.
    if (change.error == ENOENT || change.error == ENODEV) {
        logError("A tree is not watched: " + change.path);
        return;
    }
    // The backend has said why, once for the watch limit; one line per folder would flood the
    // log when a large tree is past the limit.
    logDebug([&] { return "Rescanning rather than watching " + change.path; });
    struct statx st {};
    if (!FileStamp::read(change.path, st) || !S_ISDIR(st.stx_mode))
        return;
    if (std::find(volume.unwatched.begin(), volume.unwatched.end(), st.stx_ino) !=
        volume.unwatched.end())
        return;
    volume.unwatched.push_back(st.stx_ino);
    ++unwatchedFolders_;
}

void TremorService::rescanUnwatched(Volume& volume) {
    for (size_t i = 0; i < volume.unwatched.size();) {
        auto events = volume.writer->rescan(volume.unwatched[i]);
        if (!events.ok() && events.error().domain() != std::string_view(kSqliteErrorDomain)) {
            // Gone from the trees: whatever took its place is watched when it appears.
            volume.unwatched.erase(volume.unwatched.begin() + static_cast<ptrdiff_t>(i));
            --unwatchedFolders_;
            continue;
        }
        const bool failed = !events.ok();
        publish(volume, std::move(events));
        if (failed) {
            settleLoss(volume, kTremorUserDropped | kTremorMustScanSubdirs);
            return;
        }
        ++i;
    }
}

void TremorService::publish(const Volume& volume, Result<std::vector<JournalEvent>> events) {
    if (!events.ok()) {
        logError("Could not journal events: " + events.error().description());
        return;
    }
    if (events.value().empty())
        return;
    std::lock_guard lock(listenersMutex_);
    for (auto& [token, listener] : listeners_) listener(volume.device.load(), events.value());
}

uint64_t TremorService::currentEventId() {
    catchUp();
    std::lock_guard lock(volumesMutex_);
    uint64_t last = 0;
    for (const auto& volume : volumes_) last = std::max(last, volume->store->lastEventId());
    return last;
}

std::string TremorService::uuidForDevice(uint32_t device) {
    sync();
    TremorStore* store = storeForDevice(device);
    return store ? store->uuid() : std::string();
}

uint64_t TremorService::addListener(Listener listener) {
    std::lock_guard lock(listenersMutex_);
    uint64_t token = nextListener_++;
    listeners_[token] = std::move(listener);
    return token;
}

void TremorService::removeListener(uint64_t token) {
    std::lock_guard lock(listenersMutex_);
    listeners_.erase(token);
}

}  // namespace tamber
