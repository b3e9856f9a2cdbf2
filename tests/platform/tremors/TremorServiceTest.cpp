#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/FileSystem.h"
#include "platform/objects/Array.h"
#include "platform/objects/String.h"
#include "platform/strata/StrataService.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"
#include "platform/tremors/TremorStoreDirectory.h"
#include "platform/tremors/Tremors.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;

// Polls `condition` until it holds or ten seconds pass.
bool eventually(const std::function<bool()>& condition) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (std::chrono::steady_clock::now() < deadline) {
        if (condition())
            return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return condition();
}

struct statx statPath(const std::string& path) {
    struct statx st {};
    EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW,
                                          STATX_INO | STATX_TYPE, &st),
              0)
        << path;
    return st;
}
uint64_t inodeOf(const std::string& path) {
    return statPath(path).stx_ino;
}
uint32_t deviceOf(const std::string& path) {
    auto st = statPath(path);
    return encodeDevice(st.stx_dev_major, st.stx_dev_minor);
}

void writeText(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}
// Writes a temporary file next to `path` and renames it over `path`, as editors save.
void safeSave(const std::string& path, const std::string& text) {
    writeText(path + ".saving", text);
    std::filesystem::rename(path + ".saving", path);
}

// Every journaled event of the device after `since` at or below `paths`.
std::vector<JournalEvent> journaled(TremorService& service, uint32_t device, uint64_t since = 0,
                                    const std::vector<std::string>& paths = {}) {
    std::vector<JournalEvent> events;
    service.sync();
    TremorStore* store = service.storeForDevice(device);
    EXPECT_NE(store, nullptr);
    if (store) {
        EXPECT_TRUE(store
                        ->replay(since, paths, 0,
                                 [&](const JournalEvent& event) {
                                     events.push_back(event);
                                     return true;
                                 })
                        .ok());
    }
    return events;
}

const JournalEvent* findEvent(const std::vector<JournalEvent>& events, const std::string& path,
                              uint32_t flag = 0) {
    for (const auto& event : events) {
        if (event.path == path && (event.flags & flag) == flag)
            return &event;
    }
    return nullptr;
}

std::string describe(const std::vector<JournalEvent>& events) {
    std::string text;
    for (const auto& event : events) {
        text += std::to_string(event.id) + " " + event.path +
                " ino=" + std::to_string(event.fileID) + " flags=" + std::to_string(event.flags) +
                "\n";
    }
    return text;
}

class TremorServiceTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        device_ = deviceOf(tree_);
    }
    // Starts the service on state_; it watches nothing until asked.
    void start() {
        auto service = TremorService::create(state_.path());
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        strata_ = std::make_shared<TremorStrataService>(service_);
    }
    void startWatching() {
        ASSERT_NO_FATAL_FAILURE(start());
        ASSERT_TRUE(service_->watchTree(tree_).ok());
    }
    uint32_t documentIdOf(const std::string& path) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0) << path;
        uint32_t docID = strata_->getOrAllocateDocumentId(fd);
        int error = errno;
        FileSystem::current().close(fd);
        errno = error;
        return docID;
    }
    std::vector<JournalEvent> documentIdEvents(uint64_t since) {
        return journaled(*service_, device_, since, {TremorStore::kDocumentIdRoot});
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    uint32_t device_ = 0;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<TremorStrataService> strata_;
};

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

struct Delivered {
    std::mutex mutex;
    std::vector<JournalEvent> events;

    std::vector<JournalEvent> snapshot() {
        std::lock_guard lock(mutex);
        return events;
    }
    bool has(uint32_t flag) {
        auto all = snapshot();
        return std::any_of(all.begin(), all.end(), [&](auto& event) { return event.flags & flag; });
    }
};

void collect(TremorStreamRef, void* info, size_t count, const ObjectRef& paths,
             const uint32_t* flags, const uint64_t* ids) {
    auto* delivered = static_cast<Delivered*>(info);
    auto array = objectCast<Array>(paths);
    ASSERT_TRUE(array && array->count() == count);
    std::lock_guard lock(delivered->mutex);
    for (size_t i = 0; i < count; ++i) {
        auto path = objectCast<String>(array->objects()[i]);
        ASSERT_TRUE(path);
        delivered->events.push_back({ids[i], path->value(), 0, flags[i]});
    }
}

// Streams from the shared service, as clients open them.
class TremorServiceStreamTest : public TremorServiceTest {
protected:
    void SetUp() override {
        TremorServiceTest::SetUp();
        TremorService::configure(state_.path(), InotifyApi::system());
    }
    void TearDown() override {
        for (auto stream : streams_) TremorStreamRelease(stream);
        TremorService::resetForTesting();
    }

    TremorStreamRef open(Delivered& delivered, uint64_t since) {
        TremorStreamContext context{&delivered, nullptr, nullptr};
        TremorStreamRef stream =
            TremorStreamCreate(&collect, &context, {tree_}, since, 0.01,
                               kTremorCreateUseObjects | kTremorCreateFileEvents);
        EXPECT_NE(stream, nullptr);
        if (!stream)
            return nullptr;
        streams_.push_back(stream);
        TremorStreamSetDispatchQueue(stream, queue_);
        EXPECT_TRUE(TremorStreamStart(stream));
        return stream;
    }
    std::shared_ptr<TremorService> service() { return TremorService::shared().value(); }

    // Waits for everything journaled so far, then checks that the stream saw exactly the
    // journal of tree_: in order, nothing twice, nothing missing, one history-done event.
    void expectExactlyTheJournal() {
        uint64_t last = TremorsGetCurrentEventId();
        ASSERT_TRUE(eventually([&] {
            auto events = delivered_.snapshot();
            return !events.empty() && events.back().id >= last;
        }));
        std::vector<uint64_t> expected;
        for (const auto& event : journaled(*service(), device_, 0, {tree_}))
            expected.push_back(event.id);
        std::vector<uint64_t> got;
        size_t historyDone = 0;
        for (const auto& event : delivered_.snapshot()) {
            if (event.flags & kTremorHistoryDone) {
                ++historyDone;
                EXPECT_EQ(event.path, tree_);
                continue;
            }
            EXPECT_TRUE(got.empty() || event.id > got.back()) << "out of order or repeated";
            got.push_back(event.id);
        }
        EXPECT_EQ(historyDone, 1u);
        EXPECT_EQ(got, expected);
    }

    std::shared_ptr<DispatchQueue> queue_ = DispatchQueue::makeSerial("stream test");
    std::vector<TremorStreamRef> streams_;
    Delivered delivered_;  // both outlive the streams
    Delivered replayed_;
};

TEST_F(TremorServiceStreamTest, ReplayLiveAndARestartedStreamDeliverExactlyTheJournal) {
    ASSERT_TRUE(service()->watchTree(tree_).ok());
    for (int i = 0; i < 1100; ++i)  // more than one replay batch
        writeText(tree_ + "/old" + std::to_string(i), "x");

    // Keep writing while the stream replays.
    std::atomic<bool> writing{true};
    std::thread writer([&] {
        for (int i = 0; writing && i < 1000; ++i)
            writeText(tree_ + "/new" + std::to_string(i), "y");
    });
    TremorStreamRef stream = open(delivered_, 0);
    ASSERT_TRUE(eventually([&] { return delivered_.has(kTremorHistoryDone); }));
    writing = false;
    writer.join();
    ASSERT_NO_FATAL_FAILURE(expectExactlyTheJournal());

    // Stopped, it goes on where it stopped once started again.
    TremorStreamStop(stream);
    for (int i = 0; i < 20; ++i) writeText(tree_ + "/while-stopped" + std::to_string(i), "x");
    service()->sync();
    ASSERT_TRUE(TremorStreamStart(stream));
    EXPECT_FALSE(TremorStreamStart(stream));  // already running
    writeText(tree_ + "/after", "x");
    expectExactlyTheJournal();
}

TEST_F(TremorServiceStreamTest, AnOverflowOrTrimmedHistoryReachesTheStreamAsDropped) {
    struct Overflowing : LinuxInotifyApi {
        std::atomic<bool> armed{false};
        ssize_t read(int fd, void* buffer, size_t size) override {
            if (!armed.exchange(false))
                return LinuxInotifyApi::read(fd, buffer, size);
            struct inotify_event header {};
            header.wd = -1;
            header.mask = IN_Q_OVERFLOW;
            std::memcpy(buffer, &header, sizeof header);
            ssize_t n = LinuxInotifyApi::read(fd, static_cast<char*>(buffer) + sizeof header,
                                              size - sizeof header);
            return std::max<ssize_t>(n, 0) + static_cast<ssize_t>(sizeof header);
        }
    };
    auto overflowing = std::make_shared<Overflowing>();
    TremorService::configure(state_.path(), overflowing);
    open(delivered_, TremorStream::kSinceNow);
    overflowing->armed = true;
    writeText(tree_ + "/trigger", "t");
    ASSERT_TRUE(eventually([&] { return delivered_.has(kTremorKernelDropped); }));
    EXPECT_FALSE(delivered_.has(kTremorHistoryDone));  // "now" has no history to finish

    // Journaled on the tree as a loss that needs a rescan, and the rescan keeps the index right.
    auto events = journaled(*service(), device_, 0, {tree_});
    const JournalEvent* dropped = findEvent(events, tree_, kTremorKernelDropped);
    ASSERT_NE(dropped, nullptr) << describe(events);
    EXPECT_NE(dropped->flags & kTremorMustScanSubdirs, 0u);
    std::string path;
    TremorStrataService strata(service());
    EXPECT_TRUE(strata.pathForFileId(device_, inodeOf(tree_ + "/trigger"), path));

    // A replay from before the oldest kept event starts with the loss, then goes on.
    TremorStore* store = service()->storeForDevice(device_);
    ASSERT_NE(store, nullptr);
    ASSERT_GT(store->lastEventId(), 2u);
    ASSERT_TRUE(store->trim(1).ok());
    open(replayed_, 1);
    ASSERT_TRUE(eventually([&] { return replayed_.has(kTremorHistoryDone); }));
    auto replayed = replayed_.snapshot();
    ASSERT_EQ(replayed.size(), 3u) << describe(replayed);
    EXPECT_EQ(replayed[0].path, tree_);
    EXPECT_EQ(replayed[0].flags, kTremorUserDropped | kTremorMustScanSubdirs);
    EXPECT_EQ(replayed[1].id, store->lastEventId());
}

TEST_F(TremorServiceStreamTest, AReplayFromBeyondTheLastEventIsALossAndReplaysNothing) {
    ASSERT_TRUE(service()->watchTree(tree_).ok());
    for (int i = 0; i < 5; ++i) writeText(tree_ + "/f" + std::to_string(i), "x");
    const uint64_t last = TremorsGetCurrentEventId();
    ASSERT_GT(last, 2u);
    std::vector<Delivered> streams(4);
    const uint64_t beyond[] = {last + 1, uint64_t{INT64_MAX} + 1, UINT64_MAX - 2, UINT64_MAX - 1};
    for (size_t i = 0; i < streams.size(); ++i) open(streams[i], beyond[i]);
    for (size_t i = 0; i < streams.size(); ++i) {
        SCOPED_TRACE("since " + std::to_string(beyond[i]));
        ASSERT_TRUE(eventually([&] { return streams[i].has(kTremorHistoryDone); }));
        // The loss, then the end of a history that holds nothing.
        auto events = streams[i].snapshot();
        ASSERT_EQ(events.size(), 2u) << describe(events);
        EXPECT_EQ(events[0].flags, kTremorUserDropped | kTremorMustScanSubdirs);
        EXPECT_EQ(events[1].flags, kTremorHistoryDone);
    }
    for (auto stream : streams_) TremorStreamStop(stream);
    queue_->sync([] {});
}

// The typed stream of the program's own consumers reports what the journal holds, record for
// record (IDs in order, paths, inodes, flags), without a dictionary to decode.
TEST_F(TremorServiceStreamTest, ATypedStreamDeliversTheJournalsRecordsAsTheyAre) {
    ASSERT_TRUE(service()->watchTree(tree_).ok());
    for (int i = 0; i < 5; ++i) writeText(tree_ + "/f" + std::to_string(i), "x");
    service()->sync();
    Delivered typed;
    TremorStreamRef stream = TremorStreamCreateWithEvents(
        [&typed](const std::vector<JournalEvent>& events) {
            std::lock_guard lock(typed.mutex);
            typed.events.insert(typed.events.end(), events.begin(), events.end());
        },
        std::nullopt, {tree_}, 0, 0.01, kTremorCreateFileEvents);
    ASSERT_NE(stream, nullptr);
    streams_.push_back(stream);
    TremorStreamSetDispatchQueue(stream, queue_);
    ASSERT_TRUE(TremorStreamStart(stream));
    ASSERT_TRUE(eventually([&] { return typed.has(kTremorHistoryDone); }));
    TremorStreamStop(stream);
    queue_->sync([] {});

    std::vector<JournalEvent> got;
    for (const auto& event : typed.snapshot())
        if (!(event.flags & kTremorHistoryDone))
            got.push_back(event);
    auto expected = journaled(*service(), device_, 0, {tree_});
    EXPECT_EQ(got, expected) << "typed:" << describe(got) << "\njournal:" << describe(expected);
    const JournalEvent* file = findEvent(got, tree_ + "/f3", kTremorItemCreated);
    ASSERT_NE(file, nullptr);
    EXPECT_EQ(file->fileID, statPath(tree_ + "/f3").stx_ino);
}

// The stream owns its info through the hooks: one retain when it is made, one release when the
// stream and every batch it queued are gone, never a release while a batch may still use it.
struct CountedInfo {
    std::atomic<int> retains{0};
    std::atomic<int> releases{0};
};
void* retainCounted(void* info) {
    ++static_cast<CountedInfo*>(info)->retains;
    return info;
}
void releaseCounted(void* info) {
    ++static_cast<CountedInfo*>(info)->releases;
}
void collectCounted(TremorStreamRef, void* info, size_t, const ObjectRef&, const uint32_t*,
                    const uint64_t*) {
    auto* counted = static_cast<CountedInfo*>(info);
    EXPECT_EQ(counted->releases.load(), 0) << "a batch reached released info";
}

TEST_F(TremorServiceStreamTest, TheHooksRetainOnceAndReleaseOnceAfterTheLastBatch) {
    ASSERT_TRUE(service()->watchTree(tree_).ok());
    for (int i = 0; i < 50; ++i) writeText(tree_ + "/f" + std::to_string(i), "x");
    CountedInfo counted;
    TremorStreamContext context{&counted, retainCounted, releaseCounted};
    TremorStreamRef stream = TremorStreamCreate(&collectCounted, &context, {tree_}, 0, 0.01,
                                                kTremorCreateUseObjects | kTremorCreateFileEvents);
    ASSERT_NE(stream, nullptr);
    EXPECT_EQ(counted.retains.load(), 1);
    TremorStreamSetDispatchQueue(stream, queue_);
    ASSERT_TRUE(TremorStreamStart(stream));
    // Let go while the replay may still have batches queued.
    TremorStreamStop(stream);
    TremorStreamInvalidate(stream);
    TremorStreamRelease(stream);
    queue_->sync([] {});
    ASSERT_TRUE(eventually([&] { return counted.releases.load() == 1; }));
    EXPECT_EQ(counted.retains.load(), 1);
}

// A batch the journal cannot write is rolled back whole: readers are then told to rescan the
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
