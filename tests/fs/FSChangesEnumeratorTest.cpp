#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <thread>
#include <utility>

#include "fs/FSChangesEnumerator.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/apps/AppRecord.h"
#include "platform/tremors/TremorFlags.h"
#include "tests/fs/FsTest.h"

namespace tamber {
namespace {

using Identifiers = std::vector<HostPorterItemIdentifier>;

// What one change request told the host, and whether anything came after its end.
class RecordingObserver : public HostPorterChangeObserver {
public:
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        waiter_.update([&] {
            afterFinish += finished_;
            batches.push_back(items.size());
            for (const auto& item : items) updates.push_back(item->itemIdentifier());
        });
    }
    void didDeleteItemsWithIdentifiers(const Identifiers& identifiers) override {
        waiter_.update([&] {
            afterFinish += finished_;
            batches.push_back(identifiers.size());
            deletions.insert(deletions.end(), identifiers.begin(), identifiers.end());
        });
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        waiter_.update([&] {
            afterFinish += finished_;
            finished_ = true;
            anchor = FSChangeToken::decode(a);
            moreComing = more;
        });
    }
    void finishEnumeratingWithError(const Error& e) override {
        waiter_.update([&] {
            afterFinish += finished_;
            finished_ = true;
            error = e;
        });
    }
    bool waitForFinish() {
        return waiter_.waitFor([&] { return finished_; });
    }

    Identifiers updates, deletions;
    std::vector<size_t> batches;
    std::optional<FSChangeToken> anchor;
    bool moreComing = false;
    std::optional<Error> error;
    int afterFinish = 0;

private:
    testing::Waiter waiter_;
    bool finished_ = false;
};

class FSChangesEnumeratorTest : public testing::TremorTest {
protected:
    FSChangeToken tokenSince(uint64_t eventID, uint64_t offset = 0) {
        return {0, TremorReader::deviceUUID(storageURL()).value_or("?"), eventID, offset, 7};
    }
    // One request of the host, run to its end.
    std::shared_ptr<RecordingObserver> request(
        const FSChangeToken& token,
        const HostPorterItemIdentifier& container = HostPorterRootContainerItemIdentifier) {
        auto observer = std::make_shared<RecordingObserver>();
        auto enumerator = FSChangesEnumerator::make(token, container, {storageURL()}, observer);
        enumerator->start();
        EXPECT_TRUE(observer->waitForFinish());
        // Late calls, if any, come from the rest of the batch that finished the request.
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        enumerator->stop();
        return observer;
    }
    // `count` path events that all name the same existing file.
    uint64_t journalChanges(const std::string& path, size_t count) {
        return journal(std::vector<JournalEvent>(count, JournalEvent{0, path, 0, 0}));
    }
};

TEST_F(FSChangesEnumeratorTest, ALongHistoryIsSentInPagesOf200ByChangeCount) {
    std::string a = write("a.txt");
    uint64_t since = currentID();
    uint64_t last = journalChanges(a, 450);

    auto first = request(tokenSince(since));
    EXPECT_EQ(first->updates.size(), 200u);
    EXPECT_EQ(first->batches, std::vector<size_t>(200, 1));  // each change alone, at once
    ASSERT_TRUE(first->anchor);
    EXPECT_TRUE(first->moreComing);
    EXPECT_EQ(*first->anchor, tokenSince(since, 200));  // same event ID: same history again
    EXPECT_EQ(first->afterFinish, 0);

    auto second = request(*first->anchor);
    EXPECT_EQ(second->updates.size(), 200u);
    ASSERT_TRUE(second->anchor);
    EXPECT_TRUE(second->moreComing);
    EXPECT_EQ(*second->anchor, tokenSince(since, 400));
    EXPECT_EQ(second->afterFinish, 0);

    auto third = request(*second->anchor);
    EXPECT_EQ(third->updates.size(), 50u);
    ASSERT_TRUE(third->anchor);
    EXPECT_FALSE(third->moreComing);
    EXPECT_EQ(*third->anchor, tokenSince(last, 0));
    EXPECT_EQ(third->afterFinish, 0);
    EXPECT_EQ(log->count("[DEBUG] fetching changes did catch up", LogLevel::Debug), 1u);
    // The full pages ended inside the path-based pass; only the last request went on.
    EXPECT_EQ(log->count("[DEBUG] processed all Tremors path based, carry on with the docID based",
                         LogLevel::Debug),
              1u);
    // Each later page went on from the event that filled the one before, not from the anchor.
    auto startedSince = [&](uint64_t eventID) {
        size_t n = 0;
        for (const auto& line : log->texts()) {
            n += line.starts_with("[DEBUG] starting <TremorReader:") &&
                 line.find(" since:" + std::to_string(eventID) + " ") != std::string::npos;
        }
        return n;
    };
    EXPECT_EQ(startedSince(since + 200), 1u);
    EXPECT_EQ(startedSince(since + 400), 1u);

    // A page asked for again (its answer lost, or by another process) replays the history
    // from the anchor and skips what went before: the same changes, the same anchor.
    auto again = request(*first->anchor);
    EXPECT_EQ(again->updates, second->updates);
    ASSERT_TRUE(again->anchor);
    EXPECT_EQ(*again->anchor, *second->anchor);
    // From the anchor: the first request, the last one's document-ID pass, and this one.
    EXPECT_EQ(startedSince(since), 3u);
}

TEST_F(FSChangesEnumeratorTest, ExactlyAFullPageEndsWithAnEmptyCatchUp) {
    std::string a = write("a.txt");
    uint64_t since = currentID();
    uint64_t last = journalChanges(a, 200);
    auto first = request(tokenSince(since));
    EXPECT_EQ(first->updates.size(), 200u);
    EXPECT_TRUE(first->moreComing);
    EXPECT_EQ(first->anchor, tokenSince(since, 200));
    auto second = request(*first->anchor);
    EXPECT_TRUE(second->updates.empty());
    EXPECT_FALSE(second->moreComing);
    EXPECT_EQ(second->anchor, tokenSince(last, 0));
}

TEST_F(FSChangesEnumeratorTest, BothPassesCountTogetherAndTheAnchorMovesToTheLastEvent) {
    std::string a = write("a.txt");
    auto id = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(a));
    ASSERT_TRUE(id);
    std::string doc = id->substr(4);
    uint64_t since = currentID();
    journal({{0, a, 0, 0}});
    uint64_t last = journal({{0,
                              "/.docid/" + std::to_string(device()) + "/changed/" + doc +
                                  "/src=1,dst=" + std::to_string(inodeOf(a)),
                              0, 0}});
    // The host already has the first change of this history.
    auto observer = request(tokenSince(since, 1));
    EXPECT_EQ(observer->updates, Identifiers{*id});
    EXPECT_FALSE(observer->moreComing);
    EXPECT_EQ(observer->anchor, tokenSince(last, 0));
    EXPECT_EQ(log->count("[DEBUG] forward update of ", LogLevel::Debug), 0u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] forward update of <LocalItem:"), 1u);
}

// Events journaled while the path-based pass runs lie past its end; the document-ID pass that
// follows reads further. The anchor must not move past path events no pass reported, or the
// next request never sends them.
TEST_F(FSChangesEnumeratorTest, APathEventJournaledDuringThePathPassIsNotSkipped) {
    std::string a = write("a.txt");
    std::string b = write("b.txt");
    auto idB = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(b));
    ASSERT_TRUE(idB);
    uint64_t since = currentID();
    journal({{0, a, 0, 0}});
    class JournalingObserver : public RecordingObserver {
    public:
        std::function<void()> onFirstUpdate;
        void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
            if (auto hook = std::exchange(onFirstUpdate, nullptr))
                hook();
            RecordingObserver::didUpdateItems(items);
        }
    };
    auto observer = std::make_shared<JournalingObserver>();
    const std::string deletedDocument =
        "/.docid/" + std::to_string(device()) + "/changed/9/src=1,dst=0";
    observer->onFirstUpdate = [&] {
        std::vector<JournalEvent> events{{0, b, 0, 0}, {0, deletedDocument, 0, 0}};
        EXPECT_TRUE(store().append(events).ok());
    };
    auto enumerator = FSChangesEnumerator::make(
        tokenSince(since), HostPorterRootContainerItemIdentifier, {storageURL()}, observer);
    enumerator->start();
    ASSERT_TRUE(observer->waitForFinish());
    enumerator->stop();
    ASSERT_TRUE(observer->anchor) << (observer->error ? observer->error->description() : "");

    auto next = request(*observer->anchor);
    auto all = observer->updates;
    all.insert(all.end(), next->updates.begin(), next->updates.end());
    EXPECT_NE(std::find(all.begin(), all.end(), *idB), all.end())
        << "the change to b.txt was never sent";
}

TEST_F(FSChangesEnumeratorTest, LostHistoryInEitherPassExpiresTheAnchor) {
    std::string a = write("a.txt");
    uint64_t since = currentID();
    journal({{0, a, 0, 0},
             {0, "/.docid/" + std::to_string(device()) + "/changed/9/src=1,dst=0", 0,
              kTremorUserDropped}});
    auto inDocIDPass = request(tokenSince(since));
    EXPECT_EQ(inDocIDPass->updates.size(), 1u);
    ASSERT_TRUE(inDocIDPass->error);
    EXPECT_TRUE(inDocIDPass->error->is(kHostPorterErrorDomain, -1002));
    EXPECT_FALSE(inDocIDPass->anchor);
    EXPECT_EQ(inDocIDPass->afterFinish, 0);

    uint64_t later = currentID();
    journal({{0, a, 0, kTremorKernelDropped}, {0, a, 0, 0}});
    auto inPathPass = request(tokenSince(later));
    ASSERT_TRUE(inPathPass->error);
    EXPECT_TRUE(inPathPass->error->is(kHostPorterErrorDomain, -1002));
    EXPECT_TRUE(inPathPass->updates.empty());
    EXPECT_EQ(inPathPass->afterFinish, 0);
    EXPECT_EQ(log->count("[DEBUG] fetching changes did finish after reset", LogLevel::Debug), 2u);
}

TEST_F(FSChangesEnumeratorTest, TheAllDirectoriesContainerOnlyHearsOfFolders) {
    std::string a = write("a.txt");
    std::string folder = storagePath() + "/folder";
    std::filesystem::create_directory(folder);
    auto folderID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(folder));
    uint64_t since = currentID();
    journal({{0, a, 0, 0},
             {0, folder, 0, 0},
             {0, storagePath() + "/gone", 4242424242, 0},
             {0, "/.docid/" + std::to_string(device()) + "/changed/9/src=1,dst=0", 0, 0}});
    auto all = request(tokenSince(since), HostPorterAllDirectoriesContainerItemIdentifier);
    EXPECT_EQ(all->updates, Identifiers{folderID.value_or("?")});
    EXPECT_EQ(all->deletions, Identifiers{"fid=4242424242"});
    EXPECT_EQ(
        log->count("[DEBUG] ignore update of did=9; item is not a directory", LogLevel::Debug), 1u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] ignore update of <LocalItem:"), 1u);

    // The working set hears of everything published.
    auto workingSet = request(tokenSince(since), HostPorterWorkingSetContainerItemIdentifier);
    EXPECT_EQ(workingSet->updates.size(), 2u);
    EXPECT_EQ(workingSet->deletions, (Identifiers{"fid=4242424242", "did=9"}));
}

TEST_F(FSChangesEnumeratorTest, TheRootSeesALibraryRootVanishAsTheLibrary) {
    // An application whose library lives inside the watched storage.
    std::string container = storagePath() + "/apps/notes";
    std::filesystem::create_directories(container + "/Documents");
    BundleRecord::Fields fields{"com.example.notes", "Notes", Url::fileURLWithPath(container),
                                std::nullopt};
    auto info = Dictionary::make({{"HostSupportsDocumentBrowser", Number::fromBool(true)}});
    registry->replace(AppRegistry::kUserApplications,
                      {AppRecord::make(fields, {false, false, info})});
    auto manager = LocalAppLibraryManager::shared();
    manager->refresh();
    manager->upgradeFromMainCache(nullptr, false);
    ASSERT_EQ(manager->rootURLs().size(), 1u);

    std::string root = container + "/Documents";
    uint64_t inode = inodeOf(root);
    std::filesystem::remove(root);
    uint64_t since = currentID();
    journal({{0, root, inode, kTremorItemRemoved}});
    auto observer = request(tokenSince(since));
    EXPECT_EQ(observer->deletions,
              (Identifiers{"fid=" + std::to_string(inode), "#com.example.notes"}));
    auto workingSet = request(tokenSince(since), HostPorterWorkingSetContainerItemIdentifier);
    EXPECT_EQ(workingSet->deletions, Identifiers{"fid=" + std::to_string(inode)});
}

}  // namespace
}  // namespace tamber
