#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <optional>
#include <string>
#include <vector>

#include "tests/common/FaultyInotifyApi.h"
#include "tests/platform/tremors/TremorServiceFixture.h"

namespace tamber {
namespace {

using namespace testing;

// The journal's database refuses to grow, as on a full disk, while files keep changing.
class JournalDiskFullTest : public TremorServiceTest {
protected:
    TremorStore& store() {
        TremorStore* store = service_->storeForDevice(device_);
        EXPECT_NE(store, nullptr);
        return *store;
    }
    // Enough new files that their events cannot fit in the pages the database already has.
    std::vector<std::string> createMany(const std::string& prefix) {
        std::vector<std::string> paths;
        for (int i = 0; i < 300; ++i) {
            paths.push_back(tree_ + "/" + prefix + std::string(120, 'n') + std::to_string(i));
            writeText(paths.back(), "x");
        }
        return paths;
    }
};

TEST_F(JournalDiskFullTest, LostEventsLeaveAGapBeforeAnythingJournaledLater) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    writeText(tree_ + "/before.txt", "b");
    const uint64_t anchor = service_->currentEventId();
    ASSERT_GT(anchor, 0u);

    ScopedLogCapture log;
    ASSERT_TRUE(store().capSizeForTesting(true).ok());
    std::vector<std::string> lost = createMany("lost");
    service_->sync();
    EXPECT_GE(log->countStartingWith("[ERROR] Could not journal events: "), 1u)
        << "the full database went unnoticed";

    // Space comes back; the next change is journaled.
    ASSERT_TRUE(store().capSizeForTesting(false).ok());
    std::string after = tree_ + "/after.txt";
    writeText(after, "a");
    service_->sync();

    auto events = journaled(*service_, device_, anchor, {tree_});
    const JournalEvent* created = findEvent(events, after, kTremorItemCreated);
    ASSERT_NE(created, nullptr) << "a change after the disk freed up was lost\n"
                                << describe(events);
    // A reader from the anchor must learn that history is incomplete before it reaches the
    // later event: otherwise the files created while the disk was full are never reported.
    bool gapFirst = false;
    for (const auto& event : events) {
        if (event.id >= created->id)
            break;
        if ((event.flags & kTremorUserDropped) && (event.flags & kTremorMustScanSubdirs))
            gapFirst = true;
    }
    EXPECT_TRUE(gapFirst) << "events were lost without a trace in the journal\n"
                          << describe(events);

    // And the index is back in step: the files made while the disk was full have their place.
    for (const std::string& path : {lost.front(), lost.back()}) {
        auto indexed = store().inode(inodeOf(path));
        ASSERT_TRUE(indexed.ok());
        EXPECT_TRUE(indexed.value().has_value()) << path << " is missing from the index";
    }
}

// Past the kernel's watch limit a folder is not watched: what changes in it must still reach
// the journal, found by rescanning it when a client asks where the journal stands.
class WatchLimitTest : public TremorServiceTest {
protected:
    void SetUp() override {
        TremorServiceTest::SetUp();
        std::filesystem::create_directories(tree_ + "/full/deeper");
        writeText(tree_ + "/full/old.txt", "o");
        writeText(tree_ + "/full/renamed.txt", "r");
        api_->failAddWatch("/full", ENOSPC);
        auto service = TremorService::create(state_.path(), api_);
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        ASSERT_TRUE(service_->watchTree(tree_).ok());
    }

    std::shared_ptr<FaultyInotifyApi> api_ = std::make_shared<FaultyInotifyApi>();
};

TEST_F(WatchLimitTest, ChangesInAFolderPastTheLimitAreJournaledByRescans) {
    ScopedLogCapture log;
    const uint64_t anchor = service_->currentEventId();
    const std::string full = tree_ + "/full";
    writeText(tree_ + "/watched.txt", "w");
    writeText(full + "/new.txt", "n");
    writeText(full + "/deeper/inner.txt", "i");
    std::filesystem::rename(full + "/renamed.txt", full + "/deeper/moved.txt");
    // Last: a file created after it could be given its inode number.
    std::filesystem::remove(full + "/old.txt");

    const uint64_t now = service_->currentEventId();
    auto events = journaled(*service_, device_, anchor, {tree_});
    for (const auto& event : events) EXPECT_LE(event.id, now) << "journaled after the answer";
    EXPECT_NE(findEvent(events, tree_ + "/watched.txt", kTremorItemCreated), nullptr);
    EXPECT_NE(findEvent(events, full + "/new.txt", kTremorItemCreated), nullptr)
        << describe(events);
    EXPECT_NE(findEvent(events, full + "/deeper/inner.txt", kTremorItemCreated), nullptr)
        << describe(events);
    EXPECT_NE(findEvent(events, full + "/old.txt", kTremorItemRemoved), nullptr)
        << describe(events);
    EXPECT_NE(findEvent(events, full + "/deeper/moved.txt", kTremorItemRenamed), nullptr)
        << describe(events);
    // The index follows, so identifiers of the new files resolve.
    std::string path;
    TremorStrataService strata(service_);
    ASSERT_TRUE(strata.pathForFileId(device_, inodeOf(full + "/deeper/inner.txt"), path));
    EXPECT_EQ(path, full + "/deeper/inner.txt");

    // A second look with nothing changed journals nothing more.
    EXPECT_EQ(service_->currentEventId(), now);
    // The folder appears once in the log as not watched; rescans themselves are quiet.
    for (const auto& line : log->lines()) EXPECT_NE(line.level, LogLevel::Error) << line.text;
}

// Another program (a backup, a curious user with the sqlite3 shell) holds the journal's
// database longer than the busy timeout: opening it fails with a clear error, once, leaves the
// journal as it was, and works again once the other program lets go.
TEST(JournalLockedTest, AJournalHeldByAnotherProgramFailsClearlyAndOpensOnceReleased) {
    TempDir state;
    std::string database, uuid;
    uint64_t last = 0;
    {
        auto store = TremorStore::open(state.path(), 1);
        ASSERT_TRUE(store.ok()) << store.error().description();
        std::vector<JournalEvent> events{{0, "/tree/a", 1, kTremorItemCreated}};
        ASSERT_TRUE(store.value()->append(events).ok());
        database = store.value()->directory() + "/" + TremorStoreDirectory::kDatabaseName;
        uuid = store.value()->uuid();
        last = store.value()->lastEventId();
    }
    auto holder = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    ASSERT_TRUE(holder.ok());
    ASSERT_TRUE(holder.value()->exec("BEGIN EXCLUSIVE").ok());

    {
        ScopedLogCapture log;
        // Only the outcome crosses threads: the store, if any, is closed where it was opened.
        auto attempt = std::async(std::launch::async, [&]() -> std::optional<Error> {
            auto store = TremorStore::open(state.path(), 1);
            if (store.ok())
                return std::nullopt;
            return store.error();
        });
        ASSERT_EQ(attempt.wait_for(std::chrono::seconds(60)), std::future_status::ready)
            << "opening a held journal hangs";
        std::optional<Error> refused = attempt.get();
        ASSERT_TRUE(refused) << "a held journal was opened";
        EXPECT_EQ(refused->domain(), std::string(kSqliteErrorDomain));
        EXPECT_EQ(refused->code() & 0xff, SQLITE_BUSY) << refused->description();
        size_t errors = 0;
        for (const auto& line : log->lines()) {
            if (line.level != LogLevel::Error)
                continue;
            ++errors;
            EXPECT_NE(line.text.find(database), std::string::npos) << line.text;
        }
        EXPECT_EQ(errors, 1u);
    }

    ASSERT_TRUE(holder.value()->exec("COMMIT").ok());
    holder.value().reset();
    auto again = TremorStore::open(state.path(), 1);
    ASSERT_TRUE(again.ok()) << again.error().description();
    EXPECT_EQ(again.value()->uuid(), uuid) << "the held journal was replaced";
    EXPECT_EQ(again.value()->lastEventId(), last);
}

}  // namespace
}  // namespace tamber
