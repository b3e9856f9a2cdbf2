#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <thread>

#include "fs/FSChangesEnumerator.h"
#include "items/TBFileObjectIdentifier.h"
#include "tests/fs/FsTest.h"

namespace tamber {
namespace {

namespace fsys = std::filesystem;
using Identifiers = std::vector<HostPorterItemIdentifier>;

// One change request as the host saw it: every change in order, then its end.
class PageObserver : public HostPorterChangeObserver {
public:
    struct Change {
        bool deleted;
        HostPorterItemIdentifier identifier;
    };
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        waiter_.update([&] {
            for (const auto& item : items) changes.push_back({false, item->itemIdentifier()});
        });
    }
    void didDeleteItemsWithIdentifiers(const Identifiers& identifiers) override {
        waiter_.update([&] {
            for (const auto& identifier : identifiers) changes.push_back({true, identifier});
        });
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        waiter_.update([&] {
            finished_ = true;
            anchor = FSChangeToken::decode(a);
            moreComing = more;
        });
    }
    void finishEnumeratingWithError(const Error& e) override {
        waiter_.update([&] {
            finished_ = true;
            error = e;
        });
    }
    bool waitForFinish() {
        return waiter_.waitFor([&] { return finished_; });
    }

    std::vector<Change> changes;
    std::optional<FSChangeToken> anchor;
    bool moreComing = false;
    std::optional<Error> error;

private:
    testing::Waiter waiter_;
    bool finished_ = false;
};

// The host's copy of the published items: identifiers it was told about and not told gone.
using HostState = std::set<HostPorterItemIdentifier>;

class ChangePagingTest : public testing::TremorTest {
protected:
    FSChangeToken tokenSince(uint64_t eventID, uint64_t offset = 0) {
        return {0, TremorReader::deviceUUID(storageURL()).value_or("?"), eventID, offset, 7};
    }
    std::shared_ptr<PageObserver> request(const FSChangeToken& token) {
        auto observer = std::make_shared<PageObserver>();
        auto enumerator = FSChangesEnumerator::make(token, HostPorterRootContainerItemIdentifier,
                                                    {storageURL()}, observer);
        enumerator->start();
        EXPECT_TRUE(observer->waitForFinish());
        enumerator->stop();
        return observer;
    }
    static void apply(HostState& state, const PageObserver& page) {
        for (const auto& change : page.changes) {
            if (change.deleted)
                state.erase(change.identifier);
            else
                state.insert(change.identifier);
        }
    }
    // Everything published under the storage folder, by identifier.
    HostState disk() {
        currentID();  // identifiers of moved files come from the journaled moves
        HostState state;
        for (const auto& entry : fsys::recursive_directory_iterator(storagePath())) {
            if (entry.path().filename().string().starts_with("."))
                continue;
            auto id =
                TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(entry.path().string()));
            EXPECT_TRUE(id) << entry.path();
            if (id)
                state.insert(*id);
        }
        return state;
    }
    // The host's state without the storage folder itself, which changes with every entry.
    HostState published(HostState state) {
        if (auto root = TBFileObjectIdentifier::itemIdentifier(storageURL()))
            state.erase(*root);
        return state;
    }
    // Every kind of history the paging has to keep whole: long runs of one file across page
    // boundaries, a file that lives and dies inside the history, a rename chain, a deletion
    // followed by a re-creation under the same name, and a moved folder with its contents.
    // A folder with a file in it, known before the history starts.
    void prepare() {
        fsys::create_directories(storagePath() + "/work/folder");
        write("work/folder/inner");
    }
    void makeHistory() {
        std::string work = storagePath() + "/work";
        for (int i = 0; i < 30; ++i) write("work/plain-" + std::to_string(i));
        // The journal folds quick writes together: runs of events for one file are written
        // into it, as a slower writer would make them.
        std::string hot = write("work/hot");
        modify(hot, 450);
        std::string temp = write("work/temp");
        modify(temp, 300);
        fsys::remove(temp);
        write("work/a");
        fsys::rename(work + "/a", work + "/b");
        fsys::rename(work + "/b", work + "/c");
        fsys::rename(work + "/c", work + "/d");
        write("work/again", "first");
        fsys::remove(work + "/again");
        write("work/again", "second");
        fsys::rename(work + "/folder", work + "/moved");
        modify(work + "/plain-0", 230);
        fsys::remove(work + "/plain-1");
        currentID();  // journaled before any request
    }
    // `count` modifications of the file at `path`, journaled after everything before them.
    void modify(const std::string& path, size_t count) {
        journal(std::vector<JournalEvent>(count, JournalEvent{0, path, inodeOf(path), 0}));
    }
};

TEST_F(ChangePagingTest, PagingThroughTheHistoryEndsWithTheDisksState) {
    prepare();
    HostState state = disk();
    uint64_t since = currentID();
    makeHistory();

    std::vector<FSChangeToken> anchors{tokenSince(since)};
    std::vector<HostState> states{state};
    for (int page = 0;; ++page) {
        ASSERT_LT(page, 100) << "the pages never catch up";
        auto answer = request(anchors.back());
        ASSERT_FALSE(answer->error) << answer->error->description();
        ASSERT_TRUE(answer->anchor);
        EXPECT_LE(answer->changes.size(), FSChangesEnumerator::kPageSize);
        apply(state, *answer);
        anchors.push_back(*answer->anchor);
        states.push_back(state);
        if (!answer->moreComing)
            break;
    }
    ASSERT_GE(anchors.size(), 4u) << "the history should take several pages";
    EXPECT_EQ(published(state), published(disk()));

    // Each page asked for again (its answer lost) from the host's state at the time, then the
    // rest of the pages: the same end.
    for (size_t k = 0; k + 1 < anchors.size(); ++k) {
        HostState again = states[k];
        FSChangeToken token = anchors[k];
        for (int page = 0;; ++page) {
            ASSERT_LT(page, 100) << "the pages from anchor " << k << " never catch up";
            auto answer = request(token);
            ASSERT_FALSE(answer->error) << answer->error->description();
            ASSERT_TRUE(answer->anchor);
            apply(again, *answer);
            token = *answer->anchor;
            if (!answer->moreComing)
                break;
        }
        EXPECT_EQ(published(again), published(disk())) << "resumed from anchor " << k;
    }
}

TEST_F(ChangePagingTest, ADeletionAndARecreationUnderTheSameNameKeepTheirOrder) {
    std::string path = write("name", "old");
    auto before = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(path));
    ASSERT_TRUE(before);
    HostState state = disk();
    uint64_t since = currentID();
    fsys::remove(path);
    write("name", "new");
    currentID();
    auto answer = request(tokenSince(since));
    ASSERT_FALSE(answer->error);
    apply(state, *answer);
    auto after = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(path));
    ASSERT_TRUE(after);
    EXPECT_TRUE(state.contains(*after));
    EXPECT_EQ(published(state), published(disk()));
    // Whatever identifier the new file got, the last word about it is an update.
    auto last = std::find_if(answer->changes.rbegin(), answer->changes.rend(),
                             [&](const auto& change) { return change.identifier == *after; });
    ASSERT_NE(last, answer->changes.rend());
    EXPECT_FALSE(last->deleted);
}

TEST_F(ChangePagingTest, AFileBornAndGoneInsideTheHistoryEndsDeletedOrUnheardOf) {
    HostState state = disk();
    uint64_t since = currentID();
    std::string temp = write("temp");
    uint64_t inode = inodeOf(temp);
    journal(std::vector<JournalEvent>(50, JournalEvent{0, temp, inode, 0}));
    fsys::remove(temp);
    currentID();
    auto answer = request(tokenSince(since));
    ASSERT_FALSE(answer->error);
    apply(state, *answer);
    EXPECT_FALSE(state.contains("fid=" + std::to_string(inode)));
    EXPECT_EQ(published(state), published(disk()));
}

TEST_F(ChangePagingTest, AFullPageDoesNotReadTheRestOfTheJournal) {
    std::string a = write("a.txt");
    uint64_t since = currentID();
    journal(std::vector<JournalEvent>(5 * TremorStream::kReplayBatch, JournalEvent{0, a, 0, 0}));
    auto answer = request(tokenSince(since));
    ASSERT_TRUE(answer->moreComing);
    EXPECT_EQ(answer->changes.size(), FSChangesEnumerator::kPageSize);
    // The page filled in the first batch the journal handed out; reading (and decoding) the
    // thousands of events after it for nothing made every page cost the whole history.
    EXPECT_EQ(log->countStartingWith("[DEBUG] tremor: received "), 1u);
}

}  // namespace
}  // namespace tamber
