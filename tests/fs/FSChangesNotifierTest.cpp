#include <gtest/gtest.h>

#include <thread>

#include "fs/FSChangesNotifier.h"
#include "tests/fs/FsTest.h"

namespace tamber {
namespace {

using Identifiers = std::vector<HostPorterItemIdentifier>;

class FSChangesNotifierTest : public testing::TremorTest {
protected:
    // Runs `reports` on the notifier's queue, as one batch would.
    void batch(const FSChangesNotifierRef& notifier,
               const std::function<void(TremorReader&)>& reports) {
        TremorReader& reader = *notifier->reader();
        reader.streamQueue()->sync([&] {
            reports(reader);
            notifier->readerDidFinishBatch(reader);
        });
    }
};

TEST_F(FSChangesNotifierTest, SignalsAfterTheFirstChangeAndEveryBatchAfterIt) {
    auto notifier = FSChangesNotifier::make("fid=12", {storageURL()});
    ASSERT_TRUE(notifier);
    EXPECT_EQ(notifier->deviceUUID(), TremorReader::deviceUUID(storageURL()));
    batch(notifier, [&](TremorReader& r) { notifier->readerDidProcessHistory(r); });
    batch(notifier, [](TremorReader&) {});
    EXPECT_TRUE(host->signals().empty());

    batch(notifier, [&](TremorReader& r) {
        notifier->readerDidDelete(r, "did=3", std::nullopt);
        notifier->readerDidChange(r, nullptr, std::nullopt);
    });
    EXPECT_EQ(host->signals(), Identifiers{HostPorterRootContainerItemIdentifier});
    batch(notifier, [](TremorReader&) {});
    EXPECT_EQ(host->signals().size(), 2u);
    EXPECT_EQ(log->count("[INFO] notify changes on HostPorterRootContainerItemIdentifier",
                         LogLevel::Info),
              2u);

    // Only the working set signals itself; a host that fails the signal changes nothing.
    host->clear();
    host->setSignalError(Error::syncAnchorExpired());
    auto workingSet =
        FSChangesNotifier::make(HostPorterWorkingSetContainerItemIdentifier, {storageURL()});
    auto all =
        FSChangesNotifier::make(HostPorterAllDirectoriesContainerItemIdentifier, {storageURL()});
    batch(workingSet, [&](TremorReader& r) { workingSet->readerMustRescan(r); });
    batch(all, [&](TremorReader& r) { all->readerMustRescan(r); });
    EXPECT_EQ(host->signals(), (Identifiers{HostPorterWorkingSetContainerItemIdentifier,
                                            HostPorterRootContainerItemIdentifier}));
}

TEST_F(FSChangesNotifierTest, IsNotMadeWithoutAnEventStoreAndSignalsLiveChanges) {
    EXPECT_FALSE(FSChangesNotifier::make("fid=1", {Url::fileURLWithPath("/proc")}));
    EXPECT_EQ(log->count("[ERROR] can't get volume UUID for \"/proc\"", LogLevel::Error), 1u);

    write("before.txt");  // history: the notifier only cares from now on
    auto notifier = FSChangesNotifier::make(HostPorterRootContainerItemIdentifier, {storageURL()});
    ASSERT_TRUE(notifier);
    notifier->start();
    notifier->reader()->streamQueue()->sync([] {});
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_TRUE(host->signals().empty());
    write("after.txt");
    bool signalled = false;
    for (int i = 0; i < 200 && !signalled; ++i) {
        signalled = !host->signals().empty();
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    notifier->stop();
    EXPECT_TRUE(signalled);
    EXPECT_EQ(host->signals().front(), HostPorterRootContainerItemIdentifier);
    EXPECT_EQ(log->countStartingWith("[ERROR] stream deleted"), 0u);
}

}  // namespace
}  // namespace tamber
