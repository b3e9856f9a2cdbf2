#include <gtest/gtest.h>

#include <sys/inotify.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/objects/Array.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "platform/tremors/Tremors.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/TremorServiceTestSupport.h"

namespace tamber {
namespace {

using testing::eventually;

struct Delivered {
    std::mutex mutex;
    std::vector<JournalEvent> events;  // fileID 0 when the dictionary had none
    std::atomic<int> retains{0};
    std::atomic<int> releases{0};

    std::vector<JournalEvent> snapshot() {
        std::lock_guard lock(mutex);
        return events;
    }
    bool has(uint32_t flag) {
        for (const auto& event : snapshot()) {
            if (event.flags & flag)
                return true;
        }
        return false;
    }
};

void collect(TremorStreamRef, void* info, size_t count, const ObjectRef& paths,
             const uint32_t* flags, const uint64_t* ids) {
    auto* delivered = static_cast<Delivered*>(info);
    auto array = objectCast<Array>(paths);
    ASSERT_TRUE(array);
    ASSERT_EQ(array->count(), count);
    std::lock_guard lock(delivered->mutex);
    for (size_t i = 0; i < count; ++i) {
        auto entry = objectCast<Dictionary>(array->objects()[i]);
        ASSERT_TRUE(entry);
        auto path = objectCast<String>(entry->objectForKey("path"));
        ASSERT_TRUE(path);
        auto fileID = objectCast<Number>(entry->objectForKey("fileID"));
        delivered->events.push_back(
            {ids[i], path->value(), fileID ? fileID->uint64Value() : 0, flags[i]});
    }
}

constexpr uint32_t kCreateFlags =
    kTremorCreateUseObjects | kTremorCreateUseExtendedData | kTremorCreateFileEvents;

class TremorServiceStreamTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        TremorService::configure(state_.path(), api_);
    }
    void TearDown() override {
        for (auto stream : streams_) TremorStreamRelease(stream);
        TremorService::resetForTesting();
    }

    TremorStreamRef open(Delivered& delivered, const std::vector<std::string>& paths,
                         uint64_t since, double latency = 0.01) {
        TremorStreamContext context{&delivered,
                                    [](void* info) {
                                        static_cast<Delivered*>(info)->retains++;
                                        return info;
                                    },
                                    [](void* info) { static_cast<Delivered*>(info)->releases++; }};
        TremorStreamRef stream =
            TremorStreamCreate(&collect, &context, paths, since, latency, kCreateFlags);
        EXPECT_NE(stream, nullptr);
        if (!stream)
            return nullptr;
        streams_.push_back(stream);
        TremorStreamSetDispatchQueue(stream, queue_);
        EXPECT_TRUE(TremorStreamStart(stream));
        return stream;
    }

    std::shared_ptr<TremorService> service() { return TremorService::shared().value(); }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    std::shared_ptr<InotifyApi> api_ = InotifyApi::system();
    std::shared_ptr<DispatchQueue> queue_ = DispatchQueue::makeSerial("stream test");
    std::vector<TremorStreamRef> streams_;
    Delivered delivered_;  // outlives the streams, which release it
};

TEST_F(TremorServiceStreamTest, ReplayThenHistoryDoneThenLiveWithoutGapsOrDuplicates) {
    ASSERT_FALSE(service()->watchTree(tree_));
    for (int i = 0; i < 1100; ++i)  // more than one replay batch
        testing::writeText(tree_ + "/old" + std::to_string(i), "x");

    // Keep writing while the stream replays.
    std::atomic<bool> writing{true};
    std::thread writer([&] {
        for (int i = 0; writing && i < 1000; ++i)
            testing::writeText(tree_ + "/new" + std::to_string(i), "y");
    });
    Delivered& delivered = delivered_;
    open(delivered, {tree_}, 0);
    ASSERT_TRUE(eventually([&] { return delivered.has(kTremorHistoryDone); }));
    writing = false;
    writer.join();
    uint64_t last = TremorsGetCurrentEventId();
    ASSERT_TRUE(eventually([&] {
        auto events = delivered.snapshot();
        return !events.empty() && events.back().id >= last;
    }));

    auto events = delivered.snapshot();
    std::vector<uint64_t> expected;
    for (const auto& event : testing::journaled(*service(), testing::deviceOf(tree_), 0, {tree_}))
        expected.push_back(event.id);
    std::vector<uint64_t> got;
    size_t historyDone = 0;
    for (size_t i = 0; i < events.size(); ++i) {
        if (events[i].flags & kTremorHistoryDone) {
            ++historyDone;
            EXPECT_EQ(events[i].path, tree_);
            continue;
        }
        if (!got.empty()) {
            EXPECT_GT(events[i].id, got.back()) << "out of order or duplicated at " << i;
        }
        got.push_back(events[i].id);
    }
    EXPECT_EQ(historyDone, 1u);
    EXPECT_EQ(got, expected);
    EXPECT_GT(delivered.retains.load(), 0);
}

TEST_F(TremorServiceStreamTest, AnOverflowReachesTheStreamAsLostHistory) {
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
    Delivered& delivered = delivered_;
    open(delivered, {tree_}, TremorStream::kSinceNow);
    overflowing->armed = true;
    testing::writeText(tree_ + "/trigger", "t");
    ASSERT_TRUE(eventually([&] { return delivered.has(kTremorKernelDropped); }));
    EXPECT_FALSE(delivered.has(kTremorHistoryDone));  // "now" has no history to finish
}

TEST_F(TremorServiceStreamTest, HistoryFromBeforeATreeWasWatchedIsReportedLost) {
    std::string other = root_.makeDir("other");
    ASSERT_FALSE(service()->watchTree(other));
    testing::writeText(other + "/a", "a");
    testing::writeText(tree_ + "/before-watch", "b");
    uint64_t since = TremorsGetCurrentEventId();
    ASSERT_GT(since, 0u);

    Delivered& delivered = delivered_;
    open(delivered, {tree_}, 1);  // tree_ comes under watch only now
    ASSERT_TRUE(eventually([&] { return delivered.has(kTremorHistoryDone); }));
    auto events = delivered.snapshot();
    ASSERT_FALSE(events.empty());
    EXPECT_NE(events.front().flags & kTremorUserDropped, 0u);
    EXPECT_NE(events.back().flags & kTremorHistoryDone, 0u);
}

TEST_F(TremorServiceStreamTest, DocumentIdStreamSeesASafeSave) {
    ASSERT_FALSE(service()->watchTree(tree_));
    std::string doc = tree_ + "/doc";
    testing::writeText(doc, "1");
    uint32_t device = testing::deviceOf(tree_);
    int fd = FileSystem::current().open(doc, O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    uint32_t docID = StrataLibraryGetOrAllocateDocumentId(fd);
    FileSystem::current().close(fd);
    ASSERT_NE(docID, 0u);
    uint64_t before = testing::inodeOf(doc);
    EXPECT_FALSE(TremorsCopyUUIDForDevice(device).empty());

    Delivered& delivered = delivered_;
    TremorStreamContext context{&delivered, nullptr, nullptr};
    TremorStreamRef stream = TremorStreamCreateRelativeToDevice(
        &collect, &context, device, {"/.docid"}, TremorsGetCurrentEventId(), 0.01, kCreateFlags);
    ASSERT_NE(stream, nullptr);
    streams_.push_back(stream);
    TremorStreamSetDispatchQueue(stream, queue_);
    ASSERT_TRUE(TremorStreamStart(stream));
    testing::safeSave(doc, "2");
    std::string expected =
        JournalWriter::documentIdPath(device, docID, before, testing::inodeOf(doc));
    ASSERT_TRUE(eventually([&] { return testing::findEvent(delivered.snapshot(), expected); }));
    EXPECT_EQ(StrataLibraryResolveDocumentId2(device, docID), testing::inodeOf(doc));
}

}  // namespace
}  // namespace tamber
