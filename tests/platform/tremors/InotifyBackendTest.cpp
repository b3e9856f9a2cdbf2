#include "platform/tremors/InotifyBackend.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <utility>

#include "platform/LinuxFileSystem.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/InotifyTestSupport.h"

namespace tamber {
namespace {

using namespace tamber::testing;
using Changes = std::vector<FileChange>;
using Kind = FileChange::Kind;
namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

// The real calls, except add_watch for directories whose path contains one of the given
// strings. Watches are added through "/proc/self/fd/N/.", so the descriptor is resolved first.
class FaultyInotifyApi : public LinuxInotifyApi {
public:
    void failAddWatch(std::string pathSubstring, int error) {
        std::lock_guard lock(mutex_);
        failures_[std::move(pathSubstring)] = error;
    }
    void clear() {
        std::lock_guard lock(mutex_);
        failures_.clear();
    }

    int addWatch(int fd, const std::string& path, uint32_t mask) override {
        std::string target = resolve(path);
        {
            std::lock_guard lock(mutex_);
            for (const auto& [substring, error] : failures_) {
                if (target.find(substring) != std::string::npos) {
                    errno = error;
                    return -1;
                }
            }
        }
        return LinuxInotifyApi::addWatch(fd, path, mask);
    }

private:
    static std::string resolve(const std::string& path) {
        const std::string prefix = "/proc/self/fd/";
        if (!path.starts_with(prefix))
            return path;
        std::string link = path.substr(0, path.find('/', prefix.size()));
        char target[4096];
        ssize_t n = ::readlink(link.c_str(), target, sizeof target);
        return n < 0 ? path : std::string(target, static_cast<size_t>(n));
    }

    std::mutex mutex_;
    std::map<std::string, int> failures_;
};

// The real file system, with hooks that let a test act at the worst moment.
class HookedFileSystem : public LinuxFileSystem {
public:
    std::function<void(const std::string& path)> beforeOpen;
    std::function<void()> afterListing;

    int open(const std::string& path, int flags, mode_t mode) override {
        if (beforeOpen)
            beforeOpen(path);
        return LinuxFileSystem::open(path, flags, mode);
    }
    bool readDirectory(int dirfd, std::vector<DirectoryEntry>& out) override {
        bool ok = LinuxFileSystem::readDirectory(dirfd, out);
        if (afterListing)
            afterListing();
        return ok;
    }
};

// `expected` occurs in `actual` in this order; other changes may sit between.
::testing::AssertionResult inOrder(const Changes& actual, const Changes& expected) {
    auto at = actual.begin();
    for (const FileChange& want : expected) {
        at = std::find(at, actual.end(), want);
        if (at == actual.end()) {
            return ::testing::AssertionFailure()
                   << ::testing::PrintToString(want) << " missing or out of order in "
                   << ::testing::PrintToString(actual);
        }
        ++at;
    }
    return ::testing::AssertionSuccess();
}

bool mentions(const Changes& changes, const std::string& path) {
    return std::any_of(changes.begin(), changes.end(), [&](const FileChange& c) {
        return c.path.find(path) != std::string::npos || c.fromPath.find(path) != std::string::npos;
    });
}

class InotifyBackendTest : public ::testing::Test {
protected:
    void SetUp() override {
        auto started = InotifyBackend::start(api_);
        ASSERT_TRUE(started.ok()) << started.error().description();
        backend_ = std::move(started).value();
        root_ = dir_.makeDir("root");
    }

    void watchRoot() {
        Changes discovered;
        Status status = backend_->watchTree(root_, discovered);
        ASSERT_FALSE(status.has_value()) << status->description();
        ASSERT_EQ(discovered, Changes{});
    }

    // Every event the kernel queued so far, twice over so that events caused by the first
    // round's own work (a listing racing a writer) are in too.
    Changes drain() {
        Changes out;
        backend_->drain(out);
        backend_->drain(out);
        return out;
    }

    std::string path(const std::string& relative) const { return root_ + "/" + relative; }
    static void write(const std::string& path, const std::string& contents = "x") {
        std::ofstream(path, std::ios::binary) << contents;
    }

    TempDir dir_;
    TempDir outside_;
    std::string root_;
    std::shared_ptr<FaultyInotifyApi> api_ = std::make_shared<FaultyInotifyApi>();
    std::unique_ptr<InotifyBackend> backend_;
};

TEST_F(InotifyBackendTest, ReportsChangesWithTheirPaths) {
    fs::create_directory(path("docs"));
    watchRoot();
    EXPECT_EQ(backend_->watchCount(), 2u);

    write(path("docs/a.txt"), "hello");
    fs::rename(path("docs/a.txt"), path("docs/b.txt"));
    fs::create_directory(path("new"));
    fs::rename(path("new"), path("newer"));
    fs::permissions(path("docs/b.txt"), fs::perms::owner_read);
    fs::remove(path("docs/b.txt"));
    fs::remove(path("newer"));
    // One drain: everything queued before it comes back, with no waiting.
    Changes changes;
    backend_->drain(changes);
    EXPECT_TRUE(inOrder(changes, {
                                     created(path("docs/a.txt")),
                                     modified(path("docs/a.txt")),
                                     renamed(path("docs/a.txt"), path("docs/b.txt")),
                                     created(path("new"), true),
                                     renamed(path("new"), path("newer"), true),
                                     attributes(path("docs/b.txt")),
                                     removed(path("docs/b.txt")),
                                     removed(path("newer"), true),
                                 }));
    for (const FileChange& change : changes)
        EXPECT_NE(change.kind, Kind::WatchFailed) << ::testing::PrintToString(change);
    EXPECT_EQ(backend_->watchCount(), 2u) << "the removed directory's watch is gone";
}

TEST_F(InotifyBackendTest, ATreeMovedInIsReportedEntryByEntryAndWatched) {
    watchRoot();
    std::string tree = outside_.makeDir("tree");
    write(tree + "/f1");
    fs::create_directories(tree + "/sub/deeper");
    write(tree + "/sub/f2");
    write(tree + "/sub/deeper/f3");
    fs::create_symlink(tree + "/sub", tree + "/link");
    fs::rename(tree, path("tree"));

    Changes changes = drain();
    EXPECT_TRUE(inOrder(
        changes, {created(path("tree"), true), created(path("tree/sub"), true),
                  created(path("tree/sub/deeper"), true), created(path("tree/sub/deeper/f3"))}));
    EXPECT_TRUE(inOrder(changes, {created(path("tree"), true), created(path("tree/f1"))}));
    EXPECT_TRUE(inOrder(changes, {created(path("tree/sub"), true), created(path("tree/sub/f2"))}));
    EXPECT_TRUE(inOrder(changes, {created(path("tree"), true), created(path("tree/link"))}))
        << "a link is an entry, not a directory";
    EXPECT_EQ(backend_->watchCount(), 4u) << "root, tree, sub, deeper; the link is not followed";

    write(path("tree/sub/deeper/late"));
    EXPECT_EQ(drain(), (Changes{created(path("tree/sub/deeper/late")),
                                modified(path("tree/sub/deeper/late"))}));
}

TEST_F(InotifyBackendTest, WatchesANewDirectoryBeforeListingIt) {
    auto hooked = std::make_shared<HookedFileSystem>();
    ScopedFileSystem scoped(hooked);
    watchRoot();
    // Written before the watch exists: only the listing can find it. Written right after the
    // listing: only the watch can, so it must already be in place.
    bool armed = false;
    hooked->beforeOpen = [&](const std::string& opened) {
        if (opened == path("fresh")) {
            write(path("fresh/early"));
            armed = true;
        }
    };
    hooked->afterListing = [&] {
        if (std::exchange(armed, false))
            write(path("fresh/late"));
    };
    fs::create_directory(path("fresh"));
    Changes changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("fresh"), true), created(path("fresh/early"))}));
    EXPECT_TRUE(inOrder(changes, {created(path("fresh"), true), created(path("fresh/late"))}));
}

TEST_F(InotifyBackendTest, ADirectoryRenamedBeforeItWasWatchedIsWatchedWhereItWent) {
    watchRoot();
    fs::create_directories(path("p/q"));
    write(path("p/q/f"));
    fs::rename(path("p"), path("r"));
    Changes changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("p"), true), renamed(path("p"), path("r"), true),
                                  created(path("r/q"), true), created(path("r/q/f"))}));

    // Renamed while its parent was being listed: the rename, read later, says where it is.
    auto hooked = std::make_shared<HookedFileSystem>();
    ScopedFileSystem scoped(hooked);
    hooked->beforeOpen = [&](const std::string& opened) {
        if (opened == path("s/t"))
            fs::rename(path("s"), path("u"));
    };
    fs::create_directories(path("s/t"));
    write(path("s/t/f"));
    changes = drain();
    hooked->beforeOpen = nullptr;
    EXPECT_TRUE(inOrder(changes, {created(path("s"), true), renamed(path("s"), path("u"), true),
                                  created(path("u/t/f"))}));

    write(path("u/t/g"));
    write(path("r/q/g"));
    changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("u/t/g")), created(path("r/q/g"))}));
}

TEST_F(InotifyBackendTest, FollowsRenamedDirectoriesAndForgetsOnesMovedOut) {
    fs::create_directories(path("a/b"));
    watchRoot();
    fs::rename(path("a"), path("z"));
    EXPECT_EQ(drain(), (Changes{renamed(path("a"), path("z"), true)}));

    write(path("z/b/f"));
    EXPECT_EQ(drain(), (Changes{created(path("z/b/f")), modified(path("z/b/f"))}));
    EXPECT_EQ(backend_->watchCount(), 3u);

    std::string away = outside_ / "z";
    fs::rename(path("z"), away);
    EXPECT_EQ(drain(), (Changes{removed(path("z"), true)}));
    EXPECT_EQ(backend_->watchCount(), 1u);
    write(away + "/b/g");
    write(path("still"));
    EXPECT_EQ(drain(), (Changes{created(path("still")), modified(path("still"))}))
        << "nothing from the tree that left";
}

TEST_F(InotifyBackendTest, AWatchThatCannotBeAddedIsReportedAndTheRestIsWatched) {
    ScopedLogCapture log;
    fs::create_directories(path("ok"));
    fs::create_directories(path("blocked/inner"));
    api_->failAddWatch("/blocked", ENOSPC);
    const std::string line = "[ERROR] Cannot watch " + path("blocked") +
                             ": [28: " + std::strerror(ENOSPC) +
                             "]; changes in that tree are not journaled";

    Changes discovered;
    Status status = backend_->watchTree(root_, discovered);
    EXPECT_FALSE(status.has_value());
    EXPECT_EQ(discovered, (Changes{watchFailed(path("blocked"), ENOSPC)}));
    EXPECT_EQ(log->count(line, LogLevel::Error), 1u);
    EXPECT_EQ(backend_->watchCount(), 2u);

    write(path("ok/f"));
    write(path("blocked/g"));
    write(path("blocked/inner/h"));
    Changes changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("ok/f"))}));
    EXPECT_FALSE(mentions(changes, "/blocked/")) << ::testing::PrintToString(changes);

    // The same for a directory that appears later.
    api_->failAddWatch("/fresh", ENOSPC);
    fs::create_directory(path("fresh"));
    changes = drain();
    EXPECT_TRUE(
        inOrder(changes, {created(path("fresh"), true), watchFailed(path("fresh"), ENOSPC)}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Cannot watch " + path("fresh") + ": [28: "), 1u);

    // A root that cannot be watched fails the call, and says so.
    api_->clear();
    log->clear();
    discovered.clear();
    status = backend_->watchTree(path("missing"), discovered);
    ASSERT_TRUE(status.has_value());
    EXPECT_EQ(status->code(), ENOENT);
    EXPECT_EQ(discovered, (Changes{watchFailed(path("missing"), ENOENT)}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Cannot watch " + path("missing") + ": [2: "), 1u);
}

TEST_F(InotifyBackendTest, SymbolicLinksAreNeverFollowed) {
    std::string target = outside_.makeDir("target/sub");
    fs::create_directory_symlink(outside_ / "target", path("link"));
    watchRoot();
    EXPECT_EQ(backend_->watchCount(), 1u);

    ScopedLogCapture log;
    Changes discovered;
    Status status = backend_->watchTree(path("link"), discovered);
    ASSERT_TRUE(status.has_value()) << "a link given as a root is refused";
    EXPECT_EQ(discovered, (Changes{watchFailed(path("link"), static_cast<int>(status->code()))}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Cannot watch " + path("link") + ": "), 1u);
    EXPECT_EQ(backend_->watchCount(), 1u);

    write(target + "/f");
    fs::create_directory_symlink(outside_ / "target", path("link2"));
    EXPECT_EQ(drain(), (Changes{created(path("link2"))}));
    EXPECT_EQ(backend_->watchCount(), 1u);
}

TEST_F(InotifyBackendTest, ALostRootIsReported) {
    ScopedLogCapture log;
    std::string inner = dir_.makeDir("root/inner");
    Changes discovered;
    ASSERT_FALSE(backend_->watchTree(inner, discovered).has_value());
    fs::remove(inner);
    EXPECT_EQ(drain(), (Changes{removed(inner, true), watchFailed(inner, ENOENT)}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Stopped watching " + inner + ": [2: "), 1u);
    EXPECT_EQ(backend_->watchCount(), 0u);
}

TEST_F(InotifyBackendTest, WaitWakesForEventsAndForAStopFromAnotherThread) {
    watchRoot();
    std::atomic<pid_t> readerThread{0};
    std::atomic<int> woke{-1};
    Clock::duration waited{};
    std::thread reader([&] {
        readerThread = static_cast<pid_t>(::syscall(SYS_gettid));
        auto start = Clock::now();
        woke = backend_->wait(60'000) ? 1 : 0;
        waited = Clock::now() - start;
    });
    // Bounded polling until the reader sleeps in the kernel, so that the stop has to wake it.
    auto deadline = Clock::now() + std::chrono::seconds(10);
    while (Clock::now() < deadline) {
        pid_t tid = readerThread.load();
        if (tid != 0) {
            std::ifstream stat("/proc/self/task/" + std::to_string(tid) + "/stat");
            std::string line;
            std::getline(stat, line);
            size_t close = line.rfind(')');
            if (close != std::string::npos && close + 2 < line.size() && line[close + 2] == 'S')
                break;
        }
        std::this_thread::yield();
    }
    backend_->requestStop();
    reader.join();
    EXPECT_EQ(woke.load(), 0);
    EXPECT_LT(waited, std::chrono::seconds(30));
    EXPECT_TRUE(backend_->stopRequested());
    EXPECT_FALSE(backend_->wait(60'000)) << "a stop stays requested";
}

TEST_F(InotifyBackendTest, WaitReturnsWhenEventsAreQueued) {
    watchRoot();
    write(path("f"));
    auto start = Clock::now();
    EXPECT_TRUE(backend_->wait(60'000));
    EXPECT_LT(Clock::now() - start, std::chrono::seconds(30));
    Changes changes;
    backend_->consume(changes);
    EXPECT_EQ(changes, (Changes{created(path("f")), modified(path("f"))}));
}

TEST_F(InotifyBackendTest, WatchesEveryDirectoryOfADeepTree) {
    std::string relative = "deep";
    constexpr int kDepth = 150;
    for (int i = 1; i < kDepth; ++i) relative += "/d";
    fs::create_directories(path(relative));
    watchRoot();
    EXPECT_EQ(backend_->watchCount(), 1u + kDepth);
    write(path(relative + "/bottom"));
    EXPECT_EQ(drain(),
              (Changes{created(path(relative + "/bottom")), modified(path(relative + "/bottom"))}));
}

TEST_F(InotifyBackendTest, TheKernelDroppingEventsIsReported) {
    int limit = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
    if (limit <= 0 || limit > 100'000)
        GTEST_SKIP() << "queue limit " << limit << " is too large to fill here";
    ScopedLogCapture log;
    write(path("a"));
    write(path("b"));
    watchRoot();
    // Alternating between two files, so that the kernel cannot merge the events; the queue
    // then ends with its overflow record.
    for (int i = 0; i <= limit; ++i) ASSERT_EQ(::chmod(path(i % 2 ? "a" : "b").c_str(), 0600), 0);
    Changes changes = drain();
    ASSERT_FALSE(changes.empty());
    EXPECT_EQ(changes.back(), overflow());
    EXPECT_EQ(log->count("[ERROR] The kernel dropped file system events; the watched trees need a "
                         "rescan",
                         LogLevel::Error),
              1u);
    write(path("after"));
    EXPECT_EQ(drain(), (Changes{created(path("after")), modified(path("after"))}));
}

// A writer builds directories full of files as fast as it can while the reader consumes:
// every file must be reported, after the directory it is in.
TEST_F(InotifyBackendTest, NothingIsMissedWhileDirectoriesFillUp) {
    watchRoot();
    constexpr int kDirectories = 30;
    constexpr int kFiles = 15;
    std::atomic<bool> done{false};
    std::thread writer([&] {
        for (int d = 0; d < kDirectories; ++d) {
            std::string dirPath = path("d" + std::to_string(d));
            fs::create_directories(dirPath + "/nested");
            for (int f = 0; f < kFiles; ++f) {
                write(dirPath + "/f" + std::to_string(f));
                write(dirPath + "/nested/g" + std::to_string(f));
            }
        }
        done = true;
    });
    Changes changes;
    auto deadline = Clock::now() + std::chrono::seconds(60);
    while (!done && Clock::now() < deadline) {
        backend_->wait(50);
        backend_->consume(changes);
    }
    writer.join();
    backend_->drain(changes);
    backend_->drain(changes);

    std::map<std::string, size_t> firstCreated;
    for (size_t i = 0; i < changes.size(); ++i) {
        if (changes[i].kind == Kind::Created)
            firstCreated.emplace(changes[i].path, i);
        EXPECT_NE(changes[i].kind, Kind::Overflow);
    }
    size_t missing = 0;
    for (int d = 0; d < kDirectories; ++d) {
        std::string dirPath = path("d" + std::to_string(d));
        for (int f = 0; f < kFiles; ++f) {
            for (std::string file :
                 {dirPath + "/f" + std::to_string(f), dirPath + "/nested/g" + std::to_string(f)}) {
                auto it = firstCreated.find(file);
                if (it == firstCreated.end()) {
                    ++missing;
                    ADD_FAILURE() << "no Created for " << file;
                    continue;
                }
                std::string parent = fs::path(file).parent_path().string();
                ASSERT_TRUE(firstCreated.contains(parent)) << parent;
                EXPECT_LT(firstCreated[parent], it->second) << file;
            }
        }
    }
    EXPECT_EQ(missing, 0u);
    EXPECT_EQ(backend_->watchCount(), 1u + 2 * kDirectories);
}

}  // namespace
}  // namespace tamber
