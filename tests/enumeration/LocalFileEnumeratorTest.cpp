#include "enumeration/LocalFileEnumerator.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <filesystem>
#include <random>
#include <thread>

#include "enumeration/LocalChangesObserverContext.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/strata/StrataService.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/enumeration/EnumerationTest.h"

namespace tamber {
namespace {

using testing::EnumerationTest;
using Names = std::vector<std::string>;

class LocalFileEnumeratorTest : public EnumerationTest {
protected:
    LocalFileEnumeratorRef folderEnumerator(const std::string& path) {
        return track(LocalFileEnumerator::initWithContainer(
            "fid=1", {Url::fileURLWithPath(path)}));  // the identifier only names the container
    }
    LocalFileEnumeratorRef track(LocalFileEnumeratorRef enumerator) {
        enumerators.push_back(enumerator);
        return enumerator;
    }
    // `count` files named n0000... in `folder` (under the storage), created in reverse order.
    Names fill(const std::string& folder, int count) {
        Names names;
        for (int i = count - 1; i >= 0; --i) {
            char name[16];
            std::snprintf(name, sizeof name, "n%04d", i);
            dir.writeFile("s/" + folder + "/" + name);
            names.insert(names.begin(), name);
        }
        return names;
    }
};

TEST_F(LocalFileEnumeratorTest, FolderPagesCarryTheirTokenAndFinishWithAShortPage) {
    for (int count : {200, 450}) {
        std::string folder = "f" + std::to_string(count);
        Names expected = fill(folder, count);
        dir.writeFile("s/" + folder + "/.hidden");
        dir.writeFile("s/" + folder + "/Deck.lumen/inside");
        dir.writeFile("s/" + folder + "/sub/inside");
        expected.insert(expected.begin(), "Deck.lumen");
        expected.push_back("sub");
        auto enumerator = folderEnumerator(storage + "/" + folder);

        uint64_t eventAtStart = TremorReader::currentEventID();
        Names all;
        std::vector<uint64_t> offsets;
        HostPorterPage page = HostPorterInitialPageSortedByName();
        for (;;) {
            testing::ListedPage listed = list(*enumerator, page);
            ASSERT_FALSE(listed.error) << listed.error->description();
            all.insert(all.end(), listed.names.begin(), listed.names.end());
            if (!listed.next)
                break;
            EXPECT_EQ(listed.names.size(), 200u);
            auto token = FSChangeToken::decode(*listed.next);
            ASSERT_TRUE(token);
            EXPECT_EQ(token->version, 0u);
            EXPECT_EQ(token->deviceUUID, deviceUUID());
            EXPECT_EQ(token->streamEventID, eventAtStart) << "resumed phases keep the start";
            EXPECT_EQ(token->appLibraryVersionToken, 0u);
            offsets.push_back(token->offset);
            page = *listed.next;
        }
        EXPECT_EQ(all, expected) << folder;
        std::vector<uint64_t> expectedOffsets{200};
        if (count == 450)
            expectedOffsets.push_back(400);
        EXPECT_EQ(offsets, expectedOffsets) << folder;
        EXPECT_EQ(log->count("[DEBUG] gather phase finished for [" + storage + "/" + folder + "]",
                             LogLevel::Debug),
                  1u);
    }
    EXPECT_EQ(log->countStartingWith("[DEBUG] safe to resume gather phase from "), 3u);
    // Both initial pages start the same listing.
    auto enumerator = folderEnumerator(storage + "/f200");
    EXPECT_EQ(list(*enumerator, HostPorterInitialPageSortedByDate()).names,
              list(*enumerator, HostPorterInitialPageSortedByName()).names);
}

TEST_F(LocalFileEnumeratorTest, WorkingSetListsEveryTreeThenEachTrashTopLevel) {
    install({"com.example.app"});
    std::string library = documents("com.example.app").path();
    dir.writeFile("s/a.txt");
    dir.writeFile("s/sub/b.txt");
    dir.writeFile("s/.Trash/t1.txt");
    dir.writeFile("s/.Trash/tdir/deep.txt");
    dir.writeFile("s/.Trash/.DS_Store");
    std::filesystem::create_directories(library + "/.Trash");
    dir.writeFile("apps/com.example.app/Documents/c.txt");
    dir.writeFile("apps/com.example.app/Documents/.Trash/t2.txt");
    ASSERT_TRUE(TremorService::shared().value()->watchTree(library).ok());
    // The library's files are published once the shared manager knows the library.
    auto shared = LocalAppLibraryManager::shared();
    ASSERT_TRUE(shared->refresh());
    ASSERT_TRUE(shared->upgradeFromMainCache(nullptr, false));

    auto workingSet = track(LocalFileEnumerator::initWithContainer(
        HostPorterWorkingSetContainerItemIdentifier,
        {Url::fileURLWithPath(storage), Url::fileURLWithPath(library)}));
    auto listed = list(*workingSet, HostPorterInitialPageSortedByDate());
    EXPECT_EQ(listed.names, (Names{"a.txt", "sub", "b.txt", "c.txt", "t1.txt", "tdir", "t2.txt"}));
    EXPECT_FALSE(listed.next);

    // All directories: whole trees, no trash; an ordinary folder: its children only.
    auto allDirectories = track(LocalFileEnumerator::initWithContainer(
        HostPorterAllDirectoriesContainerItemIdentifier,
        {Url::fileURLWithPath(storage), Url::fileURLWithPath(library)}));
    EXPECT_EQ(list(*allDirectories, HostPorterInitialPageSortedByName()).names,
              (Names{"a.txt", "sub", "b.txt", "c.txt"}));
    EXPECT_EQ(list(*folderEnumerator(storage), HostPorterInitialPageSortedByName()).names,
              (Names{"a.txt", "sub"}));
}

TEST_F(LocalFileEnumeratorTest, UnusablePageTokensExpireThePage) {
    fill("f", 30);
    auto enumerator = folderEnumerator(storage + "/f");

    std::mt19937 random(11);
    for (int i = 0; i < 20; ++i) {
        HostPorterPage garbage(1 + random() % 64);
        for (auto& byte : garbage) byte = static_cast<uint8_t>(random());
        auto listed = list(*enumerator, garbage);
        EXPECT_TRUE(isExpired(listed.error));
        EXPECT_TRUE(listed.names.empty());
    }
    EXPECT_EQ(log->count("[ERROR] can't create change token from anchor data, resetting",
                         LogLevel::Error),
              20u);

    const std::string other = "00000000-0000-4000-8000-000000000001";
    auto foreign = list(*enumerator, pageToken(0, other));
    EXPECT_TRUE(isExpired(foreign.error));
    EXPECT_TRUE(foreign.names.empty());
    EXPECT_EQ(log->count("[DEBUG] device UUID changed (" + other + " -> " + deviceUUID() + ")",
                         LogLevel::Debug),
              1u);

    // An offset past the end of the listing: the walk comes back short of it.
    auto beyond = list(*enumerator, pageToken(1000));
    EXPECT_TRUE(isExpired(beyond.error));
    EXPECT_TRUE(beyond.names.empty());
    EXPECT_EQ(log->count("[ERROR] enumerator returned an offset (30) smaller than the initial "
                         "offset 1000",
                         LogLevel::Error),
              1u);
}

TEST_F(LocalFileEnumeratorTest, ResumingAfterADeletionStartsOver) {
    fill("f", 250);
    auto enumerator = folderEnumerator(storage + "/f");
    auto first = list(*enumerator, HostPorterInitialPageSortedByName());
    ASSERT_TRUE(first.next);

    // A file added meanwhile does not stop the listing from resuming.
    dir.writeFile("s/f/zz-new");
    auto second = list(*enumerator, *first.next);
    ASSERT_FALSE(second.error) << second.error->description();
    EXPECT_EQ(second.names.size(), 51u);
    EXPECT_EQ(second.names.back(), "zz-new");

    std::filesystem::remove(storage + "/f/n0003");
    auto afterDeletion = list(*enumerator, *first.next);
    EXPECT_TRUE(isExpired(afterDeletion.error));
    EXPECT_EQ(log->countStartingWith("[DEBUG] deletion of ["), 1u);
    EXPECT_EQ(log->count("[DEBUG] start gather phase", LogLevel::Debug), 1u);
}

TEST_F(LocalFileEnumeratorTest, AFolderThatCantBeReadFailsItsPageWhileOneInsideItIsSkipped) {
    fill("locked", 3);
    fill("open", 2);
    fill("open/inner", 1);
    // Permission bits don't stop root, which runs the tests: refuse the reads instead.
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(faults);
    faults->inject(FaultInjectingFileSystem::Operation::ReadDirectory, EACCES, -1, "/locked");
    faults->inject(FaultInjectingFileSystem::Operation::ReadDirectory, EIO, -1, "/inner");

    auto listed = list(*folderEnumerator(storage + "/locked"), HostPorterInitialPageSortedByName());
    ASSERT_TRUE(listed.error);
    EXPECT_TRUE(listed.error->is(kPosixErrorDomain, EACCES)) << listed.error->description();
    EXPECT_NE(listed.error->reason().find(storage + "/locked"), std::string::npos)
        << listed.error->reason();
    EXPECT_TRUE(listed.names.empty());
    EXPECT_FALSE(listed.next);

    // A listing of a folder's children doesn't read them; a whole tree walks on past the one
    // it can't read.
    auto open = list(*folderEnumerator(storage + "/open"), HostPorterInitialPageSortedByName());
    EXPECT_FALSE(open.error);
    EXPECT_EQ(open.names, (Names{"inner", "n0000", "n0001"}));
    auto tree = list(*track(LocalFileEnumerator::initWithContainer(
                         HostPorterAllDirectoriesContainerItemIdentifier,
                         {Url::fileURLWithPath(storage + "/open")})),
                     HostPorterInitialPageSortedByName());
    EXPECT_FALSE(tree.error);
    EXPECT_EQ(tree.names, (Names{"inner", "n0000", "n0001"}));
}

TEST_F(LocalFileEnumeratorTest, NoDeviceUUIDFailsTheListingAndLeavesNoAnchor) {
    std::string missing = storage + "/missing";
    auto enumerator = folderEnumerator(missing);
    EXPECT_FALSE(enumerator->notifier());
    EXPECT_EQ(log->count("[ERROR] can't create notifier for \"fid=1\"; enumeration will have no "
                         "live update",
                         LogLevel::Error),
              1u);
    auto listed = list(*enumerator, HostPorterInitialPageSortedByName());
    ASSERT_TRUE(listed.error);
    EXPECT_EQ(listed.error->domain(), "LocalPorter.Error");
    EXPECT_EQ(listed.error->code(), 3);
    EXPECT_EQ(log->count("[ERROR] can't get volume UUID for " + missing, LogLevel::Error), 1u);
    EXPECT_FALSE(currentAnchor(*enumerator));

    auto changed = changes(*enumerator, pageToken(0));
    ASSERT_TRUE(changed->error);
    EXPECT_EQ(changed->error->code(), 3);
    EXPECT_EQ(enumerator->runningEnumeratorCount(), 0u);
}

TEST_F(LocalFileEnumeratorTest, ChangesMadeDuringTheGatherPhaseAreReportedAfterIt) {
    fill("f", 210);
    auto enumerator = folderEnumerator(storage + "/f");
    auto anchor = currentAnchor(*enumerator);
    ASSERT_TRUE(anchor);
    auto first = list(*enumerator, HostPorterInitialPageSortedByName());
    ASSERT_TRUE(first.next);
    dir.writeFile("s/f/written-while-listing", "new");
    auto last = list(*enumerator, *first.next);
    ASSERT_FALSE(last.error);
    EXPECT_FALSE(last.next);

    auto observer = changes(*enumerator, *anchor);
    EXPECT_FALSE(observer->error);
    EXPECT_NE(
        std::find(observer->updated.begin(), observer->updated.end(), "written-while-listing"),
        observer->updated.end());
    EXPECT_FALSE(observer->moreComing);
    auto next = FSChangeToken::decode(*observer->anchor);
    ASSERT_TRUE(next);
    EXPECT_GT(next->streamEventID, FSChangeToken::decode(*anchor)->streamEventID);
    EXPECT_TRUE(detachesAll(*enumerator)) << "a finished enumeration is dropped";

    // Anchors that can't be used: nothing is started.
    auto garbage = changes(*enumerator, HostPorterSyncAnchor{1, 2, 3});
    EXPECT_TRUE(isExpired(garbage->error));
    auto foreign = changes(*enumerator, pageToken(0, "00000000-0000-4000-8000-000000000002"));
    EXPECT_TRUE(isExpired(foreign->error));
    EXPECT_EQ(enumerator->runningEnumeratorCount(), 0u);
}

TEST_F(LocalFileEnumeratorTest, AFullPageOfChangesEndsWithMoreComingAndDetaches) {
    std::filesystem::create_directories(storage + "/f");
    auto enumerator = folderEnumerator(storage + "/f");
    auto anchor = currentAnchor(*enumerator);
    ASSERT_TRUE(anchor);
    fill("f", 205);

    auto first = changes(*enumerator, *anchor);
    ASSERT_FALSE(first->error);
    EXPECT_TRUE(first->moreComing);
    EXPECT_EQ(first->updated.size(), 200u);
    EXPECT_EQ(FSChangeToken::decode(*first->anchor)->offset, 200u);
    EXPECT_TRUE(detachesAll(*enumerator)) << "detached also when more is coming";

    // The rest comes in later batches, none of them repeating the first.
    Names rest;
    HostPorterSyncAnchor next = *first->anchor;
    for (int batch = 0; batch < 10; ++batch) {
        auto more = changes(*enumerator, next);
        ASSERT_FALSE(more->error);
        EXPECT_TRUE(detachesAll(*enumerator));
        rest.insert(rest.end(), more->updated.begin(), more->updated.end());
        next = *more->anchor;
        if (!more->moreComing)
            break;
    }
    EXPECT_EQ(FSChangeToken::decode(next)->offset, 0u) << "caught up";
    for (const char* name : {"n0000", "n0204"}) {
        bool inFirst = std::count(first->updated.begin(), first->updated.end(), name) > 0;
        bool inRest = std::count(rest.begin(), rest.end(), name) > 0;
        EXPECT_TRUE(inFirst || inRest) << name << " is never lost";
    }
}

// Counts the look-ups made in the document-ID index, answering through the real service.
class CountingStrata : public StrataService {
public:
    explicit CountingStrata(std::shared_ptr<StrataService> inner) : inner_(std::move(inner)) {}
    uint32_t getOrAllocateDocumentId(int fd) override {
        return inner_->getOrAllocateDocumentId(fd);
    }
    uint32_t documentIdForInode(uint32_t device, uint64_t inode) override {
        ++lookups;
        return inner_->documentIdForInode(device, inode);
    }
    uint64_t resolveDocumentId(uint32_t device, uint32_t documentId) override {
        return inner_->resolveDocumentId(device, documentId);
    }
    bool pathForFileId(uint32_t device, uint64_t fileId, std::string& path) override {
        return inner_->pathForFileId(device, fileId, path);
    }
    std::atomic<int> lookups{0};

private:
    std::shared_ptr<StrataService> inner_;
};

TEST_F(LocalFileEnumeratorTest, ObserverContextLooksUpUpdatedItemsOnlyWhenAsked) {
    auto a = LocalItem::make(Url::fileURLWithPath(dir.writeFile("s/a.txt")));
    auto b = LocalItem::make(Url::fileURLWithPath(dir.writeFile("s/b.txt")));
    ASSERT_TRUE(a && b);
    auto strata = std::make_shared<CountingStrata>(StrataService::current());
    auto previous = StrataService::setCurrent(strata);
    auto enumerator = folderEnumerator(storage);
    EXPECT_TRUE(enumerator->shouldUpdateFileIDInStrata());

    for (bool update : {true, false}) {
        strata->lookups = 0;
        auto host = std::make_shared<testing::WaitingChangeObserver>();
        LocalChangesObserverContext context(host, enumerator, update);
        context.didUpdateItems({});
        context.didUpdateItems({a, b});
        context.didDeleteItemsWithIdentifiers({"fid=7"});
        EXPECT_EQ(strata->lookups, update ? 2 : 0);
        EXPECT_EQ(host->updateCalls, (std::vector<size_t>{0, 2}));
        EXPECT_EQ(host->updated, (Names{"a.txt", "b.txt"}));
        EXPECT_EQ(host->deleted, (Names{"fid=7"}));
        context.finishEnumeratingWithError(Error::syncAnchorExpired());
        EXPECT_TRUE(isExpired(host->error));
    }
    StrataService::setCurrent(previous);
}

TEST_F(LocalFileEnumeratorTest, ObserverContextLooksUpARecordSentAgainOnlyOnce) {
    std::string path = dir.writeFile("s/a.txt");
    auto a = LocalItem::make(Url::fileURLWithPath(path));
    auto b = LocalItem::make(Url::fileURLWithPath(dir.writeFile("s/b.txt")));
    ASSERT_TRUE(a && b);
    auto strata = std::make_shared<CountingStrata>(StrataService::current());
    auto previous = StrataService::setCurrent(strata);
    auto host = std::make_shared<testing::WaitingChangeObserver>();
    LocalChangesObserverContext context(host, folderEnumerator(storage), true);
    auto again = LocalItem::make(Url::fileURLWithPath(path));
    ASSERT_TRUE(again);
    strata->lookups = 0;
    // A batch of events names a file many times and sends the one record it read for it with
    // each: the answer about that record does not change.
    context.didUpdateItems({a});
    context.didUpdateItems({a});
    context.didUpdateItems({a});
    EXPECT_EQ(strata->lookups, 1);
    // Another record, even of the same file, is read anew: the file may have changed.
    context.didUpdateItems({b});
    context.didUpdateItems({again});
    context.didUpdateItems({a});
    EXPECT_EQ(strata->lookups, 4);
    // The host hears of every one of them.
    EXPECT_EQ(host->updated, (Names{"a.txt", "a.txt", "a.txt", "b.txt", "a.txt", "a.txt"}));
    StrataService::setCurrent(previous);
}

}  // namespace
}  // namespace tamber
