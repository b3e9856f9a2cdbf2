#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "host/HostExtensionMain.h"
#include "host/HostPorterManager.h"
#include "tests/common/ScopedLogCapture.h"

namespace tamber {
namespace {

TEST(HostPorterManagerDeathTest, UsingTheManagerBeforeOneIsInstalledStops) {
    auto previous = HostPorterManager::installDefaultManager(nullptr);
    EXPECT_DEATH(HostPorterManager::defaultManager(), "no HostPorterManager installed");
    HostPorterManager::installDefaultManager(previous);
}

class CountingExtension : public HostPorterExtension {};

TEST(HostExtensionMainTest, HandsThePrincipalInstanceToTheRuntimeOrFailsWith70) {
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
    EXPECT_TRUE(std::dynamic_pointer_cast<CountingExtension>(received));
    HostRegisterPrincipalClass(nullptr);
    HostRegisterRuntime(nullptr);
}

// A host binds to the base interface alone: every operation a provider leaves out must still
// answer, once, with the unsupported error, so that a waiting host never hangs on it.
TEST(HostPorterExtensionTest, OperationsAProviderLeavesOutCompleteOnceAsUnsupported) {
    HostPorterExtension provider;
    std::vector<std::string> answered;  // one entry per completion call
    auto item = [&](const std::string& operation) {
        return [&answered, operation](Result<HostPorterItemRef> received) {
            ASSERT_FALSE(received.ok()) << operation;
            const Error& error = received.error();
            EXPECT_TRUE(error.is(kHostPorterErrorDomain, kHostPorterFeatureUnsupported))
                << operation;
            EXPECT_NE(error.reason().find("not supported"), std::string::npos) << operation;
            answered.push_back(operation);
        };
    };
    auto status = [&](const std::string& operation) {
        return [&answered, operation](Status status) {
            ASSERT_FALSE(status.ok()) << operation;
            EXPECT_TRUE(status.error().is(kHostPorterErrorDomain, kHostPorterFeatureUnsupported))
                << operation;
            answered.push_back(operation);
        };
    };
    const Url url = Url::fileURLWithPath("/tmp/x");
    provider.importDocumentAtURL(url, "fid=2", item("import"));
    provider.createDirectoryWithName("a", "fid=2", item("mkdir"));
    provider.createDirectoryWithName("a", "fid=2", false, item("mkdir strict"));
    provider.renameItemWithIdentifier("did=3", "b", item("rename"));
    provider.reparentItemWithIdentifier("did=3", "fid=2", std::nullopt, item("move"));
    provider.deleteItemWithIdentifier("did=3", status("delete"));
    provider.trashItemWithIdentifier("did=3", item("trash"));
    provider.untrashItemWithIdentifier("did=3", std::nullopt, item("untrash"));
    provider.setLastUsedDate(nullptr, "did=3", item("last used"));
    provider.setTagData(std::nullopt, "did=3", item("tags"));
    provider.setFavoriteRank(nullptr, "did=3", item("rank"));
    provider.defaultApplicationContainerForBundleIdentifier("com.example", item("container"));
    int perThumbnail = 0;
    provider.fetchThumbnailsForItemIdentifiers(
        {"#com.example"}, {},
        HostPorterExtension::PerThumbnailCompletion([&](const HostPorterItemIdentifier&,
                                                        std::optional<Bytes>,
                                                        std::optional<Error>) { ++perThumbnail; }),
        status("thumbnails"));
    EXPECT_EQ(perThumbnail, 0);
    EXPECT_EQ(answered, (std::vector<std::string>{"import", "mkdir", "mkdir strict", "rename",
                                                  "move", "delete", "trash", "untrash", "last used",
                                                  "tags", "rank", "container", "thumbnails"}));

    int removedCalls = 0, refreshCalls = 0;
    provider.removeTrashedItemsOlderThanDate(Date::now(), [&](size_t removed) {
        ++removedCalls;
        EXPECT_EQ(removed, 0u);
    });
    provider.refreshInstalledAppsWithCompletionHandler([&] { ++refreshCalls; });
    EXPECT_EQ(removedCalls, 1);
    EXPECT_EQ(refreshCalls, 1);
    EXPECT_FALSE(provider.itemAtURL(url).ok());
    EXPECT_FALSE(provider.persistentIdentifierForItemAtURL(url));
}

// The plain create-folder call is the bouncing one: a provider that implements only the call
// with the flag serves both.
TEST(HostPorterExtensionTest, CreatingAFolderWithoutTheFlagBounces) {
    struct Recording : HostPorterExtension {
        std::vector<bool> bounces;
        void createDirectoryWithName(const std::string&, const HostPorterItemIdentifier&,
                                     bool bounce, ItemCompletion completion) override {
            bounces.push_back(bounce);
            completion(Error::posix(EEXIST));
        }
        using HostPorterExtension::createDirectoryWithName;
    } provider;
    int calls = 0;
    HostPorterExtension& host = provider;
    host.createDirectoryWithName("a", "fid=2", [&](Result<HostPorterItemRef> made) {
        ++calls;
        EXPECT_TRUE(!made.ok() && made.error().is(kPosixErrorDomain, EEXIST));
    });
    host.createDirectoryWithName("a", "fid=2", false, [&](Result<HostPorterItemRef>) { ++calls; });
    EXPECT_EQ(calls, 2);
    EXPECT_EQ(provider.bounces, (std::vector<bool>{true, false}));
}

}  // namespace
}  // namespace tamber
