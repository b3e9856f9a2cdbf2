#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStoreDirectory.h"
#include "tests/cli/TamberProcess.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::occurrences;
using testing::TamberProcess;

// Separate `tamber` processes on one state directory: they take turns with the journal.
class JournalLockCommandsTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage = home.makeDir("Documents");
        home.writeFile("Documents/a.txt", "a");
        home.makeDir("Documents/Folder");
        environment = {{"HOME", home.path()},
                       {"XDG_STATE_HOME", home / "state"},
                       {"XDG_DATA_HOME", home / "data"},
                       {"XDG_CONFIG_HOME", home / "config"},
                       {"XDG_DATA_DIRS", home.makeDir("system-data")}};
    }
    std::string stateDir() const { return home / "state/tamber"; }

    // Holds the journal of the storage folder's volume from this process, as another tamber
    // would; returns the folder that holds that volume's journal.
    std::string holdJournal() {
        auto service = TremorService::create(stateDir());
        EXPECT_TRUE(service.ok());
        if (!service.ok())
            return {};
        holder = service.value();
        EXPECT_TRUE(holder->watchTree(storage).ok());
        auto device = holder->deviceForPath(storage);
        EXPECT_TRUE(device);
        TremorStore* store = device ? holder->storeForDevice(*device) : nullptr;
        EXPECT_NE(store, nullptr);
        return store ? store->directory() : std::string();
    }
    std::unique_ptr<TamberProcess> start(std::vector<std::string> args) {
        args.insert(args.begin(), {"--storage", storage});
        return std::make_unique<TamberProcess>(args, environment);
    }

    testing::TempDir home;
    std::string storage;
    std::map<std::string, std::string> environment;
    std::shared_ptr<TremorService> holder;
};

TEST_F(JournalLockCommandsTest, RunsStartedAtOnceTakeTurnsAndAllSucceedAlike) {
    std::vector<std::unique_ptr<TamberProcess>> runs;
    for (int i = 0; i < 4; ++i) runs.push_back(start({"ls", "root", "--json"}));
    std::vector<std::string> outputs;
    for (auto& run : runs) {
        EXPECT_EQ(run->finish(), 0) << run->out() << run->err();
        EXPECT_EQ(occurrences(run->err(), "held by"), 0u) << run->err();
        EXPECT_EQ(occurrences(run->err(), "Another Tamber process"), 0u) << run->err();
        outputs.push_back(run->out());
    }
    EXPECT_NE(outputs[0].find("a.txt"), std::string::npos) << outputs[0];
    for (const auto& output : outputs) EXPECT_EQ(output, outputs[0]);
}

TEST_F(JournalLockCommandsTest, WithoutWaitingAHeldJournalFailsAtOnceNamingItsHolderOnce) {
    std::string dir = holdJournal();
    ASSERT_FALSE(dir.empty());
    std::string message =
        "the state directory " + dir + " is held by Tamber process " + std::to_string(getpid());

    auto run = start({"--wait", "0", "ls", "root"});
    EXPECT_NE(run->finish(), 0);
    EXPECT_EQ(occurrences(run->err(), message), 1u) << run->err();
    EXPECT_EQ(occurrences(run->err(), "waiting for"), 0u) << run->err();
    EXPECT_EQ(occurrences(run->err(), "Another Tamber process"), 0u) << run->err();

    // With --json the error is the JSON object, and not printed a second time.
    run = start({"--wait", "0", "ls", "root", "--json"});
    EXPECT_NE(run->finish(), 0);
    EXPECT_EQ(occurrences(run->out() + run->err(), message), 1u) << run->out() << run->err();
    EXPECT_NE(run->out().find("\"error\""), std::string::npos) << run->out();
}

TEST_F(JournalLockCommandsTest, AWaitingRunSaysOnceWhomItWaitsForAndGoesOnWhenReleased) {
    std::string dir = holdJournal();
    ASSERT_FALSE(dir.empty());
    std::string waiting = "waiting for Tamber process " + std::to_string(getpid()) +
                          " to release the state directory " + dir;

    auto run = start({"--wait", "60", "ls", "root", "--json"});
    ASSERT_TRUE(run->waitForError(waiting)) << run->err();
    holder->shutdown();
    holder.reset();
    EXPECT_EQ(run->finish(), 0) << run->err();
    EXPECT_NE(run->out().find("a.txt"), std::string::npos) << run->out();
    EXPECT_EQ(occurrences(run->err(), waiting), 1u) << run->err();
    EXPECT_EQ(occurrences(run->err(), "held by"), 0u) << run->err();

    // Held for longer than the wait: one error, after the one notice.
    dir = holdJournal();
    run = start({"--wait", "1", "ls", "root"});
    EXPECT_NE(run->finish(), 0);
    EXPECT_EQ(occurrences(run->err(), "waiting for Tamber process"), 1u) << run->err();
    EXPECT_EQ(occurrences(run->err(), "is held by Tamber process " + std::to_string(getpid())), 1u)
        << run->err();
}

// Not a Tamber process but another program (a backup, the sqlite3 shell) holds the journal's
// database past the busy timeout: the verb fails with one clear line instead of hanging, the
// journal is kept, and the next run works once the program lets go.
TEST_F(JournalLockCommandsTest, ADatabaseHeldByAnotherProgramFailsOnceAndTheNextRunWorks) {
    auto first = start({"ls", "root"});
    ASSERT_EQ(first->finish(), 0) << first->err();
    std::string database;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(stateDir())) {
        if (entry.path().filename() == TremorStoreDirectory::kDatabaseName)
            database = entry.path();
    }
    ASSERT_FALSE(database.empty());
    auto other = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    ASSERT_TRUE(other.ok());
    ASSERT_TRUE(other.value()->exec("BEGIN EXCLUSIVE").ok());

    auto run = start({"--verbose", "ls", "root"});
    int status = run->finish(60);
    EXPECT_NE(status, -1) << "hung or crashed: " << run->err();
    EXPECT_NE(status, 0) << run->out();
    EXPECT_EQ(occurrences(run->err(), "[ERROR]"), 1u) << run->err();
    EXPECT_EQ(occurrences(run->err(), "[ERROR] Cannot open the event journal " + database +
                                          ": another program holds it"),
              1u)
        << run->err();
    EXPECT_EQ(occurrences(run->err(), "moving it aside"), 0u) << run->err();

    ASSERT_TRUE(other.value()->exec("COMMIT").ok());
    other.value().reset();
    run = start({"ls", "root"});
    EXPECT_EQ(run->finish(), 0) << run->err();
    EXPECT_NE(run->out().find("a.txt"), std::string::npos) << run->out();
    for (const auto& entry :
         std::filesystem::directory_iterator(std::filesystem::path(database).parent_path()))
        EXPECT_EQ(entry.path().string().find(".corrupt-"), std::string::npos)
            << "the held journal was replaced: " << entry.path();
}

}  // namespace
}  // namespace tamber
