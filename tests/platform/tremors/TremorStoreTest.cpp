#include "platform/tremors/TremorStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/tremors/JournalWriter.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using Paths = std::vector<std::string>;
using Ids = std::vector<uint64_t>;
constexpr uint64_t kStoreFsid = 0x1234abcd;
const std::string kVolumeDir = "000000001234abcd";

std::unique_ptr<TremorStore> openTestStore(const std::string& stateDir,
                                           uint64_t fsid = kStoreFsid) {
    auto store = TremorStore::open(stateDir, fsid);
    EXPECT_TRUE(store.ok()) << (store.ok() ? "" : store.error().description());
    return store.ok() ? std::move(store).value() : nullptr;
}

// Upper-case hex, version 4, RFC 4122 variant.
bool isRandomUuid(const std::string& uuid) {
    return std::regex_match(
        uuid, std::regex("[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}"));
}

size_t errorLinesMentioning(const CaptureLogSink& sink, const std::string& text) {
    size_t n = 0;
    for (const auto& line : sink.lines()) {
        n += line.level == LogLevel::Error && line.text.starts_with("[ERROR] ") &&
             line.text.find(text) != std::string::npos;
    }
    return n;
}

void runStoreSql(const std::string& database, const std::string& sql) {
    auto db = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    ASSERT_TRUE(db.ok());
    ASSERT_TRUE(db.value()->exec(sql).ok());
}

void overwrite(const std::string& database, std::streamoff at, size_t bytes) {
    std::fstream file(database, std::ios::binary | std::ios::in | std::ios::out);
    file.seekp(at);
    std::string junk(bytes, '\0');
    for (size_t i = 0; i < bytes; ++i) junk[i] = static_cast<char>(i * 131 + 7);
    file.write(junk.data(), static_cast<std::streamsize>(junk.size()));
}

InodeRecord dir(uint64_t inode, uint64_t parent, const std::string& name) {
    return {inode, parent, name, InodeRecord::kDirectory, 0};
}
InodeRecord file(uint64_t inode, uint64_t parent, const std::string& name) {
    return {inode, parent, name, InodeRecord::kFile, 0};
}

class TremorStoreTest : public ::testing::Test {
protected:
    void SetUp() override { reopen(); }
    void reopen() {
        store_.reset();
        store_ = openTestStore(state_.path());
        ASSERT_TRUE(store_);
    }
    std::string database() const { return state_ / (kVolumeDir + "/journal.sqlite"); }
    uint64_t append(const Paths& paths) {
        std::vector<JournalEvent> events;
        for (size_t i = 0; i < paths.size(); ++i)
            events.push_back({0, paths[i], 1000 + i, static_cast<uint32_t>(0x100 << (i % 8))});
        auto last = store_->append(events);
        EXPECT_TRUE(last.ok());
        return last.ok() ? last.value() : 0;
    }
    std::vector<JournalEvent> replayed(uint64_t since, const Paths& filter, size_t chunk = 0) {
        std::vector<JournalEvent> seen;
        EXPECT_TRUE(store_
                        ->replay(since, filter, chunk,
                                 [&](const JournalEvent& event) {
                                     seen.push_back(event);
                                     return true;
                                 })
                        .ok());
        return seen;
    }
    Paths paths(uint64_t since, const Paths& filter) {
        Paths result;
        for (const auto& event : replayed(since, filter)) result.push_back(event.path);
        return result;
    }
    Ids ids(uint64_t since, const Paths& filter, size_t chunk = 0) {
        Ids result;
        for (const auto& event : replayed(since, filter, chunk)) result.push_back(event.id);
        return result;
    }

    testing::TempDir state_;
    std::unique_ptr<TremorStore> store_;
};

TEST_F(TremorStoreTest, AStoreKeepsItsUuidAndStateAndHasOneUserAtATime) {
    std::string uuid = store_->uuid();
    EXPECT_TRUE(isRandomUuid(uuid)) << uuid;
    EXPECT_EQ(store_->directory(), state_ / kVolumeDir);
    ASSERT_TRUE(store_->addRoot("/watched/", 0, 42).ok());  // the trailing slash is dropped
    append({"/watched/x"});
    {
        testing::ScopedLogCapture log;
        auto second = TremorStore::open(state_.path(), kStoreFsid);
        ASSERT_FALSE(second.ok());
        EXPECT_EQ(second.error().userInfo().at("description"),
                  "the state directory " + (state_ / kVolumeDir) + " is held by Tamber process " +
                      std::to_string(getpid()));
        // Not this process's failure: the caller reports it, once.
        EXPECT_EQ(errorLinesMentioning(log.sink(), kVolumeDir), 0u);
    }
    EXPECT_EQ(append({"/watched/y"}), 2u);  // the failed attempt left the first one working
    reopen();
    EXPECT_EQ(store_->uuid(), uuid);
    EXPECT_EQ(store_->lastEventId(), 2u);
    auto roots = store_->roots();
    ASSERT_EQ(roots.size(), 1u);
    EXPECT_EQ(roots[0].path, "/watched");
    EXPECT_EQ(roots[0].inode, 42u);

    auto other = openTestStore(state_.path(), 7);  // another volume is another store
    ASSERT_TRUE(other);
    EXPECT_NE(other->uuid(), uuid);
    EXPECT_EQ(other->directory(), state_ / "0000000000000007");
    EXPECT_EQ(other->lastEventId(), 0u);
}

TEST_F(TremorStoreTest, AHeldStoreIsWaitedForWithOneNoticeNamingItsHolder) {
    std::string uuid = store_->uuid();
    std::promise<void> told;
    size_t notices = 0;
    pid_t named = 0;
    std::string where;
    std::string openedUuid;
    std::thread waiter([&] {
        TremorStoreDirectory::LockWait wait{60, [&](pid_t holder, const std::string& dir) {
                                                ++notices;
                                                named = holder;
                                                where = dir;
                                                told.set_value();
                                            }};
        auto second = TremorStore::open(state_.path(), kStoreFsid, wait);
        if (second.ok())
            openedUuid = second.value()->uuid();
    });
    // A deadline, so that a waiter that never says so fails instead of hanging.
    bool noticed =
        told.get_future().wait_for(std::chrono::seconds(30)) == std::future_status::ready;
    store_.reset();  // lets go
    waiter.join();
    ASSERT_TRUE(noticed);
    EXPECT_EQ(notices, 1u);
    EXPECT_EQ(named, getpid());
    EXPECT_EQ(where, state_ / kVolumeDir);
    EXPECT_EQ(openedUuid, uuid) << "the waiter did not get the store once it was free";
    EXPECT_EQ(TremorStoreDirectory::holderOf(state_ / kVolumeDir), getpid());
}

TEST(TremorStoreOpenTest, UnusableDatabasesAreMovedAsideAndReplacedWithANewUuid) {
    const std::vector<std::pair<std::string, std::function<void(const std::string&)>>> damages = {
        {"garbage", [](const std::string& db) { overwrite(db, 0, 8192); }},
        {"damaged pages that opening does not read",  // only the quick check finds them
         [](const std::string& db) {
             int64_t page = 0, pageSize = 0;
             {
                 auto conn = SqliteDatabase::open(db, SQLITE_OPEN_READWRITE);
                 ASSERT_TRUE(conn.ok());
                 auto found = conn.value()->queryInt64(
                     "SELECT pageno FROM dbstat WHERE name = 'inodes' AND pagetype = 'leaf' "
                     "ORDER BY pageno LIMIT 1 OFFSET 2");
                 ASSERT_TRUE(found.ok()) << found.error().description();
                 page = found.value();
                 pageSize = conn.value()->queryInt64("PRAGMA page_size").value();
             }
             overwrite(db, (page - 1) * pageSize, static_cast<size_t>(pageSize));
         }},
        {"wrong schema version",
         [](const std::string& db) { runStoreSql(db, "PRAGMA user_version = 9"); }},
        {"missing meta row", [](const std::string& db) { runStoreSql(db, "DELETE FROM meta"); }},
        {"event counter behind the rows",
         [](const std::string& db) { runStoreSql(db, "UPDATE meta SET next_event_id = 5"); }},
        {"document counter behind the rows",
         [](const std::string& db) { runStoreSql(db, "UPDATE meta SET next_document_id = 1"); }},
        {"tables without a version",
         [](const std::string& db) {
             runStoreSql(db, "DROP TABLE meta; PRAGMA user_version = 0");
         }},
    };
    for (const auto& [what, damage] : damages) {
        SCOPED_TRACE(what);
        testing::TempDir state;
        std::string oldUuid;
        {
            auto store = openTestStore(state.path());
            ASSERT_TRUE(store);
            oldUuid = store->uuid();
            std::vector<JournalEvent> events;
            for (int i = 0; i < 5000; ++i) events.push_back({0, "/p/" + std::to_string(i), 1, 0});
            ASSERT_TRUE(store->append(events).ok());
            ASSERT_TRUE(store->allocateDocumentId(77).ok());
            std::vector<InodeRecord> inodes;
            for (uint64_t i = 2; i < 3000; ++i) inodes.push_back(file(i, 1, "some-file-name"));
            ASSERT_TRUE(store->upsertInodes(inodes).ok());
        }
        std::string database = state / (kVolumeDir + "/journal.sqlite");
        damage(database);

        testing::ScopedLogCapture log;
        auto store = openTestStore(state.path());
        ASSERT_TRUE(store);
        EXPECT_NE(store->uuid(), oldUuid);
        EXPECT_TRUE(isRandomUuid(store->uuid()));
        EXPECT_EQ(store->lastEventId(), 0u);
        EXPECT_EQ(store->inodeForDocumentId(1).value(), std::nullopt);
        EXPECT_EQ(errorLinesMentioning(log.sink(), database), 1u);
        size_t movedAside = 0;
        for (const auto& entry : std::filesystem::directory_iterator(state / kVolumeDir))
            movedAside += entry.path().filename().string().starts_with("journal.sqlite.corrupt-");
        EXPECT_EQ(movedAside, 1u);
        std::vector<JournalEvent> events{{0, "/n", 0, 0}};
        EXPECT_EQ(store->append(events).value(), 1u);  // the replacement works
    }
}

TEST_F(TremorStoreTest, StateThatCannotBeCreatedOrWrittenIsAnErrorValue) {
    store_.reset();
    testing::ScopedLogCapture log;
    std::string plain = state_.writeFile("plain-file", "x");
    auto store = TremorStore::open(plain + "/state", kStoreFsid);
    ASSERT_FALSE(store.ok());
    EXPECT_NE(store.error().description().find(plain + "/state"), std::string::npos)
        << store.error().description();
    EXPECT_EQ(errorLinesMentioning(log.sink(), plain + "/state"), 1u);

    // Injected, so that it holds when the tests run as root too.
    auto faulty = std::make_shared<FaultInjectingFileSystem>(FileSystem::currentShared());
    testing::ScopedFileSystem scoped(faulty);
    faulty->inject(FaultInjectingFileSystem::Operation::Faccessat, EACCES, 1, kVolumeDir);
    auto unwritable = TremorStore::open(state_.path(), kStoreFsid);
    ASSERT_FALSE(unwritable.ok());
    EXPECT_EQ(unwritable.error().code(), EACCES);
    EXPECT_EQ(errorLinesMentioning(log.sink(), (state_ / kVolumeDir) + " is not writable"), 1u);

    // A bad journal that cannot be moved aside stays where it is, and the open fails.
    overwrite(database(), 0, 8192);
    faulty->inject(FaultInjectingFileSystem::Operation::Renameat2, EACCES, 1);
    EXPECT_FALSE(TremorStore::open(state_.path(), kStoreFsid).ok());
    EXPECT_TRUE(std::filesystem::exists(database()));
    EXPECT_TRUE(openTestStore(state_.path()));  // once it can be, it is
}

TEST_F(TremorStoreTest, EventIdsAreConsecutiveAndNeverReusedAcrossReopenAndTrim) {
    EXPECT_EQ(store_->lastEventId(), 0u);
    std::vector<JournalEvent> events{{0, "/a/1", 7, 0x100}, {0, "/a/2", 8, 0x200}};
    ASSERT_EQ(store_->append(events).value(), 2u);
    EXPECT_EQ(events[1].id, 2u);
    EXPECT_EQ(replayed(0, {}), events);  // every field comes back
    std::vector<JournalEvent> none;
    EXPECT_EQ(store_->append(none).value(), 2u);  // nothing appended, nothing used up
    EXPECT_EQ(append({"/a/3", "/a/4", "/a/5"}), 5u);

    reopen();
    EXPECT_EQ(store_->lastEventId(), 5u);
    EXPECT_EQ(append({"/a/6"}), 6u);
    ASSERT_TRUE(store_->trim(2).ok());
    EXPECT_EQ(store_->oldestEventId(), 5u);
    EXPECT_EQ(ids(0, {}), (Ids{5, 6}));
    ASSERT_TRUE(store_->trim(0).ok());  // everything
    EXPECT_EQ(store_->oldestEventId(), 7u);
    EXPECT_TRUE(replayed(0, {}).empty());

    // With no rows left, only the stored counter knows where IDs stopped.
    reopen();
    EXPECT_EQ(store_->oldestEventId(), 7u);
    EXPECT_EQ(append({"/a/7"}), 7u);
}

TEST_F(TremorStoreTest, ReplayMatchesWholePathComponents) {
    ASSERT_TRUE(store_->addRoot("/r/a", 0).ok());
    ASSERT_TRUE(store_->addRoot(TremorStore::kDocumentIdRoot, 0).ok());
    append({"/r/a", "/r/a/x", "/r/ab/x", "/r/ab", "/r", "/other/r/a/x", "/r/a/y/z",
            "/.docid/2049/changed/5/src=10,dst=11"});
    EXPECT_EQ(paths(0, {"/r/a"}), (Paths{"/r/a", "/r/a/x", "/r/a/y/z"}));
    EXPECT_EQ(paths(0, {"/r/a/"}), (Paths{"/r/a", "/r/a/x", "/r/a/y/z"}));
    EXPECT_EQ(paths(0, {"/r/a/y"}), (Paths{"/r/a/y/z"}));
    // Events outside every root are kept too, and found by their own path.
    EXPECT_EQ(paths(0, {"/r/ab"}), (Paths{"/r/ab/x", "/r/ab"}));
    EXPECT_EQ(paths(0, {"/r"}), (Paths{"/r/a", "/r/a/x", "/r/ab/x", "/r/ab", "/r", "/r/a/y/z"}));
    EXPECT_EQ(replayed(0, {"/"}).size(), 8u);
    EXPECT_TRUE(replayed(0, {"/nothing"}).empty());
    EXPECT_EQ(paths(0, {"/.docid"}), (Paths{"/.docid/2049/changed/5/src=10,dst=11"}));
}

TEST_F(TremorStoreTest, ReplayMergesRootsInIdOrderFromAnyStart) {
    for (const char* root : {"/x", "/y", "/z"}) ASSERT_TRUE(store_->addRoot(root, 0).ok());
    Paths all;
    // Enough events for reads that grow from the first, small one to whole chunks.
    for (int i = 0; i < 3000; ++i) {
        // Uneven interleaving, so that the roots' chunks end at different places.
        const char* root = (i % 3 == 0) ? "/x" : (i % 5 == 0 ? "/y" : "/z");
        all.push_back(std::string(root) + "/f" + std::to_string(i));
    }
    append(all);
    auto expected = [&](uint64_t since, const std::string& roots) {
        Ids result;
        for (uint64_t id = since + 1; id <= all.size(); ++id) {
            if (roots.find(all[id - 1].substr(0, 2)) != std::string::npos)
                result.push_back(id);
        }
        return result;
    };
    for (size_t chunk : {size_t{1}, size_t{7}, size_t{1000}}) {
        for (uint64_t since : {uint64_t{0}, uint64_t{50}, uint64_t{99}, uint64_t{100}}) {
            SCOPED_TRACE("chunk " + std::to_string(chunk) + ", since " + std::to_string(since));
            EXPECT_EQ(ids(since, {"/x", "/y"}, chunk), expected(since, "/x/y"));
            EXPECT_EQ(ids(since, {"/y"}, chunk), expected(since, "/y"));
            EXPECT_EQ(ids(since, {}, chunk), expected(since, "/x/y/z"));
        }
        // Stopping early.
        Ids seen;
        EXPECT_TRUE(store_
                        ->replay(10, {"/x", "/y"}, chunk,
                                 [&](const JournalEvent& event) {
                                     seen.push_back(event.id);
                                     return seen.size() < 5;
                                 })
                        .ok());
        Ids merged = expected(10, "/x/y");
        EXPECT_EQ(seen, Ids(merged.begin(), merged.begin() + 5));
    }
}

TEST_F(TremorStoreTest, ReplayIsBoundedAtItsStartAndLetsTheCallbackUseTheStore) {
    ASSERT_TRUE(store_->addRoot("/w", 0).ok());
    append({"/w/1", "/w/2", "/w/3"});
    for (const Paths& filter : {Paths{}, Paths{"/w"}}) {
        uint64_t before = store_->lastEventId();
        Ids seen;
        Status status = store_->replay(before - 3, filter, 1, [&](const JournalEvent& event) {
            seen.push_back(event.id);
            // Would deadlock if the lock were held; appends only a few, so that a replay
            // that also delivered them still ends.
            if (seen.size() <= 3)
                append({"/w/during"});
            return true;
        });
        EXPECT_TRUE(status.ok());
        EXPECT_EQ(seen, (Ids{before - 2, before - 1, before}));
        EXPECT_EQ(store_->lastEventId(), before + 3);
    }
}

TEST_F(TremorStoreTest, ReplayFromBeyondTheLastEventDeliversNothingAndIsIncomplete) {
    ASSERT_TRUE(store_->addRoot("/w", 0).ok());
    append({"/w/1", "/w/2", "/w/3"});
    const uint64_t last = store_->lastEventId();
    constexpr uint64_t kMax = UINT64_MAX;
    constexpr uint64_t kSignedMax = INT64_MAX;
    // IDs are unsigned: none of these may read as a negative number that lies before the
    // history and replay all of it.
    for (uint64_t since : {last + 1, kSignedMax - 1, kSignedMax, kSignedMax + 1, kMax - 1, kMax}) {
        SCOPED_TRACE("since " + std::to_string(since));
        EXPECT_TRUE(ids(since, {}).empty());
        EXPECT_TRUE(ids(since, {"/w"}, 1).empty());
        TremorStore::ReplayCheck check = store_->replayability(since, {"/w"});
        EXPECT_FALSE(check.complete);
        EXPECT_NE(check.reason.find("past the last event " + std::to_string(last)),
                  std::string::npos)
            << check.reason;
    }
    EXPECT_EQ(ids(last - 1, {"/w"}), (Ids{last}));
    EXPECT_TRUE(store_->replayability(last, {"/w"}).complete);
}

TEST_F(TremorStoreTest, ADamagedIndexNeverNamesAPathOutsideItsRoot) {
    ASSERT_TRUE(store_->addRoot("/r", 0, 1).ok());
    for (const std::string& name : {std::string(".."), std::string("."), std::string(""),
                                    std::string("a/b"), std::string("a\0b", 3)}) {
        EXPECT_FALSE(store_->upsertInodes({file(5, 1, "ok"), file(6, 1, name)}).ok()) << name;
    }
    EXPECT_EQ(store_->inode(5).value(), std::nullopt);  // the whole batch was refused

    // Cycles end the walk; so does a chain deeper than kMaxPathComponents.
    ASSERT_TRUE(store_
                    ->upsertInodes({dir(300, 301, "a"), dir(301, 300, "b"), dir(302, 302, "self"),
                                    file(303, 300, "f")})
                    .ok());
    EXPECT_EQ(store_->pathForInode(302).value(), std::nullopt);
    EXPECT_EQ(store_->pathForInode(303).value(), std::nullopt);
    std::vector<InodeRecord> chain;
    for (uint64_t i = 0, parent = 1; i <= TremorStore::kMaxPathComponents; parent = 10000 + i++)
        chain.push_back(dir(10000 + i, parent, "d"));
    ASSERT_TRUE(store_->upsertInodes(chain).ok());
    EXPECT_TRUE(store_->pathForInode(10000 + TremorStore::kMaxPathComponents - 1).value());
    EXPECT_EQ(store_->pathForInode(10000 + TremorStore::kMaxPathComponents).value(), std::nullopt);

    // Should a bad name reach the file anyway, it still never resolves.
    store_.reset();
    runStoreSql(
        database(),
        "INSERT INTO inodes(inode, parent, name, kind) VALUES(7, 1, '..', 2), (8, 7, 'etc', 2),"
        "(9, 1, 'fine', 2)");
    reopen();
    EXPECT_EQ(store_->pathForInode(9).value(), std::nullopt) << "a root nobody watches in this run";
    ASSERT_TRUE(store_->resumeRoot("/r"));
    EXPECT_EQ(store_->pathForInode(9).value(), "/r/fine");
    EXPECT_EQ(store_->pathForInode(8).value(), std::nullopt);
}

TEST_F(TremorStoreTest, DocumentIdsMoveToOneInodeAtATimeAndAreNeverReused) {
    uint32_t doc = store_->allocateDocumentId(10).value();
    EXPECT_EQ(store_->allocateDocumentId(10).value(), doc);  // already has one
    EXPECT_FALSE(store_->allocateDocumentId(0).ok());
    ASSERT_TRUE(store_->moveDocumentId(doc, 20).ok());
    EXPECT_EQ(store_->inodeForDocumentId(doc).value(), 20u);
    EXPECT_EQ(store_->documentIdForInode(10).value(), std::nullopt);
    uint32_t other = store_->allocateDocumentId(30).value();
    Status clash = store_->moveDocumentId(other, 20);
    ASSERT_FALSE(clash.ok());
    EXPECT_EQ(clash.error().code(), EEXIST);
    EXPECT_EQ(store_->inodeForDocumentId(other).value(), 30u);
    Status unknown = store_->moveDocumentId(999, 40);
    ASSERT_FALSE(unknown.ok());
    EXPECT_EQ(unknown.error().code(), ENOENT);

    // The highest IDs were cleared; the counter still remembers them.
    ASSERT_TRUE(store_->clearDocumentId(other).ok());
    EXPECT_EQ(store_->inodeForDocumentId(other).value(), std::nullopt);
    reopen();
    EXPECT_EQ(store_->inodeForDocumentId(doc).value(), 20u);
    EXPECT_EQ(store_->allocateDocumentId(31).value(), other + 1);
}

using Kind = FileChange::Kind;

uint64_t storeInodeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::stat(path.c_str(), &st), 0) << path;
    return st.st_ino;
}
FileChange storeChange(FileChange::Kind kind, std::string path, bool isDirectory = false,
                       std::string fromPath = {}) {
    return {kind, std::move(path), std::move(fromPath), isDirectory, 0};
}

class JournalWriterTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        ASSERT_NO_FATAL_FAILURE(open());
        ASSERT_TRUE(store_->addRoot(tree_, 0).ok());
        ASSERT_TRUE(writer_->reconcile(tree_, false).ok());
    }
    void open() {
        writer_.reset();
        store_.reset();
        auto store = TremorStore::open(state_.path(), 1);
        ASSERT_TRUE(store.ok());
        store_ = std::move(store).value();
        writer_ = std::make_unique<JournalWriter>(*store_, 7);
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    std::unique_ptr<TremorStore> store_;
    std::unique_ptr<JournalWriter> writer_;
};

TEST_F(JournalWriterTest, PastTheLastEventIdNothingIsJournaledNorIndexed) {
    writer_.reset();
    store_.reset();
    {
        auto db = SqliteDatabase::open(state_ / "0000000000000001/journal.sqlite");
        ASSERT_TRUE(db.ok());
        ASSERT_TRUE(db.value()
                        ->exec("UPDATE meta SET next_event_id = " +
                               std::to_string(TremorStore::kLastEventId))
                        .ok());
    }
    ASSERT_NO_FATAL_FAILURE(open());
    std::string last = root_.writeFile("tree/last", "x");
    auto events = writer_->apply({storeChange(Kind::Created, last)});
    ASSERT_TRUE(events.ok());
    EXPECT_EQ(events.value().at(0).id, TremorStore::kLastEventId);

    testing::ScopedLogCapture log;
    std::string refused = root_.writeFile("tree/refused", "x");
    auto failed = writer_->apply({storeChange(Kind::Created, refused)});
    ASSERT_FALSE(failed.ok());
    EXPECT_EQ(failed.error().code(), EOVERFLOW);
    EXPECT_EQ(store_->inode(storeInodeOf(refused)).value(),
              std::nullopt);  // the index went with the rows
    EXPECT_TRUE(store_->inode(storeInodeOf(last)).value());
    size_t errors = 0;
    for (const auto& line : log.sink().lines())
        errors +=
            line.level == LogLevel::Error && line.text.find("every event ID") != std::string::npos;
    EXPECT_EQ(errors, 1u);
    ASSERT_NO_FATAL_FAILURE(open());  // and the store still opens, with nothing repeated
    EXPECT_EQ(store_->lastEventId(), TremorStore::kLastEventId);
    EXPECT_FALSE(writer_->apply({storeChange(Kind::Created, refused)}).ok());
}

}  // namespace
}  // namespace tamber
