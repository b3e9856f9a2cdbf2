#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>

#include "host/HostPorterEnumerator.h"
#include "items/LocalItem.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorter.h"
#include "support/DispatchSemaphore.h"
#include "tests/common/AppLibraryTest.h"

namespace tamber {
namespace {

using namespace testing;
namespace fs = std::filesystem;

// What a browser keeps of a container: each item's name and parent, by identifier.
struct Entry {
    std::string filename;
    HostPorterItemIdentifier parent;
    friend bool operator==(const Entry&, const Entry&) = default;
};
using Replica = std::map<HostPorterItemIdentifier, Entry>;

std::string describe(const Replica& replica) {
    std::string out;
    for (const auto& [id, entry] : replica)
        out += "\n  " + id + " " + entry.filename + " in " + entry.parent;
    return out;
}

// The two views, side by side, when they differ.
void expectSameView(const Replica& host, const Replica& disk, const char* when) {
    EXPECT_TRUE(host == disk) << when << "\nhost:" << describe(host) << "\ndisk:" << describe(disk);
}

struct PageRecorder : HostPorterEnumerationObserver {
    void didEnumerateItems(const std::vector<HostPorterItemRef>& page) override {
        items.insert(items.end(), page.begin(), page.end());
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& page) override {
        next = page;
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        error = e;
        done.signal();
    }
    std::vector<HostPorterItemRef> items;
    std::optional<HostPorterPage> next;
    std::optional<Error> error;
    DispatchSemaphore done;
};

struct BatchRecorder : HostPorterChangeObserver {
    // Changes in the order they came: a deletion and a later update of the same identifier (a
    // folder's number reused) must be applied in that order.
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        std::lock_guard lock(mutex);
        for (const auto& item : items) changes.push_back({item, {}});
    }
    void didDeleteItemsWithIdentifiers(const std::vector<HostPorterItemIdentifier>& ids) override {
        std::lock_guard lock(mutex);
        for (const auto& id : ids) changes.push_back({nullptr, id});
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        {
            std::lock_guard lock(mutex);
            anchor = a;
            moreComing = more;
        }
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        {
            std::lock_guard lock(mutex);
            error = e;
        }
        done.signal();
    }
    std::mutex mutex;
    std::vector<std::pair<HostPorterItemRef, HostPorterItemIdentifier>> changes;
    HostPorterSyncAnchor anchor;
    bool moreComing = false;
    std::optional<Error> error;
    DispatchSemaphore done;
};

// A recording host over a real document storage, one app library and the real event journal:
// it lists the working set, files change on disk, it asks for changes until caught up, and its
// view must then be what is on disk.
class BrowsingEndToEndTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        TremorService::configure(state.path());
        storage = host->documentStorageURL().path();
        install({"com.example.notes"});
        library = documents("com.example.notes").path();
        porter = LocalPorter::create();
        porter->refreshAppLibraries();
        // The host registers the trees it publishes with the journal before it browses them.
        auto service = TremorService::shared();
        ASSERT_TRUE(service.ok());
        ASSERT_FALSE(service.value()->watchTree(storage));
        ASSERT_FALSE(service.value()->watchTree(library));
    }
    void TearDown() override {
        if (enumerator)
            enumerator->invalidate();
        enumerator.reset();
        porter.reset();
        TremorService::resetForTesting();
        AppLibraryTest::TearDown();
    }

    void apply(const HostPorterItemRef& item) {
        replica[item->itemIdentifier()] = {item->filename(), item->parentItemIdentifier()};
    }

    HostPorterSyncAnchor currentAnchor() {
        std::optional<HostPorterSyncAnchor> anchor;
        DispatchSemaphore done;
        enumerator->currentSyncAnchorWithCompletionHandler([&](auto value) {
            anchor = value;
            done.signal();
        });
        EXPECT_TRUE(done.wait(10));
        EXPECT_TRUE(anchor);
        return anchor.value_or(HostPorterSyncAnchor{});
    }

    void listEverything() {
        HostPorterPage page = HostPorterInitialPageSortedByName();
        for (int pages = 0; pages < 100; ++pages) {
            auto recorder = std::make_shared<PageRecorder>();
            enumerator->enumerateItemsForObserver(recorder, page);
            ASSERT_TRUE(recorder->done.wait(30));
            ASSERT_FALSE(recorder->error) << recorder->error->description();
            for (const auto& item : recorder->items) apply(item);
            if (!recorder->next)
                return;
            page = *recorder->next;
        }
        FAIL() << "the listing never ended";
    }

    // Asks for changes until caught up; returns how many requests it took.
    int catchUp(HostPorterSyncAnchor& anchor) {
        for (int requests = 1; requests <= 50; ++requests) {
            auto recorder = std::make_shared<BatchRecorder>();
            enumerator->enumerateChangesForObserver(recorder, anchor);
            EXPECT_TRUE(recorder->done.wait(30));
            std::lock_guard lock(recorder->mutex);
            EXPECT_FALSE(recorder->error) << recorder->error->description();
            if (recorder->error)
                return requests;
            for (const auto& [item, deleted] : recorder->changes) {
                if (item)
                    apply(item);
                else
                    replica.erase(deleted);
            }
            anchor = recorder->anchor;
            if (!recorder->moreComing)
                return requests;
        }
        ADD_FAILURE() << "changes never caught up";
        return 0;
    }

    // The files as the provider names them now: every visible item of the storage and of the
    // library, and the library itself.
    Replica disk() {
        Replica view;
        view["#com.example.notes"] = {"com.example.notes app",
                                      HostPorterRootContainerItemIdentifier};
        for (const auto& root : {storage, library}) {
            for (auto it = fs::recursive_directory_iterator(root); it != fs::end(it); ++it) {
                std::string name = it->path().filename();
                bool package = it->path().extension() == ".lumen";
                if (name[0] == '.' || package)
                    it.disable_recursion_pending();
                if (name[0] == '.')
                    continue;
                auto item = LocalItem::make(Url::fileURLWithPath(it->path().string()));
                if (item)
                    view[item->itemIdentifier()] = {item->filename(), item->parentItemIdentifier()};
            }
        }
        return view;
    }

    void write(const std::string& path, const std::string& contents) {
        std::ofstream(path) << contents;
    }

    TempDir state;
    std::string storage, library;
    std::shared_ptr<LocalPorter> porter;
    HostPorterEnumeratorRef enumerator;
    Replica replica;
};

TEST_F(BrowsingEndToEndTest, TheHostsViewMatchesTheDiskAfterCatchingUp) {
    write(storage + "/keep.txt", "keep");
    write(storage + "/report.txt", "v1");
    write(storage + "/old-name.txt", "rename me");
    write(storage + "/moving.txt", "move me");
    write(storage + "/doomed.txt", "delete me");
    fs::create_directories(storage + "/Projects/Old");
    write(storage + "/Projects/Old/inside.txt", "goes with its folder");
    write(library + "/note.txt", "a note");

    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok()) << made.error().description();
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    // The first changes bring the working set's app libraries up to date (its own list starts
    // empty), so that the listing covers the libraries' files too.
    catchUp(anchor);
    ASSERT_TRUE(replica.contains("#com.example.notes")) << describe(replica);
    listEverything();
    expectSameView(replica, disk(), "after listing");
    if (HasFailure())
        return;
    auto reportID =
        LocalItem::make(Url::fileURLWithPath(storage + "/report.txt"))->itemIdentifier();

    write(storage + "/created.txt", "new");
    write(storage + "/keep.txt", "modified");
    // A safe save: a new file renamed over the old one keeps the document's identifier.
    write(storage + "/report.txt.sb-tmp", "v2");
    fs::rename(storage + "/report.txt.sb-tmp", storage + "/report.txt");
    fs::rename(storage + "/old-name.txt", storage + "/new-name.txt");
    fs::rename(storage + "/moving.txt", library + "/moving.txt");
    fs::remove(storage + "/doomed.txt");
    fs::remove_all(storage + "/Projects/Old");
    fs::create_directories(storage + "/Projects/New");
    write(storage + "/Projects/New/a.txt", "a");
    write(storage + "/Projects/New/b.txt", "b");
    write(library + "/note.txt", "edited");

    catchUp(anchor);
    expectSameView(replica, disk(), "after catching up");
    EXPECT_EQ(LocalItem::make(Url::fileURLWithPath(storage + "/report.txt"))->itemIdentifier(),
              reportID);

    // Caught up: a further request reports nothing new and keeps the view.
    Replica before = replica;
    catchUp(anchor);
    expectSameView(replica, before, "after a request with nothing new");
}

}  // namespace
}  // namespace tamber
