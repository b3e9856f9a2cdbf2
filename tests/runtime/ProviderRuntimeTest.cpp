#include <gtest/gtest.h>

#include <cerrno>
#include <fstream>
#include <set>

#include "host/HostPorterEnumerator.h"
#include "platform/strata/StrataService.h"
#include "platform/tremors/TremorService.h"
#include "runtime/ChangeCollector.h"
#include "runtime/ProviderRuntime.h"
#include "support/DispatchSemaphore.h"
#include "support/DispatchTimer.h"
#include "support/WorkerPool.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/TempStagingLedger.h"
#include "tests/common/ThreadCount.h"

namespace tamber {
namespace {

using namespace testing;

const auto* const ledger = ::testing::AddGlobalTestEnvironment(new TempStagingLedger);

constexpr double kPatience = 30;  // seconds: only a hang gets near it

struct PageRecorder : HostPorterEnumerationObserver {
    void didEnumerateItems(const std::vector<HostPorterItemRef>& page) override {
        for (const auto& item : page) names.insert(item->filename());
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>&) override { done.signal(); }
    void finishEnumeratingWithError(const Error& e) override {
        error = e;
        done.signal();
    }
    std::set<std::string> names;
    std::optional<Error> error;
    DispatchSemaphore done;
};

class ProviderRuntimeTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        storage = dir.makeDir("Documents");
        // Start from a process with no pool, timer or journal threads of earlier tests.
        DispatchTimer::shared().shutdown();
        WorkerPool::shared().shutdown();
    }
    void TearDown() override {
        TremorService::resetForTesting();
        AppLibraryTest::TearDown();
    }

    ProviderRuntimeOptions options() const {
        ProviderRuntimeOptions o;
        o.storagePath = storage;
        o.stateDir = state.path();
        return o;
    }

    // One run of a host: lists the storage folder (which must show what earlier runs wrote),
    // writes a file, and asks for the changes since the anchor taken before the write, which
    // must report it.
    void useOnce(ProviderRuntime& runtime, int run) {
        auto porter = runtime.provider();
        ASSERT_TRUE(porter.ok()) << porter.error().description();
        auto made = porter.value()->enumeratorForContainerItemIdentifier(
            HostPorterWorkingSetContainerItemIdentifier);
        ASSERT_TRUE(made.ok()) << made.error().description();
        HostPorterEnumeratorRef enumerator = made.value();
        struct Invalidate {
            HostPorterEnumeratorRef& e;
            ~Invalidate() { e->invalidate(); }
        } invalidate{enumerator};

        auto listed = std::make_shared<PageRecorder>();
        auto folder = porter.value()->enumeratorForContainerItemIdentifier(
            HostPorterRootContainerItemIdentifier);
        ASSERT_TRUE(folder.ok()) << folder.error().description();
        folder.value()->enumerateItemsForObserver(listed, HostPorterInitialPageSortedByName());
        ASSERT_TRUE(listed->done.wait(kPatience)) << "run " << run;
        folder.value()->invalidate();
        ASSERT_FALSE(listed->error) << listed->error->description();
        if (run > 0) {
            EXPECT_TRUE(listed->names.contains("run-" + std::to_string(run - 1) + ".txt"))
                << "run " << run;
        }

        std::optional<HostPorterSyncAnchor> anchor;
        DispatchSemaphore got;
        enumerator->currentSyncAnchorWithCompletionHandler([&](auto value) {
            anchor = value;
            got.signal();
        });
        ASSERT_TRUE(got.wait(kPatience));
        ASSERT_TRUE(anchor);

        const std::string name = "run-" + std::to_string(run) + ".txt";
        std::ofstream(storage + "/" + name) << run;
        auto journal = runtime.startJournal();
        ASSERT_TRUE(journal.ok());
        journal.value()->sync();

        std::set<std::string> updated;
        for (int requests = 0; requests < 20; ++requests) {
            auto changes = std::make_shared<ChangeCollector>();
            enumerator->enumerateChangesForObserver(changes, *anchor);
            auto batch = changes->waitFor(kPatience);
            ASSERT_TRUE(batch) << "run " << run;
            ASSERT_FALSE(batch->error) << batch->error->description();
            for (const auto& item : batch->updated) updated.insert(item->filename());
            ASSERT_TRUE(batch->anchor) << "run " << run;
            anchor = batch->anchor;
            if (!batch->moreComing)
                break;
        }
        EXPECT_TRUE(updated.contains(name)) << "run " << run;
    }

    TempDir state;
    std::string storage;
};

// A long-running host starts and stops the provider many times in one process: every run
// sees what the runs before it wrote, hears of its own change, and leaves no thread behind.
TEST_F(ProviderRuntimeTest, AHundredRunsInOneProcessEachListChangeCatchUpAndLeaveNoThread) {
    const size_t before = liveThreadCount();
    size_t settled = before;
    for (int run = 0; run < 100; ++run) {
        ProviderRuntime runtime(options());
        useOnce(runtime, run);
        runtime.shutdown();
        if (run == 0) {
            settled = liveThreadCount();
            ASSERT_LE(settled, before + kSanitizerThreads) << "threads left after the first run";
        }
        ASSERT_EQ(liveThreadCount(), settled) << "threads left after run " << run;
        if (HasFailure())
            return;
    }
}

// Shutdown gives the process-wide slots back, so that another runtime can start; a second
// shutdown changes nothing, and start-up after shutdown is refused instead of reopening the
// journal behind the host's back.
TEST_F(ProviderRuntimeTest, ShutdownRestoresTheSlotsIsIdempotentAndRefusesLaterStartUp) {
    auto previousManager = HostPorterManager::defaultManager();
    auto previousStrata = StrataService::current();
    {
        ProviderRuntime runtime(options());
        ASSERT_TRUE(runtime.provider().ok());
        EXPECT_NE(HostPorterManager::defaultManager(), previousManager);
        EXPECT_NE(TremorService::sharedIfRunning(), nullptr);
        runtime.shutdown();
        EXPECT_EQ(HostPorterManager::defaultManager(), previousManager);
        EXPECT_EQ(TremorService::sharedIfRunning(), nullptr);
        EXPECT_EQ(StrataService::current(), previousStrata);
        runtime.shutdown();
        auto again = runtime.provider();
        ASSERT_FALSE(again.ok());
        EXPECT_TRUE(again.error().is(kPosixErrorDomain, ECANCELED));
        EXPECT_EQ(TremorService::sharedIfRunning(), nullptr);
    }
    ProviderRuntime next(options());
    EXPECT_TRUE(next.provider().ok());
}

// Two runtimes at once would feed two journals into one set of slots: the second is refused
// and the first keeps serving.
TEST_F(ProviderRuntimeTest, ASecondRuntimeWhileOneRunsIsRefusedAndTheFirstGoesOn) {
    ProviderRuntime first(options());
    ASSERT_TRUE(first.provider().ok());
    TempDir otherState;
    ProviderRuntimeOptions second = options();
    second.stateDir = otherState.path();
    ProviderRuntime other(second);
    auto refused = other.startJournal();
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().is(kPosixErrorDomain, EBUSY));
    other.shutdown();
    auto journal = first.startJournal();
    ASSERT_TRUE(journal.ok());
    EXPECT_EQ(TremorService::sharedIfRunning(), journal.value());
}

}  // namespace
}  // namespace tamber
