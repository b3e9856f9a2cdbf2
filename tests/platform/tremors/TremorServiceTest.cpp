#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <mutex>
#include <string>
#include <vector>

#include "tests/platform/tremors/TremorServiceFixture.h"

namespace tamber {
namespace {

using namespace testing;
namespace fs = std::filesystem;

TEST_F(TremorServiceTest, ADocumentIdSurvivesSafeSavesAndRenamesNotCopiesAndEndsWithItsFile) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    std::string doc = tree_ + "/a.txt";
    writeText(doc, "a");
    uint32_t docID = documentIdOf(doc);  // drains first: the new file is indexed
    ASSERT_NE(docID, 0u);
    uint64_t before = inodeOf(doc);
    uint64_t since = service_->currentEventId();
    safeSave(doc, "b");
    uint64_t inode = inodeOf(doc);
    ASSERT_NE(inode, before);
    auto docEvents = documentIdEvents(since);
    ASSERT_EQ(docEvents.size(), 1u) << describe(docEvents);
    EXPECT_EQ(docEvents[0].path, JournalWriter::documentIdPath(device_, docID, before, inode));
    EXPECT_EQ(docEvents[0].fileID, inode);
    EXPECT_EQ(documentIdOf(doc), docID);

    std::string moved = tree_ + "/sub/b.txt";
    fs::create_directory(tree_ + "/sub");
    fs::rename(doc, moved);
    fs::copy_file(moved, tree_ + "/copy.txt");
    service_->sync();
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), inode);
    std::string path;
    ASSERT_TRUE(strata_->pathForFileId(device_, inode, path));
    EXPECT_EQ(path, moved);
    EXPECT_EQ(strata_->documentIdForInode(device_, inodeOf(tree_ + "/copy.txt")), 0u);
    EXPECT_NE(documentIdOf(tree_ + "/copy.txt"), docID);

    // Files outside the watched trees never resolve nor get an ID.
    std::string outside = root_.writeFile("outside.txt", "s");
    errno = 0;
    EXPECT_FALSE(strata_->pathForFileId(device_, inodeOf(outside), path));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(strata_->pathForFileId(device_, inodeOf(root_.path()), path));
    errno = 0;
    EXPECT_EQ(documentIdOf(outside), 0u);
    EXPECT_EQ(errno, ENOENT);

    // Deleted: the ID is journaled with no destination and resolves no more.
    since = service_->currentEventId();
    fs::remove(moved);
    docEvents = documentIdEvents(since);
    ASSERT_EQ(docEvents.size(), 1u) << describe(docEvents);
    EXPECT_EQ(docEvents[0].path, JournalWriter::documentIdPath(device_, docID, inode, 0));
    errno = 0;
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), 0u);
    EXPECT_EQ(errno, ENOENT);
    auto treeEvents = journaled(*service_, device_, since, {tree_});
    const JournalEvent* removed = findEvent(treeEvents, moved, kTremorItemRemoved);
    ASSERT_NE(removed, nullptr) << describe(treeEvents);
    EXPECT_EQ(removed->fileID, inode);  // from the index: the file is gone
}

TEST_F(TremorServiceTest, CurrentEventIdIncludesAWriteThatJustCompleted) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    for (int i = 0; i < 20; ++i) {
        std::string path = tree_ + "/f" + std::to_string(i);
        writeText(path, "data");
        uint64_t current = service_->currentEventId();
        auto events = journaled(*service_, device_, 0, {path});
        const JournalEvent* created = findEvent(events, path, kTremorItemCreated);
        ASSERT_NE(created, nullptr) << "write " << i << " not journaled before the answer";
        EXPECT_LE(created->id, current);
        EXPECT_EQ(created->fileID, inodeOf(path));
    }
}

// A burst is written in groups: none of its changes may be lost, doubled or reordered, and the
// listeners see each event once, in ID order.
TEST_F(TremorServiceTest, ABurstIsJournaledWholeAndInOrder) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    uint64_t since = service_->currentEventId();
    std::mutex mutex;
    std::vector<uint64_t> delivered;
    uint64_t token = service_->addListener([&](uint32_t, const std::vector<JournalEvent>& events) {
        std::lock_guard lock(mutex);
        for (const auto& event : events) delivered.push_back(event.id);
    });
    constexpr int kFiles = 1500;
    for (int i = 0; i < kFiles; ++i) {
        std::string path = tree_ + "/a" + std::to_string(i);
        writeText(path, "x");
        if (i % 3 == 0)
            fs::rename(path, tree_ + "/b" + std::to_string(i));
    }
    uint64_t last = service_->currentEventId();
    service_->removeListener(token);
    auto events = journaled(*service_, device_, since);
    ASSERT_FALSE(events.empty());
    EXPECT_EQ(events.back().id, last);
    for (size_t k = 1; k < events.size(); ++k) ASSERT_LT(events[k - 1].id, events[k].id);
    {
        std::lock_guard lock(mutex);
        std::vector<uint64_t> journaledIds;
        for (const auto& event : events) journaledIds.push_back(event.id);
        EXPECT_EQ(delivered, journaledIds);
    }
    // Each file's creation comes before its rename, and the one after it is created after it.
    uint64_t previous = 0;
    for (int i = 0; i < kFiles; ++i) {
        std::string created = tree_ + "/a" + std::to_string(i);
        const JournalEvent* event = findEvent(events, created, kTremorItemCreated);
        ASSERT_NE(event, nullptr) << created;
        EXPECT_LT(previous, event->id) << created;
        previous = event->id;
        if (i % 3 == 0) {
            std::string renamed = tree_ + "/b" + std::to_string(i);
            const JournalEvent* moved = findEvent(events, renamed, kTremorItemRenamed);
            ASSERT_NE(moved, nullptr)
                << renamed << "\n"
                << [&] {
                       std::string text;
                       for (const auto& e : events)
                           if (e.path == renamed || e.path == created)
                               text += std::to_string(e.id) + " " + e.path +
                                       " flags=" + std::to_string(e.flags) + "\n";
                       return text;
                   }();
            EXPECT_LT(event->id, moved->id) << renamed;
            EXPECT_EQ(moved->fileID, inodeOf(renamed));
        }
    }
}

// Makes the index say that `path`'s inode was born at another time: what it says after the
// file was deleted and its inode number given to another file.
void pretendInodeWasReused(const std::string& stateDir, const std::string& path) {
    struct statvfs vfs {};
    ASSERT_EQ(FileSystem::current().statvfs(path, &vfs), 0);
    auto store = TremorStore::open(stateDir, vfs.f_fsid);
    ASSERT_TRUE(store.ok());
    auto record = store.value()->inode(inodeOf(path)).value();
    ASSERT_TRUE(record && record->stamped);
    record->birth += 1;
    ASSERT_TRUE(store.value()->upsertInodes({*record}).ok());
}

TEST_F(TremorServiceTest, ARestartJournalsWhatChangedWhileStopped) {
    std::string kept = root_.writeFile("tree/kept.txt", "k");
    std::string doomed = root_.writeFile("tree/doomed.txt", "d");
    std::string moved = root_.writeFile("tree/moved.txt", "m");
    std::string edited = root_.writeFile("tree/edited.txt", "e");
    std::string reused = root_.writeFile("tree/reused.txt", "r");
    ASSERT_NO_FATAL_FAILURE(startWatching());
    uint32_t keptID = documentIdOf(kept);
    uint32_t doomedID = documentIdOf(doomed);
    uint32_t editedID = documentIdOf(edited);
    uint32_t reusedID = documentIdOf(reused);
    ASSERT_NE(keptID, 0u);
    writeText(tree_ + "/live.txt", "l");
    uint64_t lastBefore = service_->currentEventId();
    uint64_t keptBefore = inodeOf(kept);
    uint64_t doomedInode = inodeOf(doomed);
    uint64_t reusedInode = inodeOf(reused);
    service_->shutdown();
    strata_.reset();
    service_.reset();

    // Changed while nothing watches.
    std::string added = root_.writeFile("tree/new/added.txt", "a");
    safeSave(kept, "k2");
    fs::rename(moved, tree_ + "/renamed.txt");
    fs::remove(doomed);
    writeText(edited, "edited in place");
    // The inode of "reused.txt" now belongs to an unrelated "stranger.txt".
    std::string stranger = tree_ + "/stranger.txt";
    fs::rename(reused, stranger);
    pretendInodeWasReused(state_.path(), stranger);

    ASSERT_NO_FATAL_FAILURE(startWatching());  // asked for again: its history goes on
    auto events = journaled(*service_, device_, lastBefore);
    ASSERT_FALSE(events.empty());
    EXPECT_GT(events.front().id, lastBefore);
    for (size_t i = 1; i < events.size(); ++i) EXPECT_GT(events[i].id, events[i - 1].id);

    std::string all = describe(events);
    EXPECT_NE(findEvent(events, added, kTremorItemCreated), nullptr) << all;
    EXPECT_NE(findEvent(events, tree_ + "/new", kTremorItemCreated | kTremorItemIsDir), nullptr);
    const JournalEvent* removed = findEvent(events, doomed, kTremorItemRemoved);
    ASSERT_NE(removed, nullptr) << all;
    EXPECT_EQ(removed->fileID, doomedInode);
    EXPECT_NE(findEvent(events, tree_ + "/renamed.txt", kTremorItemRenamed), nullptr) << all;
    const JournalEvent* modified = findEvent(events, edited, kTremorItemModified);
    ASSERT_NE(modified, nullptr) << all;
    EXPECT_EQ(modified->fileID, inodeOf(edited));
    EXPECT_EQ(findEvent(events, edited, kTremorItemRemoved), nullptr) << all;
    EXPECT_NE(findEvent(events, reused, kTremorItemRemoved), nullptr) << all;
    EXPECT_NE(findEvent(events, stranger, kTremorItemCreated), nullptr) << all;
    EXPECT_EQ(findEvent(events, stranger, kTremorItemRenamed), nullptr) << all;
    for (const auto& [docID, src, dst] :
         {std::tuple{keptID, keptBefore, inodeOf(kept)}, std::tuple{doomedID, doomedInode, 0ul},
          std::tuple{reusedID, reusedInode, 0ul}}) {
        EXPECT_NE(findEvent(events, JournalWriter::documentIdPath(device_, docID, src, dst)),
                  nullptr)
            << docID << "\n"
            << all;
    }
    EXPECT_EQ(strata_->resolveDocumentId(device_, keptID), inodeOf(kept));
    EXPECT_EQ(strata_->resolveDocumentId(device_, editedID), inodeOf(edited));
    EXPECT_EQ(strata_->resolveDocumentId(device_, doomedID), 0u);
    EXPECT_EQ(strata_->resolveDocumentId(device_, reusedID), 0u);
    EXPECT_EQ(strata_->documentIdForInode(device_, inodeOf(stranger)), 0u);

    // And live watching goes on after the restart.
    uint64_t resumed = service_->currentEventId();
    writeText(tree_ + "/later.txt", "x");
    auto later = journaled(*service_, device_, resumed);
    ASSERT_NE(findEvent(later, tree_ + "/later.txt", kTremorItemCreated), nullptr);
    EXPECT_GT(later.front().id, resumed);
}

TEST_F(TremorServiceTest, AFullQueueDropsAndJournalsTheLossInsteadOfGrowing) {
    auto created = TremorService::create(state_.path(), InotifyApi::system(), 1);
    ASSERT_TRUE(created.ok());
    service_ = created.value();
    ASSERT_TRUE(service_->watchTree(tree_).ok());
    uint64_t since = service_->currentEventId();
    for (int i = 0; i < 200; ++i) writeText(tree_ + "/f" + std::to_string(i), "x");
    auto events = journaled(*service_, device_, since, {tree_});
    const JournalEvent* dropped = findEvent(events, tree_, kTremorUserDropped);
    ASSERT_NE(dropped, nullptr) << describe(events);
    EXPECT_NE(dropped->flags & kTremorMustScanSubdirs, 0u);
}

// tree rather than miss what the batch held.
TEST_F(TremorServiceTest, ABatchThatCannotBeJournaledAsksReadersToRescan) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    service_->sync();
    TremorStore* store = service_->storeForDevice(device_);
    ASSERT_NE(store, nullptr);
    std::string database = store->directory() + "/" + TremorStoreDirectory::kDatabaseName;
    service_->shutdown();
    strata_.reset();
    service_.reset();
    {
        auto db = SqliteDatabase::open(database);
        ASSERT_TRUE(db.ok());
        ASSERT_TRUE(db.value()
                        ->exec("CREATE TRIGGER refused BEFORE INSERT ON inodes WHEN NEW.name = "
                               "'poison' BEGIN SELECT RAISE(ABORT, 'refused'); END")
                        .ok());
    }
    ASSERT_NO_FATAL_FAILURE(startWatching());
    uint64_t since = service_->currentEventId();

    testing::ScopedLogCapture log;
    writeText(tree_ + "/poison", "p");
    std::vector<JournalEvent> events;
    bool rescan = eventually([&] {
        events = journaled(*service_, device_, since);
        return findEvent(events, tree_, kTremorMustScanSubdirs) != nullptr;
    });
    std::string logged;
    for (const auto& line : log->lines()) logged += line.text + "\n";
    EXPECT_TRUE(rescan) << describe(events) << logged;
    EXPECT_EQ(findEvent(events, tree_ + "/poison", kTremorItemCreated), nullptr)
        << "half of a failed batch was journaled\n"
        << describe(events);
}

}  // namespace
}  // namespace tamber
