#include <gtest/gtest.h>
#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/tremors/FileChange.h"
#include "platform/tremors/InotifyBackend.h"
#include "platform/tremors/InotifyTranslator.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "tests/common/FaultyInotifyApi.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {

// Readable failure messages for change lists.
inline void PrintTo(const FileChange& change, std::ostream* os) {
    *os << FileChange::kindName(change.kind) << "(";
    if (change.kind == FileChange::Kind::Renamed)
        *os << change.fromPath << " -> ";
    *os << change.path << (change.isDirectory ? ", dir" : "");
    if (change.error != 0)
        *os << ", errno " << change.error;
    *os << ")";
}

namespace {

using namespace tamber::testing;
using Changes = std::vector<FileChange>;
using Kind = FileChange::Kind;
namespace fs = std::filesystem;

FileChange change(FileChange::Kind kind, std::string path, bool isDirectory = false, int error = 0,
                  std::string fromPath = {}) {
    return {kind, std::move(path), std::move(fromPath), isDirectory, error};
}
FileChange created(std::string path, bool isDirectory = false) {
    return change(FileChange::Kind::Created, std::move(path), isDirectory);
}
FileChange removed(std::string path, bool isDirectory = false) {
    return change(FileChange::Kind::Removed, std::move(path), isDirectory);
}
FileChange modified(std::string path) {
    return change(FileChange::Kind::Modified, std::move(path));
}
FileChange renamed(std::string from, std::string to, bool isDirectory = false) {
    return change(FileChange::Kind::Renamed, std::move(to), isDirectory, 0, std::move(from));
}
FileChange watchFailed(std::string path, int error) {
    return change(FileChange::Kind::WatchFailed, std::move(path), true, error);
}

// Builds event records laid out as the kernel lays them out: the name NUL-padded to a multiple
// of the header size.
class EventBuffer {
public:
    EventBuffer& add(int wd, uint32_t mask, std::string name = {}, uint32_t cookie = 0) {
        const size_t unit = sizeof(struct inotify_event);
        auto len = static_cast<uint32_t>(name.empty() ? 0 : (name.size() + unit) / unit * unit);
        name.resize(len, '\0');
        return addRaw(wd, mask, cookie, len, name);
    }
    // A header with an explicit length field, consistent or not, followed by `payload` as is.
    EventBuffer& addRaw(int wd, uint32_t mask, uint32_t cookie, uint32_t len,
                        const std::string& payload) {
        struct inotify_event header {};
        header.wd = wd;
        header.mask = mask;
        header.cookie = cookie;
        header.len = len;
        bytes_.append(reinterpret_cast<const char*>(&header), sizeof header);
        bytes_.append(payload);
        ends_.push_back(bytes_.size());
        return *this;
    }
    const std::string& bytes() const { return bytes_; }
    const std::vector<size_t>& recordEnds() const { return ends_; }  // where each record ends

private:
    std::string bytes_;
    std::vector<size_t> ends_;
};

const FileChange kOverflow = change(Kind::Overflow, {});

// Watches: 1 = /w, 2 = /w/a, 3 = /w/a/b, 4 = /w/a-1 (sorts between /w/a and /w/a/).
class InotifyTranslatorTest : public ::testing::Test {
protected:
    void SetUp() override { addWatches(translator_); }
    static void addWatches(InotifyTranslator& translator) {
        translator.addWatch(1, "/w");
        translator.addWatch(2, "/w/a");
        translator.addWatch(3, "/w/a/b");
        translator.addWatch(4, "/w/a-1");
    }
    Changes translate(const EventBuffer& events) {
        Changes out;
        EXPECT_TRUE(translator_.translate(events.bytes().data(), events.bytes().size(), out));
        return out;
    }

    InotifyTranslator translator_;
};

TEST_F(InotifyTranslatorTest, PairsMovesByCookieInOneReadOrAcrossTwo) {
    EventBuffer events;
    events.add(1, IN_MOVED_FROM, "x", 7)
        .add(2, IN_MOVED_TO, "y", 7)
        .add(1, IN_MOVED_FROM, "p", 8)  // two renames whose halves interleave
        .add(1, IN_MOVED_FROM, "q", 9)
        .add(1, IN_MOVED_TO, "q2", 9)
        .add(1, IN_MOVED_TO, "p2", 8)
        .add(3, IN_MOVED_TO | IN_ISDIR, "in", 10);  // no first half: moved in from outside
    EXPECT_EQ(translate(events), (Changes{renamed("/w/x", "/w/a/y"), renamed("/w/p", "/w/p2"),
                                          renamed("/w/q", "/w/q2"), created("/w/a/b/in", true)}));

    // A read that ends between the halves holds the first one, and what follows it, back.
    EXPECT_EQ(translate(EventBuffer().add(1, IN_MOVED_FROM, "old", 5).add(2, IN_MODIFY, "z")),
              Changes{});
    EXPECT_EQ(translate(EventBuffer().add(2, IN_MOVED_TO, "new", 5)),
              (Changes{renamed("/w/old", "/w/a/new"), modified("/w/a/z")}));

    // A later read without the second half: it was a move out of the trees.
    EXPECT_EQ(translate(EventBuffer().add(1, IN_MOVED_FROM, "gone", 2)), Changes{});
    EXPECT_EQ(translate(EventBuffer().add(1, IN_CREATE, "x")),
              (Changes{removed("/w/gone"), created("/w/x")}));
    EXPECT_FALSE(translator_.hasPendingMoves());
}

// Every truncation of a valid buffer: the whole records before the cut are reported exactly,
// the cut one is not, and the loss is marked. The bytes are copied into an allocation of
// exactly that size so that the address sanitizer sees any read past the end.
TEST_F(InotifyTranslatorTest, TruncatedBuffersYieldWholeRecordsAndAnOverflow) {
    EventBuffer events;
    events.add(1, IN_CREATE, "a")
        .add(2, IN_MODIFY, "a-name-longer-than-one-unit-of-sixteen-bytes")
        .add(3, IN_ATTRIB | IN_ISDIR)
        .add(-1, IN_Q_OVERFLOW)
        .add(4, IN_DELETE | IN_ISDIR, "exactly-15-char");
    const Changes perRecord = {created("/w/a"),
                               modified("/w/a/a-name-longer-than-one-unit-of-sixteen-bytes"),
                               change(Kind::AttributesChanged, "/w/a/b", true), kOverflow,
                               removed("/w/a-1/exactly-15-char", true)};
    const auto& ends = events.recordEnds();
    for (size_t length = 0; length <= events.bytes().size(); ++length) {
        InotifyTranslator translator;
        addWatches(translator);
        auto copy = std::make_unique<char[]>(length);
        std::memcpy(copy.get(), events.bytes().data(), length);
        auto whole = std::upper_bound(ends.begin(), ends.end(), length) - ends.begin();
        bool atBoundary = length == 0 || (whole > 0 && ends[whole - 1] == length);
        Changes expected(perRecord.begin(), perRecord.begin() + whole);
        if (!atBoundary)
            expected.push_back(kOverflow);
        Changes out;
        EXPECT_EQ(translator.translate(copy.get(), length, out), atBoundary) << "length " << length;
        EXPECT_EQ(out, expected) << "length " << length;
    }
}

TEST_F(InotifyTranslatorTest, ImpossibleRecordsStopTheTranslation) {
    const std::pair<const char*, EventBuffer> cases[] = {
        {"name length past the end", EventBuffer().addRaw(1, IN_CREATE, 0, 4096, "x")},
        {"name length near UINT32_MAX", EventBuffer().addRaw(1, IN_CREATE, 0, 0xfffffff0u, "x")},
        {"slash in a name", EventBuffer().add(1, IN_CREATE, "../etc")},
        {"dot-dot name", EventBuffer().add(1, IN_DELETE, "..")},
        {"creation without a name", EventBuffer().add(1, IN_CREATE)},
        {"slash in a modified name", EventBuffer().add(2, IN_MODIFY, "x/y")},
    };
    for (const auto& [what, bad] : cases) {
        std::string bytes = EventBuffer().add(1, IN_CREATE, "good").bytes() + bad.bytes() +
                            EventBuffer().add(1, IN_CREATE, "never").bytes();
        Changes out;
        EXPECT_FALSE(translator_.translate(bytes.data(), bytes.size(), out)) << what;
        EXPECT_EQ(out, (Changes{created("/w/good"), kOverflow})) << what;
    }
}

// The real calls, except that a read ending in the first half of a rename holds the second
// half back until the next poll that waits: what a reader sees when it reads between the two
// halves, which the kernel queues one after the other.
class SplitRenameInotifyApi : public LinuxInotifyApi {
public:
    ssize_t read(int fd, void* buffer, size_t size) override {
        std::lock_guard lock(mutex_);
        if (!held_.empty()) {
            if (!released_) {
                errno = EAGAIN;
                return -1;
            }
            size_t n = std::min(size, held_.size());
            std::memcpy(buffer, held_.data(), n);
            held_.erase(0, n);
            return static_cast<ssize_t>(n);
        }
        ssize_t n = LinuxInotifyApi::read(fd, buffer, size);
        if (n <= 0)
            return n;
        // Cut after the first IN_MOVED_FROM that has records after it.
        const char* bytes = static_cast<const char*>(buffer);
        for (size_t at = 0; at < static_cast<size_t>(n);) {
            const auto* event = reinterpret_cast<const struct inotify_event*>(bytes + at);
            at += sizeof(struct inotify_event) + event->len;
            if ((event->mask & IN_MOVED_FROM) && at < static_cast<size_t>(n)) {
                held_.assign(bytes + at, static_cast<size_t>(n) - at);
                released_ = false;
                ++splits_;
                return static_cast<ssize_t>(at);
            }
        }
        return n;
    }
    int queuedBytes(int fd) override {
        std::lock_guard lock(mutex_);
        int real = LinuxInotifyApi::queuedBytes(fd);
        return released_ && real >= 0 ? real + static_cast<int>(held_.size()) : real;
    }
    int poll(struct pollfd* fds, nfds_t count, int timeoutMs) override {
        {
            std::lock_guard lock(mutex_);
            if (!held_.empty() && timeoutMs != 0) {
                released_ = true;  // the second half is queued now
                for (nfds_t i = 0; i < count; ++i) fds[i].revents = 0;
                fds[0].revents = POLLIN;
                return 1;
            }
        }
        return LinuxInotifyApi::poll(fds, count, timeoutMs);
    }
    int splits() {
        std::lock_guard lock(mutex_);
        return splits_;
    }

private:
    std::mutex mutex_;
    std::string held_;
    bool released_ = true;
    int splits_ = 0;
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

class InotifyBackendTest : public ::testing::Test {
protected:
    void SetUp() override {
        auto started = InotifyBackend::start(api_);
        ASSERT_TRUE(started.ok()) << started.error().description();
        backend_ = std::move(started).value();
        root_ = dir_.makeDir("root");
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
    static void write(const std::string& path) { std::ofstream(path, std::ios::binary) << "x"; }

    TempDir dir_;
    std::string root_;
    std::shared_ptr<FaultyInotifyApi> api_ = std::make_shared<FaultyInotifyApi>();
    std::unique_ptr<InotifyBackend> backend_;
};

TEST_F(InotifyBackendTest, NewDirectoriesAreWatchedBeforeTheyAreListedAndFollowedWhenRenamed) {
    auto hooked = std::make_shared<HookedFileSystem>();
    ScopedFileSystem scoped(hooked);
    Changes discovered;
    ASSERT_TRUE(backend_->watchTree(root_, discovered).ok());
    ASSERT_EQ(discovered, Changes{});
    // Written before the watch exists: only the listing can find it. Written right after the
    // listing: only the watch can, so it must already be in place.
    bool armed = false;
    hooked->beforeOpen = [&](const std::string& opened) {
        if (opened == path("fresh")) {
            write(path("fresh/early"));
            armed = true;
        } else if (opened == path("s/t")) {
            // Renamed while its parent is listed: the rename, read later, says where it went.
            fs::rename(path("s"), path("u"));
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

    fs::create_directories(path("p/q"));
    write(path("p/q/f"));
    fs::rename(path("p"), path("r"));  // before it was watched
    fs::create_directories(path("s/t"));
    write(path("s/t/f"));
    changes = drain();
    hooked->beforeOpen = nullptr;
    EXPECT_TRUE(inOrder(changes, {created(path("p"), true), renamed(path("p"), path("r"), true),
                                  created(path("r/q"), true), created(path("r/q/f"))}));
    EXPECT_TRUE(inOrder(changes, {created(path("s"), true), renamed(path("s"), path("u"), true),
                                  created(path("u/t/f"))}));
    write(path("u/t/g"));
    write(path("r/q/g"));
    EXPECT_TRUE(inOrder(drain(), {created(path("u/t/g")), created(path("r/q/g"))}));
}

TEST_F(InotifyBackendTest, AWatchThatCannotBeAddedIsReportedAndTheRestIsWatched) {
    ScopedLogCapture log;
    fs::create_directories(path("ok"));
    fs::create_directories(path("blocked/inner"));
    api_->failAddWatch("/blocked", EACCES);
    Changes discovered;
    EXPECT_TRUE(backend_->watchTree(root_, discovered).ok());
    EXPECT_EQ(discovered, (Changes{watchFailed(path("blocked"), EACCES)}));
    EXPECT_EQ(log->count("[ERROR] Cannot watch " + path("blocked") + ": [13: " +
                             std::strerror(EACCES) + "]; changes in that tree are not journaled",
                         LogLevel::Error),
              1u);
    EXPECT_EQ(backend_->watchCount(), 2u);

    write(path("ok/f"));
    write(path("blocked/g"));
    write(path("blocked/inner/h"));
    Changes changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("ok/f"))}));
    for (const FileChange& change : changes) {
        EXPECT_TRUE(change.path.find("/blocked/") == std::string::npos &&
                    change.fromPath.find("/blocked/") == std::string::npos)
            << ::testing::PrintToString(change);
    }

    // The same for a directory that appears later.
    api_->failAddWatch("/fresh", EACCES);
    fs::create_directory(path("fresh"));
    EXPECT_TRUE(
        inOrder(drain(), {created(path("fresh"), true), watchFailed(path("fresh"), EACCES)}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Cannot watch " + path("fresh") + ": [13: "), 1u);
}

// Past the kernel's watch limit every further folder fails alike: the log says once which
// limit it is and how to raise it, not once per folder of a large tree.
TEST_F(InotifyBackendTest, TheWatchLimitIsLoggedOnceWithHowToRaiseIt) {
    ScopedLogCapture log;
    for (const char* folder : {"full/a", "full/b", "full/c/d"})
        fs::create_directories(path(folder));
    api_->failAddWatch("/full/", ENOSPC);
    Changes discovered;
    EXPECT_TRUE(backend_->watchTree(root_, discovered).ok());
    EXPECT_EQ(discovered.size(), 3u) << ::testing::PrintToString(discovered);
    for (const FileChange& change : discovered) {
        EXPECT_EQ(change.kind, Kind::WatchFailed);
        EXPECT_EQ(change.error, ENOSPC);
    }
    fs::create_directory(path("full/later"));
    EXPECT_TRUE(inOrder(drain(), {watchFailed(path("full/later"), ENOSPC)}));

    std::vector<std::string> errors;
    for (const auto& line : log->lines()) {
        if (line.level == LogLevel::Error)
            errors.push_back(line.text);
    }
    ASSERT_EQ(errors.size(), 1u) << ::testing::PrintToString(errors);
    EXPECT_NE(errors[0].find("fs.inotify.max_user_watches"), std::string::npos) << errors[0];
    EXPECT_NE(errors[0].find("sysctl"), std::string::npos) << errors[0];
}

// A read that ends between the two halves of a rename must not take the first for a move out
// of the trees: the file would be reported removed, and created again under its new name.
TEST(InotifyBackendRenameTest, ARenameReadInTwoHalvesIsStillOneRename) {
    TempDir dir;
    std::string root = dir.makeDir("root");
    auto api = std::make_shared<SplitRenameInotifyApi>();
    auto started = InotifyBackend::start(api);
    ASSERT_TRUE(started.ok()) << started.error().description();
    auto backend = std::move(started).value();
    Changes discovered;
    ASSERT_TRUE(backend->watchTree(root, discovered).ok());
    std::ofstream(root + "/a", std::ios::binary) << "x";
    std::ofstream(root + "/c", std::ios::binary) << "x";
    Changes before;
    backend->drain(before);

    // Through a sync's drain and through the reading thread's consume alike.
    fs::rename(root + "/a", root + "/b");
    Changes drained;
    backend->drain(drained);
    fs::rename(root + "/c", root + "/d");
    Changes consumed;
    ASSERT_TRUE(backend->wait(5000));
    backend->consume(consumed);
    backend->drain(consumed);

    EXPECT_EQ(api->splits(), 2);
    EXPECT_EQ(drained, (Changes{renamed(root + "/a", root + "/b")}));
    EXPECT_EQ(consumed, (Changes{renamed(root + "/c", root + "/d")}));
}

// A folder that is watched but cannot be listed (the disk or the kernel short of something for
// a moment) stays watched; what it held is found by comparing the trees with the index, and it
// is not taken for the watch limit.
TEST_F(InotifyBackendTest, AFolderThatCannotBeListedStaysWatchedAndAsksForARescan) {
    ScopedLogCapture log;
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(faults);
    Changes discovered;
    ASSERT_TRUE(backend_->watchTree(root_, discovered).ok());
    faults->inject(FaultInjectingFileSystem::Operation::ReadDirectory, ENOSPC, 1);
    fs::create_directory(path("fresh"));
    Changes changes = drain();
    EXPECT_TRUE(inOrder(changes, {created(path("fresh"), true), kOverflow}));
    for (const auto& change : changes) EXPECT_NE(change.kind, Kind::WatchFailed);
    write(path("fresh/later"));
    EXPECT_TRUE(inOrder(drain(), {created(path("fresh/later"))}));
    EXPECT_EQ(log->countStartingWith("[ERROR] Cannot list " + path("fresh")), 1u);
    EXPECT_FALSE(log->contains("max_user_watches"));
}

// The kernel's queue, dropped whole on the next read and replaced by an overflow, as when the
// kernel loses events.
class DroppingInotifyApi : public FaultyInotifyApi {
public:
    std::atomic<bool> dropNext{false};
    ssize_t read(int fd, void* buffer, size_t size) override {
        if (!dropNext.exchange(false))
            return FaultyInotifyApi::read(fd, buffer, size);
        std::vector<char> lost(1 << 16);
        while (queuedBytes(fd) > 0 && FaultyInotifyApi::read(fd, lost.data(), lost.size()) > 0) {
        }
        inotify_event overflow{};
        overflow.wd = -1;
        overflow.mask = IN_Q_OVERFLOW;
        std::memcpy(buffer, &overflow, sizeof overflow);
        return sizeof overflow;
    }
};

// Events lost with a moved tree leave its watches answering for the old paths, and a folder
// made meanwhile without one: after the overflow every watch answers for where its folder is.
TEST(InotifyOverflowTest, AfterLostEventsEveryWatchAnswersForItsFoldersPathNow) {
    TempDir dir;
    std::string root = dir.makeDir("root");
    auto api = std::make_shared<DroppingInotifyApi>();
    auto started = InotifyBackend::start(api);
    ASSERT_TRUE(started.ok());
    auto backend = std::move(started).value();
    fs::create_directories(root + "/a/b");
    Changes out;
    ASSERT_TRUE(backend->watchTree(root, out).ok());

    fs::rename(root + "/a", root + "/c");
    fs::create_directories(root + "/c/b/new");
    api->dropNext = true;
    out.clear();
    backend->drain(out);
    EXPECT_TRUE(inOrder(out, {kOverflow}));

    std::ofstream(root + "/c/b/f") << "x";
    std::ofstream(root + "/c/b/new/g") << "x";
    out.clear();
    backend->drain(out);
    backend->drain(out);
    EXPECT_TRUE(inOrder(out, {created(root + "/c/b/f")}));
    EXPECT_TRUE(inOrder(out, {created(root + "/c/b/new/g")}));
}

}  // namespace
}  // namespace tamber
