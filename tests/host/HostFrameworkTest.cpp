#include <gtest/gtest.h>

#include "host/HostExtensionMain.h"
#include "host/HostPorterManager.h"
#include "host/HostPorterPage.h"
#include "host/RecordingHostPorterManager.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

TEST(ContainerIdentifierTest, FixedStringsNeverLookLikeItemIdentifiers) {
    for (const auto& id :
         {HostPorterRootContainerItemIdentifier, HostPorterWorkingSetContainerItemIdentifier,
          HostPorterAllDirectoriesContainerItemIdentifier,
          HostPorterTemporaryLocalFolderItemIdentifier}) {
        EXPECT_EQ(id.find('='), std::string::npos) << id;
        EXPECT_EQ(id.find('#'), std::string::npos) << id;
        EXPECT_TRUE(isHostContainerIdentifier(id));
    }
    EXPECT_FALSE(isHostContainerIdentifier("fid=2"));
    EXPECT_NE(HostPorterInitialPageSortedByDate(), HostPorterInitialPageSortedByName());
    EXPECT_TRUE(isHostPorterInitialPage(HostPorterInitialPageSortedByName()));
    EXPECT_FALSE(isHostPorterInitialPage(Bytes{'b', 'p'}));
}

TEST(HostPorterManagerTest, InstalledManagerIsTheDefaultAndRecords) {
    auto recording =
        std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath("/srv/docs"));
    auto previous = HostPorterManager::installDefaultManager(recording);
    auto manager = HostPorterManager::defaultManager();
    EXPECT_EQ(manager->documentStorageURL().path(), "/srv/docs");

    int completions = 0;
    manager->signalEnumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier,
                                                        [&](auto error) {
                                                            EXPECT_FALSE(error.has_value());
                                                            ++completions;
                                                        });
    recording->setSignalError(Error::syncAnchorExpired());
    manager->signalEnumeratorForContainerItemIdentifier(HostPorterRootContainerItemIdentifier,
                                                        [&](auto error) {
                                                            EXPECT_TRUE(error.has_value());
                                                            ++completions;
                                                        });
    manager->deleteSearchableItemsWithDomainIdentifiers({"com.example.app"}, nullptr);
    EXPECT_EQ(completions, 2);
    EXPECT_EQ(recording->signals(),
              (std::vector<HostPorterItemIdentifier>{HostPorterWorkingSetContainerItemIdentifier,
                                                     HostPorterRootContainerItemIdentifier}));
    EXPECT_EQ(recording->deletions().size(), 1u);
    HostPorterManager::installDefaultManager(previous);
}

TEST(HostPorterManagerDeathTest, UsingTheManagerBeforeOneIsInstalledStops) {
    auto previous = HostPorterManager::installDefaultManager(nullptr);
    EXPECT_DEATH(HostPorterManager::defaultManager(), "no HostPorterManager installed");
    HostPorterManager::installDefaultManager(previous);
}

class CountingExtension : public HostPorterExtension {};

TEST(HostExtensionMainTest, HandsThePrincipalInstanceToTheRuntime) {
    testing::ScopedLogCapture log;
    HostRegisterPrincipalClass(nullptr);
    HostRegisterRuntime(nullptr);
    char arg0[] = "tamber";
    char* argv[] = {arg0, nullptr};
    EXPECT_EQ(HostExtensionMain(1, argv), 70);
    EXPECT_EQ(log->countStartingWith("[ERROR] no extension principal class"), 1u);

    int made = 0;
    HostRegisterPrincipalClass([&] {
        ++made;
        return std::make_shared<CountingExtension>();
    });
    std::shared_ptr<HostPorterExtension> received;
    HostRegisterRuntime([&](int argc, char**, std::shared_ptr<HostPorterExtension> ext) {
        received = ext;
        return argc + 40;
    });
    EXPECT_EQ(HostExtensionMain(1, argv), 41);
    EXPECT_EQ(made, 1);
    ASSERT_TRUE(received);
    EXPECT_TRUE(std::dynamic_pointer_cast<CountingExtension>(received));

    // The base provider publishes nothing and completes provide calls at once.
    EXPECT_FALSE(received->itemForIdentifier("fid=1").ok());
    bool completed = false;
    received->startProvidingItemAtURL(Url::fileURLWithPath("/x"),
                                      [&](auto error) { completed = !error.has_value(); });
    EXPECT_TRUE(completed);
    HostRegisterPrincipalClass(nullptr);
    HostRegisterRuntime(nullptr);
}

}  // namespace
}  // namespace tamber
