#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "items/LocalAppLibraryItem.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {
namespace {

using namespace testing;

using LocalPorterDefaultContainerTest = ProviderOperationsTest;

TEST_F(LocalPorterDefaultContainerTest, InstalledAppGivesItsLibraryItem) {
    ItemOutcome outcome;
    porter->_defaultApplicationContainerForBundleIdentifier(kApp, outcome.handler());
    EXPECT_EQ(outcome.calls, 1);
    ASSERT_TRUE(outcome.item);
    EXPECT_FALSE(outcome.error);
    EXPECT_EQ(outcome.item->itemIdentifier(), kAppIdentifier);
    EXPECT_EQ(outcome.item->fileURL().path(), library);
    EXPECT_EQ(sectionsTitled(std::string("default location for ") + kApp), 1u);
    EXPECT_EQ(log->countStartingWith("[ERROR]"), 0u);
}

TEST_F(LocalPorterDefaultContainerTest, UnknownOrContainerlessAppIsAnInvalidParameter) {
    auto expectInvalidBundle = [&](const ItemOutcome& outcome) {
        EXPECT_EQ(outcome.calls, 1);
        EXPECT_FALSE(outcome.item);
        ASSERT_TRUE(outcome.error);
        EXPECT_EQ(outcome.error->domain(), kHostPorterErrorDomain);
        EXPECT_EQ(outcome.error->code(), kHostPorterInvalidParameter);
        EXPECT_EQ(outcome.error->userInfo().at("parameter"), "bundleIdentifier");
    };

    ItemOutcome missing;
    porter->_defaultApplicationContainerForBundleIdentifier("com.example.gone", missing.handler());
    expectInvalidBundle(missing);
    EXPECT_EQ(
        log->count("[ERROR] can't create bundle proxy with 'com.example.gone'", LogLevel::Error),
        1u);

    // Installed, but with nowhere to keep documents.
    registry->replace(AppRegistry::kUserApplications,
                      {app(kApp), app("com.example.bare", true, false, false, false)});
    log->clear();
    ItemOutcome bare;
    porter->_defaultApplicationContainerForBundleIdentifier("com.example.bare", bare.handler());
    expectInvalidBundle(bare);
    EXPECT_EQ(log->countStartingWith("[ERROR] can't create an app library item with "), 1u);
    EXPECT_EQ(sectionsTitled("default location for com.example.bare"), 1u);
}

// Waits until `count` reaches `target` or a generous deadline passes.
void waitFor(const std::atomic<int>& count, int target) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (count < target && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
}

TEST_F(LocalPorterDefaultContainerTest, LaterRefreshCallsEveryEarlierHandlerAgain) {
    std::atomic<int> first{0}, second{0};
    porter->_refreshInstalledAppsWithCompletionHandler([&] { ++first; });
    waitFor(first, 1);
    porter->_refreshInstalledAppsWithCompletionHandler([&] { ++second; });
    waitFor(second, 1);
    porter->appRefreshQueue()->sync([] {});
    EXPECT_EQ(first, 2);
    EXPECT_EQ(second, 1);
    // Nothing was installed or removed: no container changed, none is signalled.
    EXPECT_TRUE(host->signals().empty());
    EXPECT_EQ(log->countStartingWith("[INFO] notify changes on "), 0u);
}

TEST_F(LocalPorterDefaultContainerTest, RefreshAfterAnInstallSignalsTheChangedContainers) {
    registry->replace(AppRegistry::kUserApplications, {app(kApp), app("com.example.new")});
    std::atomic<int> called{0};
    porter->_refreshInstalledAppsWithCompletionHandler([&] { ++called; });
    waitFor(called, 1);
    porter->appRefreshQueue()->sync([] {});
    EXPECT_EQ(log->count("[INFO] notify changes on HostPorterRootContainerItemIdentifier",
                         LogLevel::Info),
              1u);
    EXPECT_EQ(log->count("[INFO] notify changes on HostPorterWorkingSetContainerItemIdentifier",
                         LogLevel::Info),
              1u);
    EXPECT_EQ(host->signals(), (Identifiers{HostPorterRootContainerItemIdentifier,
                                            HostPorterWorkingSetContainerItemIdentifier}));
}

}  // namespace
}  // namespace tamber
