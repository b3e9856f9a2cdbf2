#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "enumeration/DirectoryListingCache.h"
#include "enumeration/LocalFileEnumerator.h"
#include "fs/FSChangeToken.h"
#include "fs/TremorReader.h"
#include "host/HostPorterEnumerator.h"
#include "items/LocalItem.h"
#include "platform/tremors/TremorService.h"
#include "tests/common/AppLibraryTest.h"

namespace tamber::testing {

// One page as the host saw it.
struct ListedPage {
    std::vector<std::string> names;      // file names, in delivery order, over all calls
    std::vector<size_t> callSizes;       // items per didEnumerateItems call
    std::optional<HostPorterPage> next;  // set when finished up to a page
    bool finished = false;               // finished up to a page (or to none)
    std::optional<Error> error;
};

class RecordingEnumerationObserver : public HostPorterEnumerationObserver {
public:
    void didEnumerateItems(const std::vector<HostPorterItemRef>& items) override {
        page.callSizes.push_back(items.size());
        for (const auto& item : items) page.names.push_back(item->filename());
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& nextPage) override {
        EXPECT_FALSE(page.finished || page.error) << "a page ends once";
        page.finished = true;
        page.next = nextPage;
    }
    void finishEnumeratingWithError(const Error& error) override {
        EXPECT_FALSE(page.finished || page.error) << "a page ends once";
        page.error = error;
    }
    ListedPage page;
};

// Changes as the host saw them; the finish may come on any thread.
class WaitingChangeObserver : public HostPorterChangeObserver {
public:
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        std::lock_guard lock(mutex_);
        for (const auto& item : items) updated.push_back(item->filename());
        updateCalls.push_back(items.size());
    }
    void didDeleteItemsWithIdentifiers(const std::vector<HostPorterItemIdentifier>& ids) override {
        std::lock_guard lock(mutex_);
        deleted.insert(deleted.end(), ids.begin(), ids.end());
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        finish([&] {
            anchor = a;
            moreComing = more;
        });
    }
    void finishEnumeratingWithError(const Error& e) override {
        finish([&] { error = e; });
    }
    // Whether a finish came within ten seconds.
    bool waitForFinish() {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(10), [&] { return finishes > 0; });
    }

    std::mutex mutex_;
    std::vector<std::string> updated;
    std::vector<size_t> updateCalls;
    std::vector<HostPorterItemIdentifier> deleted;
    std::optional<HostPorterSyncAnchor> anchor;
    bool moreComing = false;
    std::optional<Error> error;
    int finishes = 0;

private:
    template <class F>
    void finish(F&& set) {
        {
            std::lock_guard lock(mutex_);
            EXPECT_EQ(finishes, 0) << "a change enumeration ends once";
            ++finishes;
            set();
        }
        changed_.notify_all();
    }
    std::condition_variable changed_;
};

// The app-library set-up of AppLibraryTest plus an event journal on a temporary state folder
// that watches the document storage, so that device UUIDs, event IDs and document IDs are real.
class EnumerationTest : public AppLibraryTest {
protected:
    // The context detaches a finished change enumeration right after the host heard of it.
    static bool detachesAll(const LocalFileEnumerator& enumerator) {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
        while (enumerator.runningEnumeratorCount() != 0) {
            if (std::chrono::steady_clock::now() > deadline)
                return false;
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
        }
        return true;
    }
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        TremorService::configure(state.path());
        storage = host->documentStorageURL().path();
        auto service = TremorService::shared();
        ASSERT_TRUE(service.ok()) << service.error().description();
        ASSERT_TRUE(service.value()->watchTree(storage).ok());
        DirectoryListingCache::shared().clear();
    }
    void TearDown() override {
        for (auto& enumerator : enumerators) enumerator->invalidate();
        enumerators.clear();
        TremorService::resetForTesting();
        TremorService::configure("");
        AppLibraryTest::TearDown();
    }

    ListedPage list(HostPorterEnumerator& enumerator, const HostPorterPage& page) {
        auto observer = std::make_shared<RecordingEnumerationObserver>();
        enumerator.enumerateItemsForObserver(observer, page);
        EXPECT_TRUE(observer->page.finished || observer->page.error);
        return observer->page;
    }
    std::shared_ptr<WaitingChangeObserver> changes(HostPorterEnumerator& enumerator,
                                                   const HostPorterSyncAnchor& anchor) {
        auto observer = std::make_shared<WaitingChangeObserver>();
        enumerator.enumerateChangesForObserver(observer, anchor);
        EXPECT_TRUE(observer->waitForFinish());
        return observer;
    }
    std::optional<HostPorterSyncAnchor> currentAnchor(HostPorterEnumerator& enumerator) {
        std::optional<HostPorterSyncAnchor> anchor;
        bool called = false;
        enumerator.currentSyncAnchorWithCompletionHandler(
            [&](std::optional<HostPorterSyncAnchor> a) {
                anchor = std::move(a);
                called = true;
            });
        EXPECT_TRUE(called);
        return anchor;
    }
    std::string deviceUUID() {
        return TremorReader::deviceUUID(Url::fileURLWithPath(storage)).value_or("");
    }
    // A token as the gather phase writes it, resuming at `offset` from now.
    HostPorterPage pageToken(uint64_t offset, std::string uuid = {}) {
        return FSChangeToken{0, uuid.empty() ? deviceUUID() : uuid, TremorReader::currentEventID(),
                             offset, 0}
            .encode();
    }
    static bool isExpired(const std::optional<Error>& error) {
        return error && error->is(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired);
    }

    TempDir state;
    std::string storage;
    std::vector<std::shared_ptr<HostPorterEnumerator>> enumerators;  // invalidated at the end
};

}  // namespace tamber::testing
