#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorFlags.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/TremorServiceTestSupport.h"

namespace tamber {
namespace {

using testing::findEvent;
using testing::inodeOf;
using testing::journaled;

uint32_t documentIdOf(TremorStrataService& strata, const std::string& path) {
    int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
    EXPECT_GE(fd, 0) << path;
    uint32_t docID = strata.getOrAllocateDocumentId(fd);
    FileSystem::current().close(fd);
    return docID;
}

class TremorServiceTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        service_ = testing::startService(state_.path(), tree_);
        ASSERT_TRUE(service_);
        strata_ = std::make_shared<TremorStrataService>(service_);
        device_ = testing::deviceOf(tree_);
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<TremorStrataService> strata_;
    uint32_t device_ = 0;
};

TEST_F(TremorServiceTest, SafeSaveMovesTheDocumentIdToTheNewInode) {
    std::string doc = tree_ + "/doc.txt";
    testing::writeText(doc, "one");
    uint32_t docID = documentIdOf(*strata_, doc);  // the barrier indexes the new file first
    ASSERT_NE(docID, 0u);
    uint64_t before = inodeOf(doc);
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), before);

    uint64_t since = service_->currentEventId();
    testing::safeSave(doc, "two");
    uint64_t after = inodeOf(doc);
    ASSERT_NE(after, before);
    service_->sync();

    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), after);
    EXPECT_EQ(documentIdOf(*strata_, doc), docID);
    auto events = journaled(*service_, device_, since, {TremorStore::kDocumentIdRoot});
    ASSERT_EQ(events.size(), 1u) << testing::describe(events);
    EXPECT_EQ(events[0].path, JournalWriter::documentIdPath(device_, docID, before, after));
    EXPECT_EQ(events[0].fileID, after);
}

TEST_F(TremorServiceTest, RenameKeepsTheDocumentIdAndCopyGetsNone) {
    std::string doc = tree_ + "/a.txt";
    testing::writeText(doc, "a");
    uint32_t docID = documentIdOf(*strata_, doc);
    ASSERT_NE(docID, 0u);
    std::filesystem::create_directory(tree_ + "/sub");
    std::filesystem::rename(doc, tree_ + "/sub/b.txt");
    std::filesystem::copy_file(tree_ + "/sub/b.txt", tree_ + "/copy.txt");
    service_->sync();

    uint64_t inode = inodeOf(tree_ + "/sub/b.txt");
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), inode);
    std::string path;
    ASSERT_TRUE(strata_->pathForFileId(device_, inode, path));
    EXPECT_EQ(path, tree_ + "/sub/b.txt");
    EXPECT_EQ(strata_->documentIdForInode(device_, inodeOf(tree_ + "/copy.txt")), 0u);
    EXPECT_NE(documentIdOf(*strata_, tree_ + "/copy.txt"), docID);
}

TEST_F(TremorServiceTest, DeletingADocumentJournalsItsIdWithNoDestination) {
    std::string doc = tree_ + "/gone.txt";
    testing::writeText(doc, "x");
    uint32_t docID = documentIdOf(*strata_, doc);
    ASSERT_NE(docID, 0u);
    uint64_t inode = inodeOf(doc);
    uint64_t since = service_->currentEventId();
    std::filesystem::remove(doc);
    service_->sync();

    auto docEvents = journaled(*service_, device_, since, {TremorStore::kDocumentIdRoot});
    ASSERT_EQ(docEvents.size(), 1u) << testing::describe(docEvents);
    EXPECT_EQ(docEvents[0].path, JournalWriter::documentIdPath(device_, docID, inode, 0));
    errno = 0;
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), 0u);
    EXPECT_EQ(errno, ENOENT);
    auto treeEvents = journaled(*service_, device_, since, {tree_});
    const JournalEvent* removed = findEvent(treeEvents, doc, kTremorItemRemoved);
    ASSERT_NE(removed, nullptr);
    EXPECT_EQ(removed->fileID, inode);  // from the index: the file is gone
}

TEST_F(TremorServiceTest, CurrentEventIdIncludesAWriteThatJustCompleted) {
    for (int i = 0; i < 20; ++i) {
        std::string path = tree_ + "/f" + std::to_string(i);
        testing::writeText(path, "data");
        uint64_t current = service_->currentEventId();
        auto events = journaled(*service_, device_, 0, {path});
        const JournalEvent* created = findEvent(events, path, kTremorItemCreated);
        ASSERT_NE(created, nullptr) << "write " << i << " not journaled before the answer";
        EXPECT_LE(created->id, current);
        EXPECT_EQ(created->fileID, inodeOf(path));
    }
}

TEST_F(TremorServiceTest, FileIdsOutsideTheWatchedTreesNeverResolve) {
    std::string outside = root_.writeFile("outside/secret.txt", "s");
    std::string inside = root_.writeFile("tree/deep/er/inside.txt", "i");
    service_->sync();
    std::string path;
    errno = 0;
    EXPECT_FALSE(strata_->pathForFileId(device_, inodeOf(outside), path));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(strata_->pathForFileId(device_, inodeOf(root_.path()), path));
    ASSERT_TRUE(strata_->pathForFileId(device_, inodeOf(inside), path));
    EXPECT_EQ(path, inside);

    int fd = FileSystem::current().open(outside, O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    errno = 0;
    EXPECT_EQ(strata_->getOrAllocateDocumentId(fd), 0u);
    EXPECT_EQ(errno, ENOENT);
    FileSystem::current().close(fd);
}

TEST_F(TremorServiceTest, ASecondServiceOnTheSameStateFailsClearly) {
    auto second = TremorService::create(state_.path());
    ASSERT_FALSE(second.ok());
    EXPECT_NE(second.error().description().find("Another Tamber process is using"),
              std::string::npos)
        << second.error().description();
    // The first one is unaffected.
    testing::writeText(tree_ + "/after.txt", "x");
    service_->sync();
    EXPECT_NE(findEvent(journaled(*service_, device_), tree_ + "/after.txt"), nullptr);
}

TEST_F(TremorServiceTest, EventIdsIncreaseWithoutDuplicates) {
    for (int i = 0; i < 50; ++i) testing::writeText(tree_ + "/n" + std::to_string(i), "x");
    auto events = journaled(*service_, device_);
    ASSERT_GE(events.size(), 50u);
    for (size_t i = 1; i < events.size(); ++i) EXPECT_EQ(events[i].id, events[i - 1].id + 1);
}

}  // namespace
}  // namespace tamber
