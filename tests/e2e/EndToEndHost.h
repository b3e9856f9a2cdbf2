#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>

#include "host/HostPorterEnumerator.h"
#include "items/LocalItem.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorter.h"
#include "support/DispatchSemaphore.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/HostRecorders.h"

namespace tamber::testing {

namespace fs = std::filesystem;

// What a browser keeps of a container: each item's name and parent, by identifier.
struct Entry {
    std::string filename;
    HostPorterItemIdentifier parent;
    friend bool operator==(const Entry&, const Entry&) = default;
};
using Replica = std::map<HostPorterItemIdentifier, Entry>;

inline std::string describe(const Replica& replica) {
    std::string out;
    for (const auto& [id, entry] : replica)
        out += "\n  " + id + " " + entry.filename + " in " + entry.parent;
    return out;
}

// The two views, side by side, when they differ.
inline void expectSameView(const Replica& host, const Replica& disk, const char* when) {
    EXPECT_TRUE(host == disk) << when << "\nhost:" << describe(host) << "\ndisk:" << describe(disk);
}

// A recording host over a real document storage, one app library and the real event journal:
// it lists the working set, things change, it asks for changes until caught up, and its view
// must then be what is on disk.
class EndToEndHost : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        TremorService::configure(state.path(), inotify);
        storage = host->documentStorageURL().path();
        install({"com.example.notes"});
        library = documents("com.example.notes").path();
        porter = LocalPorter::create();
        porter->refreshAppLibraries();
        // The host registers the trees it publishes with the journal before it browses them.
        auto service = TremorService::shared();
        ASSERT_TRUE(service.ok());
        ASSERT_TRUE(service.value()->watchTree(storage).ok());
        ASSERT_TRUE(service.value()->watchTree(library).ok());
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
            // The working set also holds the top level of each root's trash.
            std::error_code none;
            for (auto it = fs::directory_iterator(root + "/.Trash", none); it != fs::end(it);
                 ++it) {
                if (it->path().filename().string()[0] == '.')
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
    // The journal's inotify calls; a test may put a faulty one here before SetUp.
    std::shared_ptr<InotifyApi> inotify = InotifyApi::system();
};

}  // namespace tamber::testing
