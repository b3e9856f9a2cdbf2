#include "host/StagingCopies.h"

#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <random>
#include <vector>

#include "host/FileTree.h"
#include "host/PublishedTrees.h"
#include "platform/FileContents.h"
#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Log.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

std::mutex& overrideMutex() {
    static ProcessWide<std::mutex> mutex;
    return *mutex;
}

std::string& ledgerOverride() {
    static ProcessWide<std::string> path;
    return *path;
}

// "<pid>-<random>": the ledger's name for a staging copy.
std::string ledgerNameOf(const std::string& stagingPath) {
    size_t slash = stagingPath.rfind('/');
    std::string name = slash == std::string::npos ? stagingPath : stagingPath.substr(slash + 1);
    std::string_view prefix(StagingCopies::kPrefix);
    if (!name.starts_with(prefix))
        return {};
    return name.substr(prefix.size());
}

bool processIsAlive(long pid) {
    // EPERM: it exists but is someone else's.
    return ::kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM;
}

}  // namespace

std::string StagingCopies::ledgerDirectory() {
    {
        std::lock_guard lock(overrideMutex());
        if (!ledgerOverride().empty())
            return ledgerOverride();
    }
    if (const char* state = std::getenv("XDG_STATE_HOME"); state && *state == '/')
        return std::string(state) + "/tamber/staging";
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "") + "/.local/state/tamber/staging";
}

std::string StagingCopies::setLedgerDirectoryForTesting(std::string path) {
    std::lock_guard lock(overrideMutex());
    std::swap(ledgerOverride(), path);
    return path;
}

std::string StagingCopies::makeName() {
    static thread_local std::mt19937_64 random(std::random_device{}());
    char suffix[17];
    std::snprintf(suffix, sizeof suffix, "%016llx", static_cast<unsigned long long>(random()));
    return std::string(kPrefix) + std::to_string(::getpid()) + "-" + suffix;
}

long StagingCopies::pidOfName(const std::string& name) {
    std::string_view text(name);
    if (text.starts_with(kPrefix))
        text.remove_prefix(std::string_view(kPrefix).size());
    long pid = 0;
    auto [ptr, ec] = std::from_chars(text.data(), text.data() + text.size(), pid);
    if (ec != std::errc() || ptr == text.data() || ptr == text.data() + text.size() ||
        *ptr != '-' || pid <= 0)
        return 0;
    return pid;
}

void StagingCopies::record(const std::string& path) {
    std::string name = ledgerNameOf(path);
    if (name.empty())
        return;
    std::string ledger = ledgerDirectory();
    if (auto status = FileContents::createDirectory(Url::fileURLWithPath(ledger)); !status.ok()) {
        logError("can't create staging ledger " + ledger + "; " + status.error().description());
        return;
    }
    FileSystem& fs = FileSystem::current();
    ScopedFd dir(fs.open(ledger, O_PATH | O_DIRECTORY));
    if (!dir.ok() || fs.symlinkat(path, dir.get(), name) != 0) {
        logError("can't record staging copy " + path + "; " +
                 Error::errorWithPOSIXCode(errno).description());
    }
}

void StagingCopies::forget(const std::string& path) {
    std::string name = ledgerNameOf(path);
    if (name.empty())
        return;
    FileSystem& fs = FileSystem::current();
    ScopedFd dir(fs.open(ledgerDirectory(), O_PATH | O_DIRECTORY));
    if (dir.ok() && fs.unlinkat(dir.get(), name, 0) != 0 && errno != ENOENT) {
        logError("can't forget staging copy " + path + "; " +
                 Error::errorWithPOSIXCode(errno).description());
    }
}

size_t StagingCopies::sweepStale() {
    FileSystem& fs = FileSystem::current();
    ScopedFd dir(fs.open(ledgerDirectory(), O_RDONLY | O_DIRECTORY));
    if (!dir.ok())
        return 0;  // no ledger: nothing was ever staged
    std::vector<FileSystem::DirectoryEntry> entries;
    if (!fs.readDirectory(dir.get(), entries))
        return 0;
    size_t removed = 0;
    for (const auto& entry : entries) {
        long pid = pidOfName(entry.name);
        if (pid == 0 || processIsAlive(pid))
            continue;
        auto target = filetree::readLink(dir.get(), entry.name);
        if (target.ok()) {
            Url copy = Url::fileURLWithPath(*target);
            // Only what the ledger entry names: a staging copy of that process, inside the trees.
            bool isItsCopy = copy.lastPathComponent() == std::string(kPrefix) + entry.name;
            auto parent = isItsCopy ? PublishedTrees::openParent(copy, O_PATH)
                                    : Result<PublishedTrees::Parent>(Error::posix(EINVAL));
            if (parent.ok()) {
                ScopedFd folder(parent.value().fd);
                Status status = filetree::removeItem(folder.get(), parent.value().name);
                if (status.ok()) {
                    ++removed;
                    logInfo("removed stale staging copy " + copy.path());
                } else if (!status.error().is(kPosixErrorDomain, ENOENT)) {
                    logError("can't remove stale staging copy " + copy.path() + "; " +
                             status.error().description());
                    continue;  // keep the record: a later sweep tries again
                }
            }
        }
        fs.unlinkat(dir.get(), entry.name, 0);
    }
    return removed;
}

}  // namespace tamber
