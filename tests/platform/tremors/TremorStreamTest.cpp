#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/platform/tremors/TremorServiceFixture.h"

namespace tamber {
namespace {

using namespace testing;
namespace fs = std::filesystem;

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

// A stream its client never released (a change enumeration cut short by a shutdown) must not
// keep a stopped journal alive: its databases and their lock would stay with it, and the next
// journal on the same state could not start. Once the journal is gone the stream does nothing.
TEST_F(TremorServiceStreamTest, AStreamNeverReleasedDoesNotKeepAStoppedJournalAlive) {
    ASSERT_TRUE(service()->watchTree(tree_).ok());
    TremorStreamRef stream = open(delivered_, 0);
    ASSERT_TRUE(eventually([&] { return delivered_.has(kTremorHistoryDone); }));
    std::weak_ptr<TremorService> journal = TremorService::sharedIfRunning();
    ASSERT_FALSE(journal.expired());
    TremorService::stopShared();
    EXPECT_TRUE(journal.expired()) << "the stream still holds the journal";

    auto next = TremorService::create(state_.path());
    EXPECT_TRUE(next.ok()) << next.error().description();
    TremorStreamStop(stream);
    EXPECT_FALSE(TremorStreamStart(stream));
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

}  // namespace
}  // namespace tamber
