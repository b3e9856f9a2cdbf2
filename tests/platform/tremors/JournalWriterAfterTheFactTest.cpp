#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/FileSystem.h"
#include "platform/tremors/FileChange.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;

uint64_t inodeOfFile(const std::string& path) {
    struct statx st {};
    EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_INO, &st), 0)
        << path;
    return st.stx_ino;
}

// Batches are applied after the fact, so a rename's new name may be empty already. Where the
// document went decides: gone for good is reported gone (a browser that listed it must hear of
// it), moved on in the same batch keeps its ID, and a new file at its old name is a safe save.
class WriterAfterTheFactTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree = root.makeDir("tree");
        auto opened = TremorStore::open(state.path(), 1);
        ASSERT_TRUE(opened.ok());
        store = std::move(opened).value();
        writer.emplace(*store, 7);
        ASSERT_TRUE(store->addRoot(tree, 0).ok());
    }
    // A document at `name`, known to the index before anything happens.
    std::pair<uint64_t, uint32_t> document(const std::string& name) {
        std::string path = root.writeFile("tree/" + name, name);
        EXPECT_TRUE(writer->reconcile(tree, false).ok());
        uint64_t inode = inodeOfFile(path);
        return {inode, store->allocateDocumentId(inode).value()};
    }
    std::vector<JournalEvent> apply(const std::vector<FileChange>& changes) {
        auto events = writer->apply(changes);
        EXPECT_TRUE(events.ok());
        return events.ok() ? events.value() : std::vector<JournalEvent>{};
    }
    static bool journaled(const std::vector<JournalEvent>& events, const std::string& path) {
        for (const auto& event : events)
            if (event.path == path)
                return true;
        return false;
    }
    std::string at(const std::string& name) { return tree + "/" + name; }

    testing::TempDir state, root;
    std::string tree;
    std::unique_ptr<TremorStore> store;
    std::optional<JournalWriter> writer;
};

// Lost events are made up for by comparing every tree with the index: a document that moved
// from one published tree to another meanwhile is the same file and keeps its ID.
TEST_F(WriterAfterTheFactTest, ADocumentMovedToAnotherTreeUnseenKeepsItsId) {
    std::string other = root.makeDir("other");
    ASSERT_TRUE(store->addRoot(other, 0).ok());
    ASSERT_TRUE(writer->reconcile(other, false).ok());
    auto [inode, docID] = document("report.txt");
    std::filesystem::rename(at("report.txt"), other + "/report.txt");

    auto events = writer->reconcile(std::vector<std::string>{tree, other}, true);
    ASSERT_TRUE(events.ok());
    EXPECT_EQ(store->documentIdForInode(inode).value(), docID);
    EXPECT_TRUE(journaled(events.value(), other + "/report.txt"));
    EXPECT_FALSE(journaled(events.value(), JournalWriter::documentIdPath(7, docID, inode, 0)))
        << "reported deleted";
}

TEST_F(WriterAfterTheFactTest, ADocumentRenamedThenRemovedIsReportedGoneAndLeavesNoEntry) {
    auto [inode, docID] = document("doomed.txt");
    fs::rename(at("doomed.txt"), at("renamed.txt"));
    fs::remove(at("renamed.txt"));
    auto events = apply({{FileChange::Kind::Renamed, at("renamed.txt"), at("doomed.txt"), false, 0},
                         {FileChange::Kind::Removed, at("renamed.txt"), {}, false, 0}});
    EXPECT_TRUE(journaled(events, JournalWriter::documentIdPath(7, docID, inode, 0)));
    EXPECT_EQ(store->inodeForDocumentId(docID).value(), std::nullopt);
    EXPECT_EQ(store->pathForInode(inode).value(), std::nullopt);
}

// A file moved into a folder made just before is not seen as a move: the new folder was not
// watched yet, so the kernel reports the old name as removed and the folder's listing finds the
// file. The index knows the file, so the journal reports a move, which a browser can follow.
TEST_F(WriterAfterTheFactTest, AKnownFileFoundInANewFolderIsJournaledAsAMove) {
    auto [inode, docID] = document("a.txt");
    fs::create_directory(at(".Trash"));
    fs::rename(at("a.txt"), at(".Trash/a.txt"));
    auto events = apply({{FileChange::Kind::Created, at(".Trash"), {}, true, 0},
                         {FileChange::Kind::Created, at(".Trash/a.txt"), {}, false, 0},
                         {FileChange::Kind::Removed, at("a.txt"), {}, false, 0}});
    bool movedAway = false;
    for (const auto& event : events) {
        if (event.path == at("a.txt") && event.fileID == inode &&
            (event.flags & kTremorItemRenamed))
            movedAway = true;
    }
    EXPECT_TRUE(movedAway) << "the old name's event must carry the file's number as a move";
    EXPECT_EQ(store->documentIdForInode(inode).value(), docID);
    EXPECT_EQ(store->pathForInode(inode).value(), at(".Trash/a.txt"));
    EXPECT_FALSE(journaled(events, JournalWriter::documentIdPath(7, docID, inode, 0)));
}

TEST_F(WriterAfterTheFactTest, ADocumentRenamedTwiceKeepsItsIdAtItsLastName) {
    auto [inode, docID] = document("a.txt");
    fs::rename(at("a.txt"), at("b.txt"));
    fs::rename(at("b.txt"), at("c.txt"));
    auto events = apply({{FileChange::Kind::Renamed, at("b.txt"), at("a.txt"), false, 0},
                         {FileChange::Kind::Renamed, at("c.txt"), at("b.txt"), false, 0}});
    EXPECT_FALSE(journaled(events, JournalWriter::documentIdPath(7, docID, inode, 0)));
    EXPECT_EQ(store->documentIdForInode(inode).value(), docID);
    EXPECT_EQ(store->pathForInode(inode).value(), at("c.txt"));
}

TEST_F(WriterAfterTheFactTest, ABackupRenameThenANewFileAtTheNameIsASafeSave) {
    auto [inode, docID] = document("doc.txt");
    fs::rename(at("doc.txt"), at("doc.txt~"));
    std::ofstream(at("doc.txt.new"), std::ios::binary) << "v1";
    fs::rename(at("doc.txt.new"), at("doc.txt"));
    fs::remove(at("doc.txt~"));
    uint64_t saved = inodeOfFile(at("doc.txt"));
    auto events = apply({{FileChange::Kind::Renamed, at("doc.txt~"), at("doc.txt"), false, 0},
                         {FileChange::Kind::Created, at("doc.txt.new"), {}, false, 0},
                         {FileChange::Kind::Renamed, at("doc.txt"), at("doc.txt.new"), false, 0},
                         {FileChange::Kind::Removed, at("doc.txt~"), {}, false, 0}});
    EXPECT_EQ(store->documentIdForInode(saved).value(), docID);
    EXPECT_FALSE(journaled(events, JournalWriter::documentIdPath(7, docID, inode, 0)));
}

}  // namespace
}  // namespace tamber
