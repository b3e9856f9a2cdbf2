#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cerrno>
#include <chrono>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/TestStores.h"

// The document-ID part of the store: metadata copies, detached IDs, and the upgrade of
// databases written by older versions.

namespace tamber {
namespace {

constexpr uint64_t kFsid = 0x5eed;
const std::string kTags = "com.velk.metadata:_kHostItemUserTags";
const std::string kRank = "com.velk.favorite-rank.number#PS";

void runSql(const std::string& database, const std::string& sql) {
    auto db = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    ASSERT_TRUE(db.ok());
    ASSERT_TRUE(db.value()->exec(sql).ok()) << sql;
}

int64_t userVersion(const std::string& database) {
    auto db = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    EXPECT_TRUE(db.ok());
    return db.ok() ? db.value()->queryInt64("PRAGMA user_version").value() : -1;
}

InodeRecord stampedFile(uint64_t inode, uint64_t parent, const std::string& name) {
    InodeRecord record{inode, parent, name, InodeRecord::kFile, 0};
    record.birth = 1000 + inode;
    record.size = 5;
    record.mtime = 2000;
    record.ctime = 3000;
    record.stamped = true;
    return record;
}

TEST(DocumentIndexTest, MetadataCopiesFollowTheIdAndGoWithIt) {
    testing::TempDir state;
    auto store = testing::openTestStore(state.path(), kFsid);
    ASSERT_TRUE(store);
    uint32_t doc = store->allocateDocumentId(10).value();
    Bytes binary{0, 0xff, 'a', 0, 0x80};  // raw bytes, NULs included
    ASSERT_TRUE(store->setDocumentAttribute(doc, kTags, binary).ok());
    ASSERT_TRUE(store->setDocumentAttribute(doc, kRank, Bytes{'1'}).ok());
    ASSERT_TRUE(store->setDocumentAttribute(doc, kRank, Bytes{'2'}).ok());  // replaced
    EXPECT_EQ(store->documentAttributes(doc).value(),
              (TremorStore::Attributes{{kTags, binary}, {kRank, Bytes{'2'}}}));
    ASSERT_TRUE(store->setDocumentAttribute(doc, kRank, std::nullopt).ok());
    EXPECT_EQ(store->documentAttributes(doc).value(), (TremorStore::Attributes{{kTags, binary}}));

    // Detached from an inode that became another file: no inode has it, the copy waits.
    ASSERT_TRUE(store->detachDocumentId(doc).ok());
    EXPECT_EQ(store->inodeForDocumentId(doc).value(), std::nullopt);
    EXPECT_EQ(store->documentIdForInode(10).value(), std::nullopt);
    store.reset();
    store = testing::openTestStore(state.path(), kFsid);
    ASSERT_TRUE(store);
    ASSERT_TRUE(store->moveDocumentId(doc, 20).ok());
    EXPECT_EQ(store->inodeForDocumentId(doc).value(), 20u);
    EXPECT_EQ(store->documentAttributes(doc).value(), (TremorStore::Attributes{{kTags, binary}}));
    // An ID never handed out cannot be brought into being by a move.
    Status unknown = store->moveDocumentId(doc + 1, 30);
    ASSERT_FALSE(unknown.ok());
    EXPECT_EQ(unknown.error().code(), ENOENT);
    EXPECT_EQ(store->documentIdForInode(30).value(), std::nullopt);

    // Other documents' copies are their own; clearing an ID drops its copy for good.
    uint32_t other = store->allocateDocumentId(40).value();
    ASSERT_TRUE(store->replaceDocumentAttributes(other, {{kRank, Bytes{'9'}}}).ok());
    ASSERT_TRUE(store->clearDocumentId(doc).ok());
    EXPECT_TRUE(store->documentAttributes(doc).value().empty());
    EXPECT_EQ(store->documentAttributes(other).value(),
              (TremorStore::Attributes{{kRank, Bytes{'9'}}}));
    ASSERT_TRUE(store->replaceDocumentAttributes(other, {}).ok());
    EXPECT_TRUE(store->documentAttributes(other).value().empty());
}

TEST(DocumentIndexTest, AFailedBatchTakesBackDetachesMovesAndCopies) {
    testing::TempDir state;
    auto store = testing::openTestStore(state.path(), kFsid);
    ASSERT_TRUE(store);
    uint32_t doc = store->allocateDocumentId(10).value();
    ASSERT_TRUE(store->setDocumentAttribute(doc, kTags, Bytes{'t'}).ok());
    Status failed = store->transact([&]() -> Status {
        EXPECT_TRUE(store->detachDocumentId(doc).ok());
        EXPECT_TRUE(store->moveDocumentId(doc, 11).ok());
        EXPECT_TRUE(store->setDocumentAttribute(doc, kTags, Bytes{'u'}).ok());
        return Error::posix(EIO);
    });
    ASSERT_FALSE(failed.ok());
    EXPECT_EQ(store->inodeForDocumentId(doc).value(), 10u);
    EXPECT_EQ(store->documentAttributes(doc).value(),
              (TremorStore::Attributes{{kTags, Bytes{'t'}}}));
}

// Databases of schemas 1 and 2, made by taking today's apart the way the older versions built
// them. Events, roots, IDs and entries stay; copies start empty.
TEST(DocumentIndexTest, OlderDatabasesAreUpgradedInPlace) {
    const std::string toVersion2 =
        "DROP TABLE document_attributes; ALTER TABLE inodes DROP COLUMN ctime; "
        "PRAGMA user_version = 2";
    const std::string toVersion1 =
        toVersion2 +
        "; DROP INDEX inodes_by_name; ALTER TABLE inodes DROP COLUMN birth; "
        "ALTER TABLE inodes DROP COLUMN size; ALTER TABLE inodes DROP COLUMN mtime; "
        "CREATE INDEX inodes_by_parent ON inodes(parent); PRAGMA user_version = 1";
    for (int version : {1, 2}) {
        SCOPED_TRACE("schema " + std::to_string(version));
        testing::TempDir state;
        std::string uuid;
        uint32_t doc = 0;
        {
            auto store = testing::openTestStore(state.path(), kFsid);
            ASSERT_TRUE(store);
            uuid = store->uuid();
            ASSERT_TRUE(store->addRoot("/watched", 0, 1).ok());
            ASSERT_TRUE(store->upsertInodes({stampedFile(2, 1, "a.txt")}).ok());
            doc = store->allocateDocumentId(2).value();
            std::vector<JournalEvent> events{{0, "/watched/a.txt", 2, 0x100}};
            ASSERT_TRUE(store->append(events).ok());
        }
        runSql(testing::testStoreDatabase(state, kFsid), version == 1 ? toVersion1 : toVersion2);

        testing::ScopedLogCapture log;
        auto store = testing::openTestStore(state.path(), kFsid);
        ASSERT_TRUE(store);
        EXPECT_EQ(store->uuid(), uuid) << "upgraded, not replaced";
        EXPECT_EQ(store->lastEventId(), 1u);
        EXPECT_EQ(store->inodeForDocumentId(doc).value(), 2u);
        // A reopened store answers paths only for the trees this process watches again.
        ASSERT_TRUE(store->resumeRoot("/watched"));
        EXPECT_EQ(store->pathForInode(2).value(), "/watched/a.txt");
        auto record = store->inode(2).value();
        ASSERT_TRUE(record);
        EXPECT_EQ(record->stamped, version == 2);
        EXPECT_EQ(record->ctime, 0) << "not known yet";
        EXPECT_TRUE(store->documentAttributes(doc).value().empty());
        ASSERT_TRUE(store->setDocumentAttribute(doc, kTags, Bytes{'t'}).ok());
        ASSERT_TRUE(store->upsertInodes({stampedFile(3, 1, "b.txt")}).ok());
        EXPECT_EQ(store->inode(3).value()->ctime, 3000);
        EXPECT_EQ(store->allocateDocumentId(3).value(), doc + 1);
        EXPECT_EQ(log.sink().countStartingWith("[INFO] Upgraded the event journal in"), 1u);
        store.reset();
        EXPECT_EQ(userVersion(testing::testStoreDatabase(state, kFsid)),
                  TremorStore::kSchemaVersion);
    }
}

// After an upgrade nothing says whether a document's metadata changed, so the first crawl reads
// it; later crawls read only documents whose change time moved.
TEST(DocumentIndexTest, ACrawlReadsTheMetadataOfDocumentsWithAnUnknownOrNewChangeTime) {
    testing::TempDir state, root;
    std::string tree = root.makeDir("tree");
    std::string path = root.writeFile("tree/doc.txt", "d");
    root.writeFile("tree/plain.txt", "p");
    if (::setxattr(path.c_str(), ("user." + kTags).c_str(), "old", 3, 0) != 0)
        GTEST_SKIP() << "no user attributes on this file system";
    auto counting = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(counting);
    auto store = testing::openTestStore(state.path(), kFsid);
    ASSERT_TRUE(store);
    JournalWriter writer(*store, 7);
    ASSERT_TRUE(store->addRoot(tree, 0).ok());
    ASSERT_TRUE(writer.reconcile(tree, false).ok());
    struct statx st {};
    ASSERT_EQ(counting->statx(AT_FDCWD, path, 0, STATX_INO, &st), 0);
    uint32_t doc = store->allocateDocumentId(st.stx_ino).value();
    auto record = store->inode(st.stx_ino).value();
    ASSERT_TRUE(record);
    record->ctime = 0;  // as an upgraded entry
    ASSERT_TRUE(store->upsertInodes({*record}).ok());

    ASSERT_TRUE(writer.reconcile(tree, true).ok());
    EXPECT_EQ(store->documentAttributes(doc).value(),
              (TremorStore::Attributes{{kTags, Bytes{'o', 'l', 'd'}}}));

    counting->resetCalls();
    ASSERT_TRUE(writer.reconcile(tree, true).ok());
    EXPECT_EQ(counting->calls(FaultInjectingFileSystem::Operation::Llistxattr), 0u);

    // Set until the change time shows it: a coarse clock may not have ticked since the last change.
    auto changeTime = [&] {
        struct statx now {};
        EXPECT_EQ(::statx(AT_FDCWD, path.c_str(), 0, STATX_CTIME, &now), 0);
        return std::pair(now.stx_ctime.tv_sec, now.stx_ctime.tv_nsec);
    };
    auto before = changeTime();
    for (int attempt = 0; attempt < 1000 && changeTime() == before; ++attempt) {
        ASSERT_EQ(::setxattr(path.c_str(), ("user." + kTags).c_str(), "new", 3, 0), 0);
        if (changeTime() == before)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    ASSERT_TRUE(writer.reconcile(tree, true).ok());
    EXPECT_EQ(counting->calls(FaultInjectingFileSystem::Operation::Llistxattr), 1u);
    EXPECT_EQ(store->documentAttributes(doc).value(),
              (TremorStore::Attributes{{kTags, Bytes{'n', 'e', 'w'}}}));
}

}  // namespace
}  // namespace tamber
