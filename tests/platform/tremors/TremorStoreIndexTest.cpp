#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <vector>

#include "platform/tremors/TremorStore.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

constexpr uint64_t kFsid = 0x77;

std::unique_ptr<TremorStore> openStore(const std::string& stateDir) {
    auto store = TremorStore::open(stateDir, kFsid);
    EXPECT_TRUE(store.ok()) << (store.ok() ? "" : store.error().description());
    return store.ok() ? std::move(store).value() : nullptr;
}

InodeRecord dir(uint64_t inode, uint64_t parent, const std::string& name) {
    return {inode, parent, name, InodeRecord::kDirectory, 0};
}

InodeRecord file(uint64_t inode, uint64_t parent, const std::string& name) {
    return {inode, parent, name, InodeRecord::kFile, 0};
}

TEST(TremorStoreIndexTest, PathsAreRebuiltFromTheParentChain) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/home/u/Docs", 0, 100));
    // Inode numbers use all 64 bits on some file systems.
    const uint64_t high = 0x8000000000000005u;
    ASSERT_FALSE(store->upsertInodes({dir(101, 100, "a"), file(102, 101, "b.txt"),
                                      dir(high, 101, "c d"), file(104, high, "é.txt")}));
    EXPECT_EQ(store->pathForInode(100), "/home/u/Docs");
    EXPECT_EQ(store->pathForInode(101), "/home/u/Docs/a");
    EXPECT_EQ(store->pathForInode(102), "/home/u/Docs/a/b.txt");
    EXPECT_EQ(store->pathForInode(104), "/home/u/Docs/a/c d/é.txt");
    EXPECT_EQ(store->inode(104).value().parent, high);

    // A rename is an upsert with the new parent and name.
    ASSERT_FALSE(store->upsertInodes({file(102, 100, "renamed.txt")}));
    EXPECT_EQ(store->pathForInode(102), "/home/u/Docs/renamed.txt");
    auto record = store->inode(102);
    ASSERT_TRUE(record);
    EXPECT_EQ(*record, file(102, 100, "renamed.txt"));

    // Under the root "/", names join without a doubled slash; the deeper root still wins.
    ASSERT_FALSE(store->addRoot("/", 0, 2));
    ASSERT_FALSE(store->upsertInodes({dir(3, 2, "top"), file(4, 3, "f")}));
    EXPECT_EQ(store->pathForInode(4), "/top/f");
    EXPECT_EQ(store->pathForInode(2), "/");
    EXPECT_EQ(store->pathForInode(102), "/home/u/Docs/renamed.txt");
}

TEST(TremorStoreIndexTest, OnlyInodesInsideWatchedRootsResolve) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/r", 0));  // inode not known yet
    ASSERT_FALSE(store->upsertInodes({dir(11, 10, "in"), file(12, 11, "f"), dir(21, 20, "out"),
                                      file(22, 21, "g"), file(30, 0, "orphan")}));
    EXPECT_EQ(store->pathForInode(12), std::nullopt);
    ASSERT_FALSE(store->setRootInode("/r", 10));
    EXPECT_EQ(store->pathForInode(12), "/r/in/f");
    EXPECT_EQ(store->pathForInode(22), std::nullopt);  // chain ends at unindexed 20
    EXPECT_EQ(store->pathForInode(30), std::nullopt);
    EXPECT_EQ(store->pathForInode(999), std::nullopt);  // not indexed at all
    EXPECT_EQ(store->pathForInode(0), std::nullopt);

    // A removed directory cuts its descendants off.
    ASSERT_FALSE(store->removeInodes({11}));
    EXPECT_EQ(store->pathForInode(12), std::nullopt);
    EXPECT_EQ(store->inode(11), std::nullopt);

    // And so does unwatching the root.
    ASSERT_FALSE(store->upsertInodes({dir(11, 10, "in")}));
    EXPECT_EQ(store->pathForInode(12), "/r/in/f");
    ASSERT_FALSE(store->removeRoot("/r"));
    EXPECT_EQ(store->pathForInode(12), std::nullopt);
    EXPECT_TRUE(store->setRootInode("/r", 10).has_value());  // no such root any more
}

TEST(TremorStoreIndexTest, CorruptChainsEndInsteadOfLooping) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/r", 0, 1));
    ASSERT_FALSE(store->upsertInodes(
        {dir(300, 301, "a"), dir(301, 300, "b"), dir(302, 302, "self"), file(303, 300, "f")}));
    EXPECT_EQ(store->pathForInode(300), std::nullopt);
    EXPECT_EQ(store->pathForInode(302), std::nullopt);
    EXPECT_EQ(store->pathForInode(303), std::nullopt);

    // Depth is bounded: a chain of kMaxPathComponents resolves, one more does not.
    std::vector<InodeRecord> chain;
    uint64_t parent = 1;
    for (uint64_t i = 0; i <= TremorStore::kMaxPathComponents; ++i) {
        chain.push_back(dir(10000 + i, parent, "d"));
        parent = 10000 + i;
    }
    ASSERT_FALSE(store->upsertInodes(chain));
    auto deepest = store->pathForInode(10000 + TremorStore::kMaxPathComponents - 1);
    ASSERT_TRUE(deepest);
    EXPECT_EQ(std::count(deepest->begin(), deepest->end(), '/'),
              static_cast<long>(TremorStore::kMaxPathComponents) + 1);
    EXPECT_EQ(store->pathForInode(10000 + TremorStore::kMaxPathComponents), std::nullopt);
}

TEST(TremorStoreIndexTest, NamesThatCouldLeaveTheRootAreRefused) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/r", 0, 1));
    for (const std::string& name : {std::string(".."), std::string("."), std::string(""),
                                    std::string("a/b"), std::string("a\0b", 3)}) {
        EXPECT_TRUE(store->upsertInodes({file(5, 1, "ok"), file(6, 1, name)}).has_value()) << name;
    }
    EXPECT_EQ(store->inode(5), std::nullopt);  // the whole batch was refused

    // Should such a name reach the file anyway, it still never resolves.
    std::string database = store->directory() + "/journal.sqlite";
    store.reset();
    {
        auto db = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
        ASSERT_TRUE(db.ok());
        ASSERT_FALSE(db.value()->exec(
            "INSERT INTO inodes VALUES(7, 1, '..', 2); INSERT INTO inodes VALUES(8, 7, 'etc', 2);"
            "INSERT INTO inodes VALUES(9, 1, 'fine', 2)"));
    }
    store = openStore(state.path());
    ASSERT_TRUE(store);
    EXPECT_EQ(store->pathForInode(9), "/r/fine");
    EXPECT_EQ(store->pathForInode(8), std::nullopt);
}

TEST(TremorStoreIndexTest, ChildrenListTheIndexedEntriesOfADirectory) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->upsertInodes({dir(50, 1, "p"),
                                      file(51, 50, "x"),
                                      file(52, 50, "y"),
                                      {53, 50, "link", InodeRecord::kSymlink, 0},
                                      file(60, 51, "elsewhere")}));
    ASSERT_TRUE(store->allocateDocumentId(52).ok());
    auto kids = store->children(50);
    std::sort(kids.begin(), kids.end(),
              [](const InodeRecord& a, const InodeRecord& b) { return a.inode < b.inode; });
    ASSERT_EQ(kids.size(), 3u);
    EXPECT_EQ(kids[0], file(51, 50, "x"));
    EXPECT_EQ(kids[1].inode, 52u);
    EXPECT_EQ(kids[1].docID, 1u);
    EXPECT_EQ(kids[2].kind, InodeRecord::kSymlink);
    ASSERT_FALSE(store->removeInodes({51, 53}));
    ASSERT_EQ(store->children(50).size(), 1u);
    EXPECT_TRUE(store->children(999).empty());
}

TEST(TremorStoreIndexTest, DocumentIdsAreSequentialPerInodeAndSurviveReopen) {
    testing::TempDir state;
    {
        auto store = openStore(state.path());
        ASSERT_TRUE(store);
        EXPECT_EQ(store->allocateDocumentId(10).value(), 1u);
        EXPECT_EQ(store->allocateDocumentId(11).value(), 2u);
        EXPECT_EQ(store->allocateDocumentId(10).value(), 1u);  // already has one
        EXPECT_EQ(store->documentIdForInode(11), 2u);
        EXPECT_EQ(store->inodeForDocumentId(1), 10u);
        EXPECT_EQ(store->documentIdForInode(12), std::nullopt);
        EXPECT_FALSE(store->allocateDocumentId(0).ok());
    }
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    EXPECT_EQ(store->allocateDocumentId(10).value(), 1u);
    EXPECT_EQ(store->allocateDocumentId(12).value(), 3u);
    EXPECT_EQ(store->inodeForDocumentId(2), 11u);
}

TEST(TremorStoreIndexTest, DocumentIdsFollowSafeSavesAndAreNeverReused) {
    testing::TempDir state;
    {
        auto store = openStore(state.path());
        ASSERT_TRUE(store);
        ASSERT_FALSE(store->upsertInodes({file(10, 1, "doc.txt"), file(20, 1, ".doc.tmp")}));
        uint32_t doc = store->allocateDocumentId(10).value();

        // The temporary file replaced the original: the old inode goes, the ID moves.
        ASSERT_FALSE(store->removeInodes({10}));
        EXPECT_EQ(store->inodeForDocumentId(doc), 10u);  // left for the caller to decide
        ASSERT_FALSE(store->upsertInodes({file(20, 1, "doc.txt")}));
        ASSERT_FALSE(store->moveDocumentId(doc, 20));
        EXPECT_EQ(store->inodeForDocumentId(doc), 20u);
        EXPECT_EQ(store->documentIdForInode(20), doc);
        EXPECT_EQ(store->documentIdForInode(10), std::nullopt);
        EXPECT_EQ(store->inode(20).value().docID, doc);
        EXPECT_FALSE(store->moveDocumentId(doc, 20));  // already there

        // An inode cannot carry two IDs, and unknown IDs cannot be moved.
        uint32_t other = store->allocateDocumentId(30).value();
        Status clash = store->moveDocumentId(other, 20);
        ASSERT_TRUE(clash);
        EXPECT_EQ(clash->code(), EEXIST);
        EXPECT_EQ(store->inodeForDocumentId(other), 30u);
        Status unknown = store->moveDocumentId(999, 40);
        ASSERT_TRUE(unknown);
        EXPECT_EQ(unknown->code(), ENOENT);

        ASSERT_FALSE(store->clearDocumentId(other));  // deleted
        EXPECT_EQ(store->inodeForDocumentId(other), std::nullopt);
        EXPECT_EQ(store->allocateDocumentId(30).value(), other + 1);
        ASSERT_FALSE(store->clearDocumentId(other + 1));
    }
    // The highest IDs were cleared; the counter still remembers them.
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    EXPECT_EQ(store->allocateDocumentId(31).value(), 4u);
}

}  // namespace
}  // namespace tamber
