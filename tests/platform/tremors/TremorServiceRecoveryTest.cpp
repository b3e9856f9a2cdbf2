#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>

#include <atomic>
#include <cstring>
#include <filesystem>
#include <string>

#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/LinuxInotifyApi.h"
#include "platform/tremors/TremorFlags.h"
#include "tests/common/TempDir.h"
#include "tests/platform/tremors/TremorServiceTestSupport.h"

namespace tamber {
namespace {

using testing::findEvent;
using testing::inodeOf;
using testing::journaled;

// The real calls, except that a read can be made to start with a queue-overflow record.
class OverflowingInotifyApi : public LinuxInotifyApi {
public:
    std::atomic<bool> overflowNextRead{false};

    ssize_t read(int fd, void* buffer, size_t size) override {
        if (!overflowNextRead.load() || size < 2 * sizeof(struct inotify_event))
            return LinuxInotifyApi::read(fd, buffer, size);
        struct inotify_event header {};
        header.wd = -1;
        header.mask = IN_Q_OVERFLOW;
        std::memcpy(buffer, &header, sizeof header);
        ssize_t n = LinuxInotifyApi::read(fd, static_cast<char*>(buffer) + sizeof header,
                                          size - sizeof header);
        if (n < 0)
            return n;  // nothing queued after all: keep the overflow for the next read
        overflowNextRead = false;
        return n + static_cast<ssize_t>(sizeof header);
    }
};

uint32_t allocateDocumentId(TremorService& service, const std::string& path) {
    TremorStrataService strata(std::shared_ptr<TremorService>(&service, [](TremorService*) {}));
    int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
    EXPECT_GE(fd, 0);
    uint32_t docID = strata.getOrAllocateDocumentId(fd);
    FileSystem::current().close(fd);
    return docID;
}

TEST(TremorServiceRecoveryTest, ARestartJournalsWhatChangedWhileStopped) {
    testing::TempDir state;
    testing::TempDir root;
    std::string tree = root.makeDir("tree");
    std::string kept = root.writeFile("tree/kept.txt", "k");
    std::string doomed = root.writeFile("tree/doomed.txt", "d");
    std::string moved = root.writeFile("tree/moved.txt", "m");
    uint32_t device = testing::deviceOf(tree);

    auto first = testing::startService(state.path(), tree);
    ASSERT_TRUE(first);
    uint32_t keptID = allocateDocumentId(*first, kept);
    uint32_t doomedID = allocateDocumentId(*first, doomed);
    ASSERT_NE(keptID, 0u);
    testing::writeText(tree + "/live.txt", "l");
    uint64_t lastBefore = first->currentEventId();
    ASSERT_GT(lastBefore, 0u);
    uint64_t keptBefore = inodeOf(kept);
    uint64_t doomedInode = inodeOf(doomed);
    first->shutdown();
    first.reset();

    // Changed while nothing watches. New files first: an inode number freed before they are
    // made could be reused, and a reused number of the same kind reads as a rename.
    std::string added = root.writeFile("tree/new/added.txt", "a");
    testing::safeSave(kept, "k2");
    std::filesystem::rename(moved, tree + "/renamed.txt");
    std::filesystem::remove(doomed);

    auto second = TremorService::create(state.path());  // resumes the remembered tree
    ASSERT_TRUE(second.ok()) << second.error().description();
    auto service = second.value();
    ASSERT_TRUE(service->isWatched(tree));
    auto events = journaled(*service, device, lastBefore);
    ASSERT_FALSE(events.empty());
    EXPECT_GT(events.front().id, lastBefore);
    for (size_t i = 1; i < events.size(); ++i) EXPECT_GT(events[i].id, events[i - 1].id);

    std::string all = testing::describe(events);
    EXPECT_NE(findEvent(events, added, kTremorItemCreated), nullptr) << all;
    EXPECT_NE(findEvent(events, tree + "/new", kTremorItemCreated | kTremorItemIsDir), nullptr);
    const JournalEvent* removed = findEvent(events, doomed, kTremorItemRemoved);
    ASSERT_NE(removed, nullptr) << all;
    EXPECT_EQ(removed->fileID, doomedInode);
    EXPECT_NE(findEvent(events, tree + "/renamed.txt", kTremorItemRenamed), nullptr) << all;
    EXPECT_NE(
        findEvent(events, JournalWriter::documentIdPath(device, keptID, keptBefore, inodeOf(kept))),
        nullptr)
        << all;
    EXPECT_NE(findEvent(events, JournalWriter::documentIdPath(device, doomedID, doomedInode, 0)),
              nullptr)
        << all;

    TremorStrataService strata(service);
    EXPECT_EQ(strata.resolveDocumentId(device, keptID), inodeOf(kept));
    EXPECT_EQ(strata.resolveDocumentId(device, doomedID), 0u);

    // And live watching goes on after the restart.
    uint64_t resumed = service->currentEventId();
    testing::writeText(tree + "/later.txt", "x");
    auto later = journaled(*service, device, resumed);
    ASSERT_NE(findEvent(later, tree + "/later.txt", kTremorItemCreated), nullptr);
    EXPECT_GT(later.front().id, resumed);
}

TEST(TremorServiceRecoveryTest, AKernelOverflowIsJournaledAsLostHistoryAndRescanned) {
    testing::TempDir state;
    testing::TempDir root;
    std::string tree = root.makeDir("tree");
    auto api = std::make_shared<OverflowingInotifyApi>();
    auto created = TremorService::create(state.path(), api);
    ASSERT_TRUE(created.ok());
    auto service = created.value();
    ASSERT_FALSE(service->watchTree(tree));
    uint32_t device = testing::deviceOf(tree);

    std::atomic<int> droppedSeen{0};
    service->addListener([&](uint32_t, const std::vector<JournalEvent>& events) {
        for (const auto& event : events)
            droppedSeen += event.path == tree && (event.flags & kTremorKernelDropped) != 0;
    });
    uint64_t since = service->currentEventId();
    api->overflowNextRead = true;
    testing::writeText(tree + "/trigger.txt", "t");
    ASSERT_TRUE(testing::eventually([&] { return droppedSeen.load() > 0; }));

    auto events = journaled(*service, device, since, {tree});
    const JournalEvent* dropped = findEvent(events, tree, kTremorKernelDropped);
    ASSERT_NE(dropped, nullptr) << testing::describe(events);
    EXPECT_NE(dropped->flags & kTremorMustScanSubdirs, 0u);
    // The rescan keeps the index right: the file is known after the loss.
    TremorStrataService strata(service);
    std::string path;
    EXPECT_TRUE(strata.pathForFileId(device, inodeOf(tree + "/trigger.txt"), path));
}

TEST(TremorServiceRecoveryTest, AFullQueueDropsAndJournalsTheLossInsteadOfGrowing) {
    testing::TempDir state;
    testing::TempDir root;
    std::string tree = root.makeDir("tree");
    auto created = TremorService::create(state.path(), InotifyApi::system(), 1);
    ASSERT_TRUE(created.ok());
    auto service = created.value();
    ASSERT_FALSE(service->watchTree(tree));
    uint32_t device = testing::deviceOf(tree);

    uint64_t since = service->currentEventId();
    for (int i = 0; i < 200; ++i) testing::writeText(tree + "/f" + std::to_string(i), "x");
    auto events = journaled(*service, device, since, {tree});
    const JournalEvent* dropped = findEvent(events, tree, kTremorUserDropped);
    ASSERT_NE(dropped, nullptr) << testing::describe(events);
    EXPECT_NE(dropped->flags & kTremorMustScanSubdirs, 0u);
}

}  // namespace
}  // namespace tamber
