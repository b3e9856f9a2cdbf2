#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <thread>

#include <fcntl.h>
#include <sys/inotify.h>

#include "items/ItemMetadata.h"
#include "platform/FileSystem.h"
#include "platform/tremors/InotifyApi.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorService.h"
#include "runtime/ProviderRuntime.h"
#include "server/SqliteReplica.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/TempStagingLedger.h"

namespace tamber {
namespace {

using namespace testing;
namespace fs = std::filesystem;

const auto* const ledger = ::testing::AddGlobalTestEnvironment(new TempStagingLedger);

// Only a hang gets near these.
constexpr auto kPatience = std::chrono::seconds(60);

// The system's inotify calls, except that the next read can be made to report a queue overflow
// (the kernel dropped events) before what really happened.
class OverflowingInotify : public InotifyApi {
public:
    std::atomic<bool> overflowNext{false};

    int init(int flags) override { return real_->init(flags); }
    int addWatch(int fd, const std::string& path, uint32_t mask) override {
        return real_->addWatch(fd, path, mask);
    }
    int removeWatch(int fd, int wd) override { return real_->removeWatch(fd, wd); }
    ssize_t read(int fd, void* buffer, size_t size) override {
        if (size >= sizeof(inotify_event) && overflowNext.exchange(false)) {
            inotify_event overflow{};
            overflow.wd = -1;
            overflow.mask = IN_Q_OVERFLOW;
            std::memcpy(buffer, &overflow, sizeof overflow);
            return sizeof overflow;
        }
        return real_->read(fd, buffer, size);
    }
    int queuedBytes(int fd) override { return real_->queuedBytes(fd); }
    int eventfd(unsigned int initial, int flags) override { return real_->eventfd(initial, flags); }
    int signal(int eventFd) override { return real_->signal(eventFd); }
    int poll(struct pollfd* fds, nfds_t count, int timeoutMs) override {
        return real_->poll(fds, count, timeoutMs);
    }
    int close(int fd) override { return real_->close(fd); }

private:
    std::shared_ptr<InotifyApi> real_ = InotifyApi::system();
};

// A real provider on a temporary storage and app library, with its own journal, and the
// replica the server would run over it. Signals and index deletions reach the replica as the
// server wires them.
class ReplicaSyncTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        storage = dir.makeDir("Documents");
        install({"com.example.notes"});
        library = documents("com.example.notes").path();
    }
    void TearDown() override {
        stop();
        TremorService::resetForTesting();
        AppLibraryTest::TearDown();
    }

    void startRuntime() {
        ProviderRuntimeOptions options;
        options.storagePath = storage;
        options.stateDir = state.path();
        options.inotify = inotify;
        options.onSignal = [this](const HostPorterItemIdentifier& container) {
            if (!forwardSignals)
                return;
            std::lock_guard lock(replicaMutex);
            if (replica)
                replica->signal(container);
        };
        options.onDeleteIndex = [this](const std::vector<std::string>& domains,
                                       HostPorterManager::Completion completion) {
            SqliteReplica* target;
            {
                std::lock_guard lock(replicaMutex);
                target = replica.get();
            }
            if (!target) {
                completion(std::nullopt);
                return;
            }
            // What another connection sees of the library when the completion runs.
            target->deleteSearchableItems(domains, [this, completion](std::optional<Error> error) {
                auto db = SqliteDatabase::open(databasePath, SQLITE_OPEN_READONLY);
                if (db.ok()) {
                    auto left = db.value()->queryInt64(
                        "SELECT count(*) FROM items WHERE id = '#com.example.notes' OR "
                        "instr(CAST(path AS TEXT), '" +
                        library + "') = 1");
                    if (left.ok())
                        leftAtCompletion = left.value();
                }
                ++deletions;
                completion(std::move(error));
            });
        };
        runtime = std::make_unique<ProviderRuntime>(options);
        auto porter = runtime->provider();
        ASSERT_TRUE(porter.ok()) << porter.error().description();
        provider = porter.value();
        auto started = runtime->startJournal();
        ASSERT_TRUE(started.ok());
        journal = started.value();
    }

    // Starts the runtime and a replica on it, and waits for the first catch-up.
    void start(ReplicaSync::Hooks hooks = {}, bool waitReady = true) {
        startRuntime();
        if (HasFatalFailure())
            return;
        HostReplica::Options options;
        options.databasePath = databasePath;
        options.provider = provider;
        options.journal = journal;
        options.historyBatches = historyBatches;
        auto opened = SqliteReplica::open(options, std::move(hooks));
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        {
            std::lock_guard lock(replicaMutex);
            replica = std::move(opened).value();
        }
        replica->start();
        if (waitReady) {
            ASSERT_TRUE(replica->waitUntilReady(kPatience));
        }
    }

    void stop() {
        std::unique_ptr<SqliteReplica> gone;
        {
            std::lock_guard lock(replicaMutex);
            gone = std::move(replica);
        }
        if (gone)
            gone->shutdown();
        gone.reset();
        if (runtime)
            runtime->shutdown();
        runtime.reset();
        provider.reset();
        journal.reset();
    }

    // What the browser should hold: every visible file and folder of the storage and the
    // library (hidden ones are not published), the library itself, and the top level of each
    // trash.
    std::set<std::string> disk() {
        std::set<std::string> paths;
        std::vector<std::string> roots{storage};
        if (libraryPublished) {
            paths.insert(library);
            roots.push_back(library);
        }
        for (const std::string& root : roots) {
            for (auto it = fs::recursive_directory_iterator(root); it != fs::end(it); ++it) {
                if (it->path().filename().string().starts_with(".")) {
                    it.disable_recursion_pending();
                    continue;
                }
                paths.insert(it->path().string());
            }
            if (fs::exists(root + "/.Trash"))
                for (const auto& entry : fs::directory_iterator(root + "/.Trash"))
                    if (!entry.path().filename().string().starts_with("."))
                        paths.insert(entry.path().string());
        }
        return paths;
    }

    std::vector<nlohmann::json> everything() {
        ReplicaSearchQuery all;
        all.limit = 1000;
        auto found = replica->search(all);
        EXPECT_TRUE(found.ok());
        return found.ok() ? found.value() : std::vector<nlohmann::json>{};
    }
    std::set<std::string> held() {
        std::set<std::string> paths;
        for (const auto& item : everything())
            if (item.contains("path"))
                paths.insert(item["path"].get<std::string>());
        return paths;
    }
    std::string identifierOf(const std::string& path) {
        for (const auto& item : everything())
            if (item.value("path", "") == path)
                return item["identifier"];
        return {};
    }

    // Waits until the replica holds what is on disk; false after the patience.
    bool converges() {
        journal->sync();
        const auto deadline = std::chrono::steady_clock::now() + kPatience;
        while (std::chrono::steady_clock::now() < deadline) {
            if (held() == disk() && !replica->status().catchingUp)
                return true;
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        return false;
    }
    // Waits until no catch-up runs nor is asked for by the signals sent so far.
    void settle() {
        journal->sync();
        const auto deadline = std::chrono::steady_clock::now() + kPatience;
        for (int quiet = 0; quiet < 10 && std::chrono::steady_clock::now() < deadline;) {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
            quiet = replica->status().catchingUp ? 0 : quiet + 1;
        }
    }

    static void write(const std::string& path, const std::string& text = "x") {
        fs::create_directories(fs::path(path).parent_path());
        std::ofstream(path) << text;
    }

    std::string describe(const std::set<std::string>& paths) {
        std::string out;
        for (const auto& p : paths) out += "\n  " + p;
        return out;
    }

    TempDir state;
    std::string storage, library;
    std::string databasePath = state / "replica/replica.db";
    size_t historyBatches = 10000;
    std::shared_ptr<OverflowingInotify> inotify = std::make_shared<OverflowingInotify>();
    std::atomic<bool> forwardSignals{true};
    bool libraryPublished = true;
    std::atomic<int> deletions{0};
    std::atomic<int64_t> leftAtCompletion{-1};
    std::unique_ptr<ProviderRuntime> runtime;
    std::shared_ptr<HostPorterExtension> provider;
    std::shared_ptr<TremorService> journal;
    std::mutex replicaMutex;
    std::unique_ptr<SqliteReplica> replica;
};

#define EXPECT_CONVERGES() \
    EXPECT_TRUE(converges()) << "replica:" << describe(held()) << "\ndisk:" << describe(disk())

// The first listing holds every item of the working set, as the disk has them, and the
// status says so.
TEST_F(ReplicaSyncTest, FirstListingHoldsTheWholeWorkingSet) {
    for (int i = 0; i < 450; ++i) write(storage + "/bulk/f" + std::to_string(i) + ".txt");
    write(storage + "/a/b/c/deep.txt");
    write(storage + "/.hidden/secret.txt");
    write(library + "/note.md");
    write(storage + "/.Trash/thrown.txt");
    start();
    EXPECT_EQ(held(), disk()) << "replica:" << describe(held()) << "\ndisk:" << describe(disk());
    ReplicaStatus status = replica->status();
    EXPECT_TRUE(status.ready);
    EXPECT_FALSE(status.catchingUp);
    EXPECT_FALSE(status.historyLost);
    EXPECT_EQ(status.items, disk().size());
}

// Changes made on disk reach the replica through the provider's signal, in order: a rename
// then a delete leaves nothing, a create then a move leaves the item at its new place; each
// batch is kept for subscribers and in the history.
TEST_F(ReplicaSyncTest, ChangesOnDiskReachTheReplicaInOrder) {
    write(storage + "/keep.txt");
    write(storage + "/doomed.txt");
    start();
    const uint64_t before = replica->status().sequence;
    std::mutex heardMutex;
    std::vector<ReplicaBatch> heard;
    replica->subscribe([&](const ReplicaBatch& batch) {
        std::lock_guard lock(heardMutex);
        heard.push_back(batch);
    });

    fs::rename(storage + "/doomed.txt", storage + "/renamed.txt");
    fs::remove(storage + "/renamed.txt");
    write(storage + "/made.txt", "new");
    fs::create_directories(storage + "/dir");
    fs::rename(storage + "/made.txt", storage + "/dir/made.txt");
    write(library + "/lib.txt");
    EXPECT_CONVERGES();
    const std::string dirId = identifierOf(storage + "/dir");
    ASSERT_FALSE(dirId.empty());
    for (const auto& item : everything()) {
        if (item["filename"] == "made.txt") {
            EXPECT_EQ(item["parentIdentifier"], dirId);
        }
    }

    // The journal's events are all reflected once caught up, and the last one was seen.
    settle();
    ReplicaStatus status = replica->status();
    EXPECT_EQ(status.journalLagEvents, 0u);
    EXPECT_TRUE(status.lastEventTime);
    EXPECT_FALSE(status.historyLost);
    EXPECT_GT(status.sequence, before);
    auto history = replica->batchesSince(before);
    ASSERT_TRUE(history.ok()) << history.error().description();
    ASSERT_FALSE(history->empty());
    std::lock_guard lock(heardMutex);
    ASSERT_EQ(heard.size(), history->size());
    for (size_t i = 0; i < heard.size(); ++i) {
        EXPECT_EQ(heard[i].sequence, history.value()[i].sequence);
        EXPECT_EQ(heard[i].changes, history.value()[i].changes);
    }
}

// A tag list that a desktop program writes to a file reaches the replica and its search through
// the journal alone, and becomes the item's own tags; taking it in writes once, not forever.
TEST_F(ReplicaSyncTest, ADesktopTagListWrittenByAnotherProgramReachesTheSearch) {
    const std::string path = storage + "/tagged.txt";
    write(path);
    start();
    auto taggedWith = [&](const std::string& tag) {
        ReplicaSearchQuery query;
        query.tag = tag;
        query.limit = 10;
        auto found = replica->search(query);
        std::set<std::string> paths;
        if (found.ok())
            for (const auto& item : found.value()) paths.insert(item.value("path", ""));
        return paths;
    };
    auto setDesktopList = [&](const std::optional<std::string>& list) {
        FileSystem& fs = FileSystem::current();
        int fd = fs.open(path, O_RDONLY | O_CLOEXEC, 0);
        ASSERT_GE(fd, 0);
        int rc = list ? fs.fsetxattr(fd, "xdg.tags", list->data(), list->size(), 0)
                      : fs.fremovexattr(fd, "xdg.tags");
        fs.close(fd);
        if (rc != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
        ASSERT_EQ(rc, 0);
    };
    auto waitFor = [&](const std::string& tag, const std::set<std::string>& expected) {
        journal->sync();
        const auto deadline = std::chrono::steady_clock::now() + kPatience;
        while (taggedWith(tag) != expected && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        return taggedWith(tag) == expected;
    };
    const Url url = Url::fileURLWithPath(path);

    ASSERT_NO_FATAL_FAILURE(setDesktopList("Desk,Work"));
    if (IsSkipped())
        return;
    ASSERT_TRUE(waitFor("Desk", {path}));
    EXPECT_EQ(taggedWith("Work"), std::set<std::string>{path});
    EXPECT_EQ(ItemMetadata::readTagLabels(url), (std::vector<std::string>{"Desk", "Work"}));

    // Taking it in changed Tamber's attribute, whose event is heard once and then all is quiet.
    settle();
    const uint64_t settled = replica->status().sequence;
    settle();
    EXPECT_EQ(replica->status().sequence, settled);

    ASSERT_NO_FATAL_FAILURE(setDesktopList(std::nullopt));
    ASSERT_TRUE(waitFor("Work", {}));
    EXPECT_EQ(taggedWith("Desk"), std::set<std::string>{});
    EXPECT_EQ(ItemMetadata::readTagLabels(url), std::vector<std::string>{});
}

// Events the kernel dropped are history lost: the status says so from then on (whether the
// journal's mark or the provider's refusal of the anchor tells it first), and the replica
// still ends up holding the disk.
TEST_F(ReplicaSyncTest, DroppedEventsAreReportedAsLostHistory) {
    write(storage + "/one.txt");
    start();
    EXPECT_FALSE(replica->status().historyLost);
    inotify->overflowNext = true;
    write(storage + "/two.txt");
    EXPECT_CONVERGES();
    EXPECT_FALSE(inotify->overflowNext);
    EXPECT_TRUE(replica->status().historyLost);
}

// Signals that arrive during a catch-up cause one more, not one each.
TEST_F(ReplicaSyncTest, SignalsDuringACatchUpCauseExactlyOneMore) {
    forwardSignals = false;  // only this test's signals
    std::mutex gateMutex;
    std::condition_variable gateChanged;
    bool entered = false, open = false;
    std::atomic<int> started{0};
    ReplicaSync::Hooks hooks;
    hooks.catchUpStarted = [&] {
        if (++started != 2)
            return;
        std::unique_lock lock(gateMutex);
        entered = true;
        gateChanged.notify_all();
        gateChanged.wait(lock, [&] { return open; });
    };
    start(hooks);
    EXPECT_EQ(replica->catchUps(), 1u);
    replica->signal(HostPorterWorkingSetContainerItemIdentifier);
    {
        std::unique_lock lock(gateMutex);
        ASSERT_TRUE(gateChanged.wait_for(lock, kPatience, [&] { return entered; }));
    }
    for (int i = 0; i < 50; ++i) replica->signal(HostPorterWorkingSetContainerItemIdentifier);
    {
        std::lock_guard lock(gateMutex);
        open = true;
    }
    gateChanged.notify_all();
    settle();
    EXPECT_EQ(replica->catchUps(), 3u);
    EXPECT_TRUE(replica->status().ready);
}

// A restart catches up from the stored anchor (the history goes on, no listing from scratch)
// and then holds what changed while it was stopped.
TEST_F(ReplicaSyncTest, RestartCatchesUpFromTheStoredAnchor) {
    write(storage + "/before.txt");
    start();
    const uint64_t sequence = replica->status().sequence;
    stop();
    write(storage + "/while-stopped.txt");
    fs::remove(storage + "/before.txt");
    write(library + "/also.txt");
    start();
    EXPECT_CONVERGES();
    auto history = replica->batchesSince(sequence);
    ASSERT_TRUE(history.ok()) << "listed again instead of catching up";
    EXPECT_FALSE(history->empty());
    EXPECT_FALSE(replica->status().historyLost);
}

// An anchor the provider no longer accepts (-1002) makes the replica list everything again;
// the status reports the lost history and old sequences can no longer be replayed.
TEST_F(ReplicaSyncTest, AnExpiredAnchorRebuildsFromAFullListing) {
    write(storage + "/one.txt");
    start();
    const uint64_t sequence = replica->status().sequence;
    stop();
    {
        auto db = SqliteDatabase::open(databasePath);
        ASSERT_TRUE(db.ok());
        ASSERT_TRUE(db.value()->exec("UPDATE meta SET value = x'00ff' WHERE key = 'anchor'").ok());
    }
    write(storage + "/two.txt");
    start();
    EXPECT_CONVERGES();
    EXPECT_TRUE(replica->status().historyLost);
    auto history = replica->batchesSince(sequence);
    ASSERT_FALSE(history.ok());
    EXPECT_TRUE(history.error().is(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired));
}

// A database that is garbage at start is rebuilt from a full listing, with one error line.
TEST_F(ReplicaSyncTest, ACorruptDatabaseIsRebuiltWithOneErrorLine) {
    write(storage + "/one.txt");
    start();
    stop();
    {
        std::ofstream garbage(databasePath, std::ios::trunc | std::ios::binary);
        garbage << std::string(4096, '\x01');
    }
    fs::remove(databasePath + "-wal");
    write(storage + "/two.txt");
    start();
    EXPECT_CONVERGES();
    size_t lines = 0;
    for (const auto& line : log->lines())
        if (line.level == LogLevel::Error && line.text.find("replica") != std::string::npos)
            ++lines;
    EXPECT_EQ(lines, 1u);
}

// A catch-up abandoned between two batches (a crash, a shutdown) leaves the anchor with the
// items it covers: the replica holds exactly the batches its history has, and the next start
// holds the disk.
TEST_F(ReplicaSyncTest, ACatchUpAbandonedBetweenBatchesLeavesAnchorAndItemsConsistent) {
    start();
    const uint64_t items = replica->status().items;
    const uint64_t sequence = replica->status().sequence;
    stop();
    // More changes than one batch holds.
    for (int i = 0; i < 500; ++i) write(storage + "/n" + std::to_string(i) + ".txt");
    std::atomic<int> asked{0};
    ReplicaSync::Hooks hooks;
    hooks.beforeBatch = [&] { return ++asked <= 1; };
    start(hooks, false);
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (asked < 2 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    ASSERT_GE(asked.load(), 2);
    settle();
    auto history = replica->batchesSince(sequence);
    ASSERT_TRUE(history.ok()) << history.error().description();
    ASSERT_EQ(history->size(), 1u);
    std::set<std::string> created;
    for (const auto& item : history->front().changes["updated"]) created.insert(item["identifier"]);
    EXPECT_FALSE(created.empty());
    EXPECT_LT(created.size(), 500u);
    EXPECT_EQ(replica->status().items, items + created.size());
    EXPECT_FALSE(replica->status().ready);
    stop();
    start();
    EXPECT_CONVERGES();
}

// When the provider stops publishing an app library, its upgrade asks the host to delete the
// library's index entries and waits, on the thread the catch-up is waiting for: the deletion
// commits without waiting for the catch-up, before its completion runs, and nothing hangs.
TEST_F(ReplicaSyncTest, IndexDeletionAskedFromInsideACatchUpCommitsFirstAndDoesNotDeadlock) {
    write(library + "/a.txt");
    write(library + "/sub/b.txt");
    write(storage + "/mine.txt");
    start();
    ASSERT_FALSE(identifierOf(library + "/sub/b.txt").empty());

    registry->replace(AppRegistry::kUserApplications, {});
    libraryPublished = false;
    std::atomic<bool> refreshed{false};
    provider->refreshInstalledAppsWithCompletionHandler([&] { refreshed = true; });
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (deletions == 0 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    ASSERT_EQ(deletions.load(), 1) << "the provider never asked to delete the index";
    EXPECT_EQ(leftAtCompletion.load(), 0) << "completion ran before the deletion was committed";
    EXPECT_CONVERGES();
    EXPECT_TRUE(identifierOf(library + "/sub/b.txt").empty());
    EXPECT_FALSE(identifierOf(storage + "/mine.txt").empty());
    EXPECT_TRUE(replica->status().ready);
}

}  // namespace
}  // namespace tamber
