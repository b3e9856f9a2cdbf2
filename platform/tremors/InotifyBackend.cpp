#include "platform/tremors/InotifyBackend.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cerrno>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Log.h"
#include "support/MutexLock.h"

namespace tamber {

namespace {

using Kind = FileChange::Kind;

std::string joinPath(const std::string& dir, const std::string& name) {
    return dir == "/" ? dir + name : dir + "/" + name;
}

// The directory is no longer there (or is no longer a directory): whoever removed or replaced
// it is reported by the watch of its parent, so there is nothing to complain about.
bool vanished(int error) {
    return error == ENOENT || error == ENOTDIR || error == ELOOP;
}

FileChange created(std::string path, bool isDirectory) {
    FileChange change;
    change.kind = Kind::Created;
    change.path = std::move(path);
    change.isDirectory = isDirectory;
    return change;
}

}  // namespace

Result<std::unique_ptr<InotifyBackend>> InotifyBackend::start(std::shared_ptr<InotifyApi> api) {
    int inotifyFd = api->init(IN_NONBLOCK | IN_CLOEXEC);
    if (inotifyFd < 0) {
        int error = errno;
        logError(formatPlatform("Cannot start watching files: inotify_init1 failed %{errno}d",
                                {ErrnoArg{error}}));
        return Error::posix(error);
    }
    int stopFd = api->eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (stopFd < 0) {
        int error = errno;
        api->close(inotifyFd);
        logError(formatPlatform("Cannot start watching files: eventfd failed %{errno}d",
                                {ErrnoArg{error}}));
        return Error::posix(error);
    }
    struct statx st {};
    bool haveProc = FileSystem::current().statx(AT_FDCWD, "/proc/self/fd", 0, STATX_TYPE, &st) == 0;
    if (!haveProc)
        logInfo("/proc is not available: directories are watched by path");
    return std::make_unique<InotifyBackend>(Private{}, std::move(api), inotifyFd, stopFd, haveProc);
}

InotifyBackend::InotifyBackend(Private, std::shared_ptr<InotifyApi> api, int inotifyFd, int stopFd,
                               bool watchThroughDescriptors)
    : api_(std::move(api)),
      inotifyFd_(inotifyFd),
      stopFd_(stopFd),
      watchThroughDescriptors_(watchThroughDescriptors),
      buffer_(kReadBufferSize) {}

InotifyBackend::~InotifyBackend() {
    // Closing the instance removes all of its watches.
    api_->close(inotifyFd_);
    api_->close(stopFd_);
}

Status InotifyBackend::watchTree(const std::string& root, std::vector<FileChange>& discovered) {
    if (root.empty() || root.front() != '/')
        return Error::invalidParameter("root", root);
    std::string top = root;
    while (top.size() > 1 && top.back() == '/') top.pop_back();

    MutexLock lock(mutex_);
    int error = watchDirectories(top, false, discovered);
    if (error == 0) {
        if (std::find(roots_.begin(), roots_.end(), top) == roots_.end())
            roots_.push_back(top);
        return Status::OK();
    }
    // Asked for explicitly, so even a missing root is worth a line.
    if (vanished(error))
        reportUnwatched(top, error, discovered);
    return Error::posix(error);
}

bool InotifyBackend::wait(int timeoutMs) {
    if (stopRequested_.load())
        return false;
    if (readingCutShort_.load())
        return true;
    struct pollfd fds[2] = {{inotifyFd_, POLLIN, 0}, {stopFd_, POLLIN, 0}};
    if (api_->poll(fds, 2, timeoutMs) < 0 && errno != EINTR)
        logError(formatPlatform("Cannot wait for inotify events: %{errno}d", {ErrnoArg{errno}}));
    // The stop counter is never read back, so every later wait sees it too.
    return !(fds[1].revents & POLLIN) && !stopRequested_.load();
}

void InotifyBackend::consume(std::vector<FileChange>& out) {
    MutexLock lock(mutex_);
    size_t bytes = 0;
    for (size_t i = 0; i < kReadsPerConsume; ++i) {
        if (!readOnce(out, bytes) && !awaitMovePartner()) {
            finishReading(out, true);
            return;
        }
    }
    readingCutShort_.store(true);
}

void InotifyBackend::drain(std::vector<FileChange>& out) {
    MutexLock lock(mutex_);
    // Events queued after this point may come along too; those before it all do.
    int queued = api_->queuedBytes(inotifyFd_);
    size_t bytes = 0;
    // Nothing queued: a read would only answer EAGAIN (every identifier asked syncs, and
    // passes here).
    bool queueEmpty = queued == 0 && !translator_.hasPendingMoves();
    while (!queueEmpty) {
        if (!readOnce(out, bytes) && !awaitMovePartner()) {
            queueEmpty = true;
            break;
        }
        if (queued >= 0 && bytes >= static_cast<size_t>(queued) && !translator_.hasPendingMoves())
            break;
    }
    finishReading(out, queueEmpty);
}

void InotifyBackend::requestStop() {
    stopRequested_.store(true);
    if (api_->signal(stopFd_) < 0)
        logError(formatPlatform("Cannot wake the inotify reader: %{errno}d", {ErrnoArg{errno}}));
}

size_t InotifyBackend::watchCount() const {
    MutexLock lock(mutex_);
    return translator_.watchCount();
}

bool InotifyBackend::readOnce(std::vector<FileChange>& out, size_t& bytesRead) {
    ssize_t n;
    do {
        n = api_->read(inotifyFd_, buffer_.data(), buffer_.size());
    } while (n < 0 && errno == EINTR);
    if (n <= 0) {
        if (n < 0 && errno != EAGAIN)
            logError(formatPlatform("Cannot read inotify events: %{errno}d", {ErrnoArg{errno}}));
        return false;
    }
    bytesRead += static_cast<size_t>(n);
    std::vector<FileChange> changes;
    if (!translator_.translate(buffer_.data(), static_cast<size_t>(n), changes))
        logError("Unreadable inotify event record: the events after it are lost");
    dropOrphanedWatches();
    handle(changes, out);
    return true;
}

bool InotifyBackend::awaitMovePartner() {
    if (!translator_.hasPendingMoves())
        return false;
    struct pollfd fd = {inotifyFd_, POLLIN, 0};
    int ready;
    do {
        ready = api_->poll(&fd, 1, kMovePartnerWaitMs);
    } while (ready < 0 && errno == EINTR);
    return ready > 0 && (fd.revents & POLLIN);
}

void InotifyBackend::finishReading(std::vector<FileChange>& out, bool queueEmpty) {
    readingCutShort_.store(false);
    // The two halves of a rename are queued together, so with the queue read to the end a
    // lone first half is a move out of the trees.
    std::vector<FileChange> changes;
    translator_.flushPendingMoves(changes);
    dropOrphanedWatches();
    handle(changes, out);
    // Any rename that made a directory vanish happened before it was missed, so it has been
    // read by now.
    if (queueEmpty)
        vanished_.clear();
}

void InotifyBackend::dropOrphanedWatches() {
    // Their removal is queued as IN_IGNORED for watches the translator no longer knows.
    for (int wd : translator_.takeOrphanedWatches()) api_->removeWatch(inotifyFd_, wd);
}

void InotifyBackend::handle(std::vector<FileChange>& changes, std::vector<FileChange>& out) {
    for (FileChange& change : changes) {
        const Kind kind = change.kind;
        if (kind == Kind::Overflow) {
            logError("The kernel dropped file system events; the watched trees need a rescan");
        } else if (kind == Kind::WatchFailed) {
            logError(formatPlatform("Stopped watching %@: %{errno}d",
                                    {change.path, ErrnoArg{change.error}}));
        }
        const bool appeared =
            change.isDirectory && (kind == Kind::Created || kind == Kind::Renamed);
        std::string path = appeared ? change.path : std::string();
        std::string from = kind == Kind::Renamed ? change.fromPath : std::string();
        out.push_back(std::move(change));
        if (kind == Kind::Overflow) {
            // Lost events may have moved watched directories (their watches now answer for
            // paths they no longer have) and made new ones that no watch covers: every tree
            // is walked again, each watch given its directory's path now.
            for (const std::string& root : roots_) watchDirectories(root, false, out, true);
            continue;
        }
        if (!appeared)
            continue;
        // A directory renamed within the trees is normally watched already, and then this
        // costs one call; one that was never watched is watched and listed now.
        watchDirectories(path, true, out);
        if (!from.empty())
            rewatchMoved(from, path, out);
    }
}

void InotifyBackend::rewatchMoved(const std::string& from, const std::string& to,
                                  std::vector<FileChange>& out) {
    if (vanished_.empty())
        return;
    const std::string prefix = from + "/";
    std::vector<std::string> moved;
    for (const std::string& path : vanished_) {
        if (path.starts_with(prefix))
            moved.push_back(to + path.substr(from.size()));
    }
    for (const std::string& path : moved) watchDirectories(path, true, out);
}

int InotifyBackend::watchDirectories(const std::string& top, bool reportContents,
                                     std::vector<FileChange>& out, bool refresh) {
    // An explicit stack: trees can be deeper than the call stack is.
    std::vector<std::string> stack;
    int topError = watchOne(top, stack, reportContents, out, refresh);
    while (!stack.empty()) {
        std::string path = std::move(stack.back());
        stack.pop_back();
        watchOne(path, stack, reportContents, out, refresh);
    }
    return topError;
}

int InotifyBackend::watchOne(const std::string& path, std::vector<std::string>& subdirectories,
                             bool reportContents, std::vector<FileChange>& out, bool refresh) {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW, 0));
    if (!fd.ok()) {
        int error = errno;
        if (vanished(error))
            vanished_.push_back(path);
        else
            reportUnwatched(path, error, out);
        return error;
    }
    // Watching the open descriptor rather than the path makes the watched directory the one
    // listed below, even if the path is renamed or replaced in between. The trailing "/."
    // passes through the descriptor's link, so IN_DONT_FOLLOW does not stop at it.
    std::string target =
        watchThroughDescriptors_ ? "/proc/self/fd/" + std::to_string(fd.get()) + "/." : path;
    int wd = api_->addWatch(inotifyFd_, target, kWatchMask);
    if (wd < 0) {
        int error = errno;
        if (vanished(error))
            vanished_.push_back(path);
        else
            reportUnwatched(path, error, out, error == ENOSPC);  // ENOSPC: the watch limit
        return error;
    }
    if (translator_.addWatch(wd, path) && !refresh) {
        // Watched before: what is inside was listed then or reported since.
        return 0;
    }
    logDebug([&] { return "Watching " + path; });

    std::vector<FileSystem::DirectoryEntry> entries;
    if (!fs.readDirectory(fd.get(), entries)) {
        // Watched, but what it held before the watch is not known: the trees are compared
        // with the index, as after lost events, rather than this folder given up.
        logError(formatPlatform("Cannot list %@: %{errno}d; rescanning the watched trees",
                                {path, ErrnoArg{errno}}));
        FileChange rescan;
        rescan.kind = Kind::Overflow;
        out.push_back(std::move(rescan));
        return 0;
    }
    for (const auto& entry : entries) {
        bool isDirectory = entry.type == DT_DIR;
        if (entry.type == DT_UNKNOWN) {
            struct statx st {};
            isDirectory =
                fs.statx(fd.get(), entry.name, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) == 0 &&
                S_ISDIR(st.stx_mode);
        }
        std::string child = joinPath(path, entry.name);
        if (reportContents)
            out.push_back(created(child, isDirectory));
        if (isDirectory)
            subdirectories.push_back(std::move(child));
    }
    return 0;
}

void InotifyBackend::reportUnwatched(const std::string& path, int error,
                                     std::vector<FileChange>& out, bool watchLimit) {
    if (!watchLimit) {
        logError(
            formatPlatform("Cannot watch %@: %{errno}d; changes in that tree are not journaled",
                           {path, ErrnoArg{error}}));
    } else if (!watchLimitLogged_.exchange(true)) {
        logError("Cannot watch " + path +
                 ": the limit of inotify watches (fs.inotify.max_user_watches) is reached; "
                 "folders past it are rescanned when changes are asked for, not watched. "
                 "Raise it with \"sysctl -w fs.inotify.max_user_watches=524288\" (and a file "
                 "in /etc/sysctl.d/ to keep it)");
    } else {
        logDebug([&] { return "Cannot watch " + path + ": the watch limit is reached"; });
    }
    FileChange change;
    change.kind = Kind::WatchFailed;
    change.path = path;
    change.isDirectory = true;
    change.error = error;
    out.push_back(std::move(change));
}

}  // namespace tamber
