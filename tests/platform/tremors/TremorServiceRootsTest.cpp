#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/FileSystem.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;

struct statx statPath(const std::string& path) {
    struct statx st {};
    EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW,
                                          STATX_INO | STATX_TYPE, &st),
              0)
        << path;
    return st;
}
uint64_t rootInodeOf(const std::string& path) {
    return statPath(path).stx_ino;
}

// Which trees a service watches from one run to the next: only those asked for in the run.
class TremorServiceRootsTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage_ = root_.makeDir("storage");
        other_ = root_.makeDir("other");
        auto st = statPath(storage_);
        device_ = encodeDevice(st.stx_dev_major, st.stx_dev_minor);
    }
    void start() {
        stop();
        auto service = TremorService::create(state_.path());
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        strata_ = std::make_shared<TremorStrataService>(service_);
    }
    void stop() {
        strata_.reset();
        if (service_)
            service_->shutdown();
        service_.reset();
    }
    TremorStore& store() {
        TremorStore* store = service_->storeForDevice(device_);
        EXPECT_NE(store, nullptr);
        return *store;
    }
    uint32_t documentIdOf(const std::string& path) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0) << path;
        uint32_t docID = strata_->getOrAllocateDocumentId(fd);
        FileSystem::current().close(fd);
        return docID;
    }
    bool resolves(const std::string& path) {
        std::string found;
        return strata_->pathForFileId(device_, rootInodeOf(path), found) && found == path;
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string storage_;
    std::string other_;
    uint32_t device_ = 0;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<TremorStrataService> strata_;
};

TEST_F(TremorServiceRootsTest, ARememberedTreeIsNeitherWatchedNorCrawledNorResolvedUntilAskedFor) {
    std::string file = root_.writeFile("other/file.txt", "x");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    ASSERT_TRUE(resolves(file));
    uint64_t last = service_->currentEventId();
    stop();

    // Changed while nothing ran: a crawl at start would journal it.
    root_.writeFile("other/while-stopped.txt", "y");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    EXPECT_FALSE(service_->isWatched(other_));
    EXPECT_EQ(service_->currentEventId(), last) << "a tree nobody asked for was crawled";
    EXPECT_FALSE(resolves(file)) << "an unpublished tree answered a path";
    root_.writeFile("other/live.txt", "z");
    EXPECT_EQ(service_->currentEventId(), last) << "a tree nobody asked for is watched";

    // Asked for again in the same run: its history goes on where it stopped.
    ASSERT_TRUE(service_->watchTree(other_).ok());
    EXPECT_TRUE(resolves(file));
    EXPECT_TRUE(store().replayability(last, {other_}).complete)
        << store().replayability(last, {other_}).reason;
    bool journaled = false;
    ASSERT_TRUE(store()
                    .replay(last, {other_}, 0,
                            [&](const JournalEvent& event) {
                                journaled |= event.path == other_ + "/while-stopped.txt" &&
                                             (event.flags & kTremorItemCreated) != 0;
                                return true;
                            })
                    .ok());
    EXPECT_TRUE(journaled);
}

TEST_F(TremorServiceRootsTest, ATreeARunLeftAsideStartsItsHistoryAnewWhenAskedForAgain) {
    std::string file = root_.writeFile("other/file.txt", "x");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    uint64_t anchor = service_->currentEventId();
    stop();

    // A run that publishes only the storage folder.
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    EXPECT_EQ(service_->retireUnwatched(), std::vector<std::string>{other_});
    EXPECT_TRUE(service_->retireUnwatched().empty()) << "retired twice";
    stop();

    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    EXPECT_TRUE(store().replayability(anchor, {storage_}).complete);
    auto check = store().replayability(anchor, {other_});
    EXPECT_FALSE(check.complete) << "the run that left it aside hid a gap";
    EXPECT_TRUE(store().replayability(service_->currentEventId(), {other_}).complete);
    EXPECT_TRUE(resolves(file));
}

TEST_F(TremorServiceRootsTest, AForgottenTreeNoLongerAnswersNorJournalsAndIsForgottenOnce) {
    std::string file = root_.writeFile("other/deep/file.txt", "x");
    std::string kept = root_.writeFile("storage/sub/kept.txt", "k");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    uint32_t docID = documentIdOf(file);
    ASSERT_NE(docID, 0u);
    ASSERT_NE(documentIdOf(kept), 0u);

    auto forgotten = service_->forget(other_ + "/");
    ASSERT_TRUE(forgotten.ok()) << forgotten.error().description();
    EXPECT_EQ(forgotten.value().entries, 2u);  // deep and deep/file.txt
    EXPECT_EQ(forgotten.value().documents, 1u);
    EXPECT_FALSE(service_->isWatched(other_));
    EXPECT_FALSE(resolves(file));
    errno = 0;
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), 0u);
    EXPECT_EQ(strata_->documentIdForInode(device_, rootInodeOf(file)), 0u);
    uint64_t last = service_->currentEventId();
    root_.writeFile("other/after.txt", "y");
    EXPECT_EQ(service_->currentEventId(), last) << "a forgotten tree is still journaled";
    EXPECT_TRUE(resolves(kept));

    auto again = service_->forget(other_);
    ASSERT_FALSE(again.ok());
    EXPECT_EQ(again.error().code(), ENOENT);
    EXPECT_FALSE(service_->forget(root_ / "never-watched").ok());

    // A tree inside one this run publishes stays that tree's: nothing of it is dropped.
    std::string sub = storage_ + "/sub";
    ASSERT_TRUE(service_->watchTree(sub).ok());  // covered: not a root of its own
    stop();
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(sub).ok());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    forgotten = service_->forget(sub);
    ASSERT_TRUE(forgotten.ok()) << forgotten.error().description();
    EXPECT_EQ(forgotten.value().entries, 0u);
    EXPECT_TRUE(resolves(kept));
    EXPECT_TRUE(service_->isWatched(kept));

    // Forgotten for good: the next run does not know it, and watching it starts anew.
    stop();
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_FALSE(service_->forget(other_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    EXPECT_FALSE(store().replayability(last, {other_}).complete);
    EXPECT_TRUE(resolves(file));
    EXPECT_NE(documentIdOf(file), docID) << "a forgotten document ID came back";
}

TEST_F(TremorServiceRootsTest, ATreeWhoseFolderIsGoneIsForgottenAtStartWithOneInfoLine) {
    std::string gone = root_.makeDir("gone");
    std::string file = root_.writeFile("gone/file.txt", "x");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(gone).ok());
    uint32_t docID = documentIdOf(file);
    ASSERT_NE(docID, 0u);
    stop();
    fs::remove_all(gone);

    auto infoLines = [&](const CaptureLogSink& sink) {
        size_t n = 0;
        for (const auto& line : sink.lines())
            n += line.level == LogLevel::Info && line.text.find(gone) != std::string::npos;
        return n;
    };
    {
        testing::ScopedLogCapture log;
        ASSERT_NO_FATAL_FAILURE(start());
        EXPECT_EQ(infoLines(log.sink()), 1u);
    }
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    for (const auto& root : store().rememberedRoots()) EXPECT_NE(root.path, gone);
    EXPECT_EQ(strata_->resolveDocumentId(device_, docID), 0u);
    {
        testing::ScopedLogCapture log;
        ASSERT_NO_FATAL_FAILURE(start());
        EXPECT_EQ(infoLines(log.sink()), 0u) << "forgotten twice";
    }
}

TEST_F(TremorServiceRootsTest, WatchRememberedResumesWhatTheLastRunWatched) {
    std::string file = root_.writeFile("other/file.txt", "x");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_TRUE(service_->watchTree(storage_).ok());
    ASSERT_TRUE(service_->watchTree(other_).ok());
    uint64_t anchor = service_->currentEventId();
    stop();
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_TRUE(service_->watchRemembered().ok());
    EXPECT_TRUE(service_->isWatched(storage_));
    EXPECT_TRUE(service_->isWatched(other_));
    EXPECT_TRUE(store().replayability(anchor, {storage_, other_}).complete);
    EXPECT_TRUE(resolves(file));
}

}  // namespace
}  // namespace tamber
