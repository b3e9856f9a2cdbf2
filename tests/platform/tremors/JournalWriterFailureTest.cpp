#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/tremors/FileChange.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorStore.h"
#include "platform/tremors/TremorStoreDirectory.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

uint64_t inodeOf(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

// A watched tree and its journal, whose database refuses chosen writes through a trigger: the
// way a full disk or an I/O error would stop a write half-way through a batch.
class JournalWriterFailureTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        doc_ = root_.writeFile("tree/doc.txt", "d");
        open();
        ASSERT_TRUE(store_->addRoot(tree_, 0).ok());
        ASSERT_TRUE(writer_->reconcile(tree_, false).ok());
        docID_ = store_->allocateDocumentId(inodeOf(doc_)).value();
    }

    void open() {
        auto opened = TremorStore::open(state_.path(), 1);
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        store_ = std::move(opened).value();
        writer_ = std::make_unique<JournalWriter>(*store_, 7);
    }

    // Closes the store, installs `trigger` in its database, and opens it again.
    void refuse(const std::string& trigger) {
        std::string path = store_->directory() + "/" + TremorStoreDirectory::kDatabaseName;
        writer_.reset();
        store_.reset();
        {
            auto db = SqliteDatabase::open(path);
            ASSERT_TRUE(db.ok());
            ASSERT_TRUE(db.value()->exec(trigger).ok());
        }
        open();
    }

    testing::TempDir state_, root_;
    std::string tree_, doc_;
    uint32_t docID_ = 0;
    std::unique_ptr<TremorStore> store_;
    std::unique_ptr<JournalWriter> writer_;
};

TEST_F(JournalWriterFailureTest, AFailedIndexWriteKeepsNothingOfTheBatch) {
    ASSERT_NO_FATAL_FAILURE(
        refuse("CREATE TRIGGER refused BEFORE INSERT ON inodes WHEN NEW.name = 'poison' "
               "BEGIN SELECT RAISE(ABORT, 'refused'); END"));
    uint64_t last = store_->lastEventId();
    std::string fine = root_.writeFile("tree/fine.txt", "f");
    std::string poison = root_.writeFile("tree/poison", "p");

    testing::ScopedLogCapture quiet;
    auto applied = writer_->apply({{FileChange::Kind::Created, fine, {}, false, 0},
                                   {FileChange::Kind::Created, poison, {}, false, 0}});
    EXPECT_FALSE(applied.ok()) << "the batch was reported as journaled";
    EXPECT_EQ(store_->lastEventId(), last) << "events of a failed batch were committed";
    auto indexed = store_->inode(inodeOf(fine));
    ASSERT_TRUE(indexed.ok());
    EXPECT_FALSE(indexed.value().has_value()) << "half of a failed batch stayed in the index";

    // The writer is not left in a broken state: the next batch goes through whole.
    auto next = writer_->apply({{FileChange::Kind::Created, fine, {}, false, 0}});
    ASSERT_TRUE(next.ok());
    EXPECT_EQ(store_->lastEventId(), last + 1);
}

TEST_F(JournalWriterFailureTest, AFailedDocumentIdWriteKeepsTheDocumentAndItsEntry) {
    ASSERT_NO_FATAL_FAILURE(
        refuse("CREATE TRIGGER refused BEFORE DELETE ON documents "
               "BEGIN SELECT RAISE(ABORT, 'refused'); END"));
    uint64_t last = store_->lastEventId();
    uint64_t inode = inodeOf(doc_);
    ASSERT_EQ(::unlink(doc_.c_str()), 0);

    testing::ScopedLogCapture quiet;
    auto applied = writer_->apply({{FileChange::Kind::Removed, doc_, {}, false, 0}});
    EXPECT_FALSE(applied.ok());
    EXPECT_EQ(store_->lastEventId(), last) << "the removal was journaled without its index";
    auto entry = store_->inode(inode);
    ASSERT_TRUE(entry.ok());
    EXPECT_TRUE(entry.value().has_value()) << "the index entry went while its document stayed";
    auto document = store_->inodeForDocumentId(docID_);
    ASSERT_TRUE(document.ok());
    EXPECT_EQ(document.value(), inode);
}

}  // namespace
}  // namespace tamber
