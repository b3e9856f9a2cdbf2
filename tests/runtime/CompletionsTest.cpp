#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "runtime/ChangeCollector.h"
#include "runtime/CompletionWaiter.h"
#include "runtime/PageCollector.h"
#include "runtime/ProviderCalls.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/runtime/FakeItem.h"

namespace tamber {
namespace {

// The waits have no limit of their own; a deadline turns a lost wake-up into a failure.
constexpr double kDeadline = 10;

TEST(CompletionWaiterTest, TheFirstOutcomeStandsAndLaterOnesAreRefused) {
    auto waiter = std::make_shared<CompletionWaiter<int>>();
    EXPECT_FALSE(waiter->waitFor(0)) << "nothing delivered yet";
    EXPECT_TRUE(waiter->finish(1));
    EXPECT_FALSE(waiter->finish(2));
    EXPECT_EQ(waiter->waitFor(kDeadline), 1);
    // Taken, it still refuses: a late completion cannot start a second answer.
    EXPECT_FALSE(waiter->finish(3));
    EXPECT_TRUE(waiter->finished());
}

TEST(CompletionWaiterTest, RacingCompletionsOnOtherThreadsDeliverExactlyOne) {
    auto waiter = std::make_shared<CompletionWaiter<int>>();
    std::atomic<int> accepted{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) threads.emplace_back([&, i] { accepted += waiter->finish(i); });
    auto outcome = waiter->waitFor(kDeadline);
    for (auto& thread : threads) thread.join();
    ASSERT_TRUE(outcome);
    EXPECT_EQ(accepted.load(), 1);
    EXPECT_GE(*outcome, 0);
    EXPECT_LT(*outcome, 8);
}

TEST(ProviderCallsTest, WaitsForACompletionOnAnotherThreadAndIgnoresASecondOne) {
    std::thread late;
    auto item = ProviderCalls::waitForItem([&](HostPorterExtension::ItemCompletion done) {
        late = std::thread([done] {
            done(FakeItem::make("did=1", "first"));
            done(Error::posix(EIO));  // a provider's bug: must change nothing
        });
    });
    late.join();
    ASSERT_TRUE(item.ok());
    EXPECT_EQ(item.value()->filename(), "first");

    auto failed = ProviderCalls::waitForItem([](auto done) {
        done(Error::posix(EACCES));
        done(FakeItem::make("did=1", "late"));
    });
    ASSERT_FALSE(failed.ok());
    EXPECT_TRUE(failed.error().is(kPosixErrorDomain, EACCES));

    // A success without an item: the host still gets an answer, not a crash or a hang.
    auto neither = ProviderCalls::waitForItem([](auto done) { done(HostPorterItemRef()); });
    ASSERT_FALSE(neither.ok());
    EXPECT_TRUE(neither.error().is(kHostPorterErrorDomain, kHostPorterNoSuchItem));

    Status status = ProviderCalls::waitForStatus([](auto done) {
        done(Status::OK());
        done(Error::posix(EIO));
    });
    EXPECT_TRUE(status.ok());
    EXPECT_EQ(ProviderCalls::waitForCount([](auto done) {
                  done(3);
                  done(4);
              }),
              3u);
}

TEST(CollectorTest, APageKeepsItsItemsInOrderAndASecondFinishIsLoggedNotDelivered) {
    testing::ScopedLogCapture log;
    auto collector = std::make_shared<PageCollector>();
    std::thread provider([collector] {
        collector->didEnumerateItems({FakeItem::make("did=1", "a"), FakeItem::make("did=2", "b")});
        collector->didEnumerateItems({FakeItem::make("did=3", "c")});
        collector->finishEnumeratingUpToPage(Bytes{7});
        collector->finishEnumeratingWithError(Error::posix(EIO));
    });
    PageCollector::Page page = collector->wait();
    provider.join();
    EXPECT_FALSE(page.error);
    EXPECT_EQ(page.nextPage, Bytes{7});
    std::vector<std::string> names;
    for (const auto& item : page.items) names.push_back(item->filename());
    EXPECT_EQ(names, (std::vector<std::string>{"a", "b", "c"}));
    EXPECT_EQ(log->count("[ERROR] a listing page was finished twice", LogLevel::Error), 1u);
}

TEST(CollectorTest, AChangeBatchKeepsDeletionsAndUpdatesInTheOrderTheyCame) {
    testing::ScopedLogCapture log;
    auto collector = std::make_shared<ChangeCollector>();
    EXPECT_FALSE(collector->waitFor(0));
    // A folder's number deleted, then reused by a new folder: applying these out of order
    // would lose the new folder.
    collector->didDeleteItemsWithIdentifiers({"fid=9"});
    collector->didUpdateItems({FakeItem::make("fid=9", "new")});
    collector->didDeleteItemsWithIdentifiers({"did=4"});
    collector->finishEnumeratingChangesUpToSyncAnchor(Bytes{1, 2}, true);
    collector->finishEnumeratingChangesUpToSyncAnchor(Bytes{3}, false);
    auto batch = collector->waitFor(kDeadline);
    ASSERT_TRUE(batch);
    ASSERT_EQ(batch->changes.size(), 3u);
    EXPECT_EQ(batch->changes[0].deletedItem, "fid=9");
    EXPECT_FALSE(batch->changes[0].item);
    ASSERT_TRUE(batch->changes[1].item);
    EXPECT_EQ(batch->changes[1].item->itemIdentifier(), "fid=9");
    EXPECT_EQ(batch->changes[2].deletedItem, "did=4");
    EXPECT_EQ(batch->deleted, (std::vector<HostPorterItemIdentifier>{"fid=9", "did=4"}));
    EXPECT_EQ(batch->anchor, (Bytes{1, 2}));
    EXPECT_TRUE(batch->moreComing);
    EXPECT_EQ(log->count("[ERROR] a change batch was finished twice", LogLevel::Error), 1u);
}

}  // namespace
}  // namespace tamber
