#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/TestStores.h"

// Document IDs given to many inodes at once, as a page of a listing asks for them, and the
// placement read that comes before: where each inode is and which ID it has.

namespace tamber {
namespace {

constexpr uint64_t kBatchFsid = 0xba7c;
const std::string kBatchTags = "com.velk.metadata:_kHostItemUserTags";

// Makes every insert of a document row for `inode` fail, as a full disk or an I/O error
// would fail the transaction that holds it. Only while no store has the database open.
void failDocumentRowsFor(const std::string& database, uint64_t inode) {
    auto db = SqliteDatabase::open(database, SQLITE_OPEN_READWRITE);
    ASSERT_TRUE(db.ok());
    ASSERT_TRUE(db.value()
                    ->exec("CREATE TRIGGER injected_failure BEFORE INSERT ON documents WHEN "
                           "NEW.inode = " +
                           std::to_string(inode) + " BEGIN SELECT RAISE(ABORT, 'injected'); END")
                    .ok());
}

InodeRecord entry(uint64_t inode, uint64_t parent, const std::string& name, uint8_t kind) {
    return InodeRecord{inode, parent, name, kind, 0};
}

class DocumentIdBatchTest : public ::testing::Test {
protected:
    void SetUp() override {
        store_ = testing::openTestStore(state_.path(), kBatchFsid);
        ASSERT_TRUE(store_);
        // /w (inode 1) holds folders a (2) and b (3); a holds files 10..12, b holds 20.
        ASSERT_TRUE(store_->addRoot("/w", 0, 1).ok());
        ASSERT_TRUE(store_
                        ->upsertInodes({entry(2, 1, "a", InodeRecord::kDirectory),
                                        entry(3, 1, "b", InodeRecord::kDirectory),
                                        entry(10, 2, "x.txt", InodeRecord::kFile),
                                        entry(11, 2, "y.txt", InodeRecord::kFile),
                                        entry(12, 2, "z.txt", InodeRecord::kFile),
                                        entry(20, 3, "w.txt", InodeRecord::kFile)})
                        .ok());
    }
    void reopen() {
        store_.reset();
        store_ = testing::openTestStore(state_.path(), kBatchFsid);
        ASSERT_TRUE(store_);
    }

    testing::TempDir state_;
    std::unique_ptr<TremorStore> store_;
};

TEST_F(DocumentIdBatchTest, APlacementAnswersEveryInodeAsTheSingleLookUpsDo) {
    uint32_t doc = store_->allocateDocumentId(11).value();
    // 99 is in no folder; 40 names a parent the index does not know.
    ASSERT_TRUE(store_->upsertInodes({entry(40, 77, "lost.txt", InodeRecord::kFile)}).ok());
    std::vector<uint64_t> inodes{10, 11, 20, 1, 2, 99, 40, 12};
    auto placed = store_->placeInodes(inodes);
    ASSERT_TRUE(placed.ok()) << placed.error().description();
    ASSERT_EQ(placed.value().size(), inodes.size());
    for (size_t i = 0; i < inodes.size(); ++i) {
        EXPECT_EQ(placed.value()[i].path, store_->pathForInode(inodes[i]).value()) << inodes[i];
        EXPECT_EQ(placed.value()[i].docID,
                  store_->documentIdForInode(inodes[i]).value().value_or(0))
            << inodes[i];
    }
    EXPECT_EQ(placed.value()[0].path, "/w/a/x.txt");
    EXPECT_EQ(placed.value()[1].docID, doc);
    EXPECT_EQ(placed.value()[5].path, std::nullopt);
    EXPECT_EQ(placed.value()[6].path, std::nullopt);
}

TEST_F(DocumentIdBatchTest, ABatchKeepsIdsThatExistGivesNewOnesOnceAndKeepsTheirCopies) {
    uint32_t existing = store_->allocateDocumentId(11).value();
    auto ids = store_->allocateDocumentIds({{10, {{kBatchTags, Bytes{'t'}}}},
                                            {11, {{kBatchTags, Bytes{'n', 'o'}}}},
                                            {12, {}},
                                            {10, {}},
                                            {20, {}}});
    ASSERT_TRUE(ids.ok()) << ids.error().description();
    const auto& got = ids.value();
    ASSERT_EQ(got.size(), 5u);
    EXPECT_EQ(got[1], existing);
    EXPECT_EQ(got[3], got[0]);  // an inode asked for twice gets one ID
    EXPECT_EQ((std::set<uint32_t>{got[0], got[1], got[2], got[4]}.size()), 4u);
    EXPECT_EQ(store_->inodeForDocumentId(got[0]).value(), 10u);
    EXPECT_EQ(store_->inodeForDocumentId(got[2]).value(), 12u);
    EXPECT_EQ(store_->inodeForDocumentId(got[4]).value(), 20u);
    EXPECT_EQ(store_->documentAttributes(got[0]).value(),
              (TremorStore::Attributes{{kBatchTags, Bytes{'t'}}}));
    // An ID that existed keeps its own copy: the batch's is only for new ones.
    EXPECT_TRUE(store_->documentAttributes(existing).value().empty());

    // Written before they were handed out: a reopened store knows them and goes on after them.
    ASSERT_NO_FATAL_FAILURE(reopen());
    EXPECT_EQ(store_->documentIdForInode(12).value(), got[2]);
    uint32_t next = store_->allocateDocumentId(2).value();
    for (uint32_t id : got) EXPECT_LT(id, next);
}

TEST_F(DocumentIdBatchTest, AFailedBatchHandsOutNoIdAndKeepsNoCopy) {
    uint32_t before = store_->allocateDocumentId(20).value();
    store_.reset();
    ASSERT_NO_FATAL_FAILURE(
        failDocumentRowsFor(testing::testStoreDatabase(state_, kBatchFsid), 12));
    ASSERT_NO_FATAL_FAILURE(reopen());

    auto ids = store_->allocateDocumentIds({{10, {{kBatchTags, Bytes{'t'}}}}, {11, {}}, {12, {}}});
    EXPECT_FALSE(ids.ok());
    EXPECT_EQ(store_->documentIdForInode(10).value(), std::nullopt);
    EXPECT_EQ(store_->documentIdForInode(11).value(), std::nullopt);
    EXPECT_TRUE(store_->documentAttributes(before + 1).value().empty());
    // The counter went back with the rows.
    EXPECT_EQ(store_->allocateDocumentId(10).value(), before + 1);
    EXPECT_EQ(store_->allocateDocumentId(12).ok(), false);
    EXPECT_EQ(store_->allocateDocumentId(11).value(), before + 2);
}

}  // namespace
}  // namespace tamber
