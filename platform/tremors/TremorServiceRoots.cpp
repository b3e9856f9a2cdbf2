#include "platform/tremors/TremorService.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/Url.h"
#include "platform/strata/StrataService.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/WatchedRoots.h"
#include "support/Log.h"

// Which trees the service watches: the stores found at start, the roots a run asks for,
// those it leaves aside or forgets, and which volume and root a path belongs to. The event
// pipeline and the service's lifetime are in TremorService.cpp.
namespace tamber {

namespace {

bool isVolumeDirectoryName(const std::string& name) {
    if (name.size() != 16)
        return false;
    for (char c : name) {
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f')))
            return false;
    }
    return true;
}

}  // namespace

Status TremorService::openExistingStores() {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(stateDir_, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::vector<FileSystem::DirectoryEntry> entries;
    if (fd.ok()) {
        fs.readDirectory(fd.get(), entries);
        fd.reset();
    }
    // Always in the same order, so that two processes waiting for each other's stores cannot
    // each hold one the other wants.
    std::vector<std::string> names;
    for (const auto& entry : entries) {
        if (isVolumeDirectoryName(entry.name))
            names.push_back(entry.name);
    }
    std::sort(names.begin(), names.end());
    for (const auto& name : names) {
        uint64_t fsid = std::stoull(name, nullptr, 16);
        auto store = TremorStore::open(stateDir_, fsid, lockWait_);
        if (!store.ok())
            return store.error();
        pruneVanishedRoots(*store.value());
        std::lock_guard lock(volumesMutex_);
        // Kept open: the roots it remembers are watched only when asked for, and the store of
        // their volume must then be this one, not a second opening.
        if (auto added = addVolume(fsid, std::move(store).value()); !added.ok())
            return added.error();
    }
    indexReady_ = true;
    return Status::OK();
}

void TremorService::pruneVanishedRoots(TremorStore& store) {
    for (const auto& root : store.rememberedRoots()) {
        if (root.path == TremorStore::kDocumentIdRoot)
            continue;
        struct statx st {};
        if (FileSystem::current().statx(AT_FDCWD, root.path, AT_SYMLINK_NOFOLLOW, STATX_TYPE,
                                        &st) == 0
                ? S_ISDIR(st.stx_mode)
                : errno != ENOENT && errno != ENOTDIR)
            continue;  // there, or not known to be gone (unreadable, say)
        auto forgotten = store.forgetRoot(root.path);
        if (!forgotten.ok()) {
            logError("Cannot forget the vanished tree " + root.path + ": " +
                     forgotten.error().description());
            continue;
        }
        logInfo("Forgot the remembered tree " + root.path + ": it no longer exists (" +
                std::to_string(forgotten.value().entries) + " index entries dropped)");
    }
}

Result<TremorService::Volume*> TremorService::addVolume(uint64_t fsid,
                                                        std::unique_ptr<TremorStore> store) {
    auto volume = std::make_unique<Volume>();
    volume->fsid = fsid;
    volume->store = std::move(store);
    bool hasDocIdRoot = false;
    for (const auto& root : volume->store->roots())
        hasDocIdRoot |= root.path == TremorStore::kDocumentIdRoot;
    if (!hasDocIdRoot) {
        if (auto error =
                volume->store->addRoot(TremorStore::kDocumentIdRoot, volume->store->lastEventId());
            !error.ok())
            return error.error();
    }
    volumes_.push_back(std::move(volume));
    return volumes_.back().get();
}

Result<TremorService::Volume*> TremorService::openVolume(uint64_t fsid, uint32_t device) {
    Volume* volume = nullptr;
    for (auto& existing : volumes_) {
        if (existing->fsid == fsid)
            volume = existing.get();
    }
    if (!volume) {
        auto store = TremorStore::open(stateDir_, fsid, lockWait_);
        if (!store.ok())
            return store.error();
        auto added = addVolume(fsid, std::move(store).value());
        if (!added.ok())
            return added.error();
        volume = added.value();
    }
    volume->device = device;
    if (!volume->writer)
        volume->writer = std::make_unique<JournalWriter>(*volume->store, device);
    return volume;
}

Result<TremorService::Volume*> TremorService::volumeFor(const std::string& path) {
    struct statvfs vfs {};
    if (FileSystem::current().statvfs(path, &vfs) != 0)
        return Error::posix(errno);
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, 0, STATX_INO, &st) != 0)
        return Error::posix(errno);
    std::lock_guard lock(volumesMutex_);
    return openVolume(static_cast<uint64_t>(vfs.f_fsid),
                      encodeDevice(st.stx_dev_major, st.stx_dev_minor));
}

Status TremorService::watchTree(const std::string& path) {
    if (stopped_)
        return Error::posix(ESHUTDOWN);
    std::string root = WatchedRoots::normalised(path);
    if (isWatched(root))
        return Status::OK();
    // A tree's history starts after what is journaled by now: a replay from before it must not
    // pass for complete because queued events of other trees got their IDs later.
    sync();
    return watch(root);
}

std::vector<std::pair<std::string, Error>> TremorService::watchTrees(
    const std::vector<std::string>& paths) {
    std::vector<std::pair<std::string, Error>> failed;
    if (stopped_) {
        for (const auto& path : paths) failed.emplace_back(path, Error::posix(ESHUTDOWN));
        return failed;
    }
    sync();  // as watchTree() does
    Resumed resumed;
    for (const auto& path : paths) {
        std::string root = WatchedRoots::normalised(path);
        if (isWatched(root))
            continue;
        if (auto status = watch(root, &resumed); !status.ok())
            failed.emplace_back(path, status.error());
    }
    reconcileResumed(resumed);
    return failed;
}

void TremorService::reconcileResumed(const Resumed& resumed) {
    std::lock_guard write(writeMutex_);
    for (const auto& [volume, paths] : resumed)
        publish(*volume, volume->writer->reconcile(paths, true));
}

Status TremorService::watch(const std::string& path, Resumed* resumedLater) {
    if (isWatched(path))
        return Status::OK();
    auto volume = volumeFor(path);
    if (!volume.ok())
        return volume.error();
    Volume& v = *volume.value();
    std::lock_guard write(writeMutex_);
    struct statx st {};
    if (FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_INO | STATX_TYPE,
                                    &st) != 0)
        return Error::posix(errno);
    if (!S_ISDIR(st.stx_mode))
        return Error::posix(ENOTDIR);
    // Watched without a gap until the last run stopped: the history goes on. Anything else
    // (new, left aside by a run, forgotten) starts anew from here.
    bool resumed = v.store->resumeRoot(path);
    if (!resumed) {
        // A gap in a known tree's history is journaled, so that the history starting here
        // begins after an ID that no anchor from before the gap can hold.
        if (v.store->knowsRoot(path))
            publish(v,
                    v.writer->journalDropped({path}, kTremorUserDropped | kTremorMustScanSubdirs));
        if (auto status = v.store->addRoot(path, v.store->lastEventId(), st.stx_ino); !status.ok())
            return status;
    }
    {
        std::lock_guard lock(volumesMutex_);
        roots_.emplace_back(path, &v);
    }
    std::vector<FileChange> discovered;
    Status watched = backend_->watchTree(path, discovered);
    if (!discovered.empty())
        enqueue(std::move(discovered));
    if (!watched.ok()) {
        std::lock_guard lock(volumesMutex_);
        std::erase_if(roots_, [&](const auto& root) { return root.first == path; });
        v.store->releaseRoot(path);
        return watched;
    }
    // Watched first, then crawled: nothing that changes from now on is missed. What changed
    // while no run watched a resumed tree is journaled, as live watching would have.
    if (resumed && resumedLater)
        (*resumedLater)[&v].push_back(path);
    else
        publish(v, v.writer->reconcile(path, resumed));
    return Status::OK();
}

Status TremorService::watchRemembered() {
    std::vector<std::string> paths;
    {
        std::lock_guard lock(volumesMutex_);
        for (const auto& volume : volumes_) {
            for (const auto& root : volume->store->roots()) {
                if (root.path != TremorStore::kDocumentIdRoot)
                    paths.push_back(root.path);
            }
        }
    }
    Status first;
    for (const auto& [path, error] : watchTrees(paths)) {
        logError("A remembered tree is not watched: " + path + ": " + error.description());
        if (first.ok())
            first = error;
    }
    return first;
}

std::vector<std::string> TremorService::retireUnwatched() {
    std::lock_guard write(writeMutex_);
    std::vector<TremorStore*> stores;
    {
        std::lock_guard lock(volumesMutex_);
        for (const auto& volume : volumes_) stores.push_back(volume->store.get());
    }
    std::vector<std::string> all;
    for (TremorStore* store : stores) {
        auto retired = store->retireRoots();
        if (!retired.ok()) {
            logError("Cannot mark the trees this run left aside: " + retired.error().description());
            continue;
        }
        for (auto& path : retired.value()) {
            logDebug([&] { return "No longer watched: " + path; });
            all.push_back(std::move(path));
        }
    }
    return all;
}

Result<TremorStore::Forgotten> TremorService::forget(const std::string& rawPath) {
    std::string path = WatchedRoots::normalised(rawPath);
    std::lock_guard write(writeMutex_);
    TremorStore* owner = nullptr;
    {
        std::lock_guard lock(volumesMutex_);
        for (const auto& volume : volumes_) {
            for (const auto& root : volume->store->rememberedRoots()) {
                if (root.path == path && path != TremorStore::kDocumentIdRoot)
                    owner = volume->store.get();
            }
        }
        // What the kernel still reports for it is dropped from now on (unless another
        // watched tree holds it); its kernel watches go with the process.
        if (owner)
            std::erase_if(roots_, [&](const auto& root) { return root.first == path; });
    }
    if (!owner) {
        return Error(kPosixErrorDomain, ENOENT,
                     {{"description", path + " is not a remembered tree of the event journal"}});
    }
    return owner->forgetRoot(path);
}

bool TremorService::isWatched(const std::string& path) const {
    std::lock_guard lock(volumesMutex_);
    for (const auto& root : roots_) {
        if (WatchedRoots::isAtOrBelow(path, root.first))
            return true;
    }
    return false;
}

TremorService::Volume* TremorService::ownerOf(const std::string& path) const {
    std::lock_guard lock(volumesMutex_);
    const std::pair<std::string, Volume*>* best = nullptr;
    for (const auto& root : roots_) {
        if (WatchedRoots::isAtOrBelow(path, root.first) &&
            (!best || root.first.size() > best->first.size()))
            best = &root;
    }
    return best ? best->second : nullptr;
}

std::vector<std::string> TremorService::rootPaths(const Volume& volume) const {
    std::lock_guard lock(volumesMutex_);
    std::vector<std::string> paths;
    for (const auto& root : roots_) {
        if (root.second == &volume)
            paths.push_back(root.first);
    }
    return paths;
}

TremorStore* TremorService::storeForDevice(uint32_t device) const {
    std::lock_guard lock(volumesMutex_);
    for (const auto& volume : volumes_) {
        if (device != 0 && volume->device == device)
            return volume->store.get();
    }
    return nullptr;
}

std::optional<uint32_t> TremorService::deviceForPath(const std::string& path) const {
    Volume* volume = ownerOf(path);
    if (!volume)
        return std::nullopt;
    std::lock_guard lock(volumesMutex_);
    return volume->device.load();
}

}  // namespace tamber
