#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <future>
#include <thread>

#include "items/TBFileObjectIdentifier.h"
#include "platform/FaultInjectingFileSystem.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/ScopedFileSystem.h"

namespace tamber::testing {
namespace {

using LocalAppLibraryManagerTest = AppLibraryTest;

TEST_F(LocalAppLibraryManagerTest, RefreshListsTheAppsThatPublishDocuments) {
    auto noName =
        AppRecord::make({{}, {}, Url::fileURLWithPath(container("h")), {}}, {true, true, nullptr});
    registry->replace(AppRegistry::kUserApplications,
                      {nullptr, app("u.in-place-sharing", false, true, true),
                       app("u.sharing-only", std::nullopt, false, true),
                       app("u.in-place-only", std::nullopt, true, false),
                       app("u.no-container", true, false, false, false),
                       BundleRecord::make({"u.not-an-app", {}, documents("x"), {}}),
                       app("u.browser"), app("u.no-info", std::nullopt, true, true), noName});
    registry->replace(AppRegistry::kSystemApplications, {app("sys.browser")});
    registry->replace(1, {app("other.type")});

    auto manager = LocalAppLibraryManager::init(kMain);
    EXPECT_TRUE(manager->refresh());
    auto content = load(kMain);
    EXPECT_EQ(content.versionToken, 1u);
    EXPECT_EQ(bundlesOf(content.bundleRecords),
              (Identifiers{"u.in-place-sharing", "u.browser", "u.no-info", "-", "sys.browser"}));
    EXPECT_EQ(log->count("[ERROR] enumerate Application provided nil proxy", LogLevel::Error), 1u);
    EXPECT_TRUE(log->contains("[DEBUG] main cache version token is now 1"));
    EXPECT_EQ(manager->versionToken(), 0u);  // only the main cache changed
}

TEST_F(LocalAppLibraryManagerTest, RefreshRewritesOnlyWhenContainersOrTheirOrderChange) {
    auto manager = LocalAppLibraryManager::init(kMain);
    install({"org.a", "org.b"});
    EXPECT_TRUE(manager->refresh());
    EXPECT_FALSE(manager->refresh());
    EXPECT_TRUE(log->contains("[DEBUG] bundle proxies are identical to previous version"));
    install({"org.b", "org.a"});
    EXPECT_TRUE(manager->refresh());
    EXPECT_EQ(token(kMain), 2u);
    // Other fields of the same containers are no change.
    registry->replace(AppRegistry::kUserApplications,
                      {AppRecord::make({"x", "X", Url::fileURLWithPath(container("org.b")), {}},
                                       {true, true, nullptr}),
                       app("org.a")});
    EXPECT_FALSE(manager->refresh());

    // A failed write is logged, keeps the old file and token, and the next refresh retries.
    auto faults = std::make_shared<FaultInjectingFileSystem>(FileSystem::currentShared());
    ScopedFileSystem scoped(faults);
    faults->inject(FaultInjectingFileSystem::Operation::Renameat2, EROFS, 1, "app-libraries.plist");
    install({"org.b"});
    EXPECT_FALSE(manager->refresh());
    EXPECT_TRUE(
        log->contains("[ERROR] can't refresh app libraries; " + Error::posix(EROFS).description()));
    EXPECT_EQ(bundlesOf(load(kMain).bundleRecords), (Identifiers{"org.b", "org.a"}));
    EXPECT_TRUE(manager->refresh());
    EXPECT_EQ(token(kMain), 3u);
}

TEST_F(LocalAppLibraryManagerTest, UpgradeReportsChangesAndDeletesIndexOnlyWhenAsked) {
    ASSERT_TRUE(save(kWorkingSet, {app("org.a")}, 1).ok());
    ASSERT_TRUE(save(kMain, {app("org.a"), app("org.b")}, 1).ok());
    auto manager = LocalAppLibraryManager::init(kWorkingSet);
    RecordingChangeObserver observer;
    EXPECT_FALSE(manager->upgradeFromMainCache(&observer, true));  // equal tokens
    EXPECT_TRUE(observer.updates.empty() && observer.deletions.empty());
    EXPECT_EQ(manager->rootURLs(), std::vector<Url>{documents("org.a")});

    install({"org.c", "org.b"});
    ASSERT_TRUE(manager->refresh());
    EXPECT_TRUE(manager->upgradeFromMainCache(&observer, false));
    EXPECT_EQ(observer.updates, (std::vector<Identifiers>{{"#org.b", "#org.c"}}));
    EXPECT_EQ(observer.deletions, (std::vector<Identifiers>{{"#org.a"}}));
    EXPECT_TRUE(host->deletions().empty());
    EXPECT_EQ(manager->rootURLs(), (std::vector<Url>{documents("org.b"), documents("org.c")}));

    install({});
    ASSERT_TRUE(manager->refresh());
    observer = {};
    EXPECT_TRUE(manager->upgradeFromMainCache(&observer, true));
    EXPECT_TRUE(observer.updates.empty());
    EXPECT_EQ(observer.deletions, (std::vector<Identifiers>{{"#org.b", "#org.c"}}));
    EXPECT_EQ(host->deletions(), (std::vector<Identifiers>{{"#org.b", "#org.c"}}));
    EXPECT_TRUE(log->contains("[DEBUG] items from domains (#org.b, #org.c) removed from index"));
    EXPECT_EQ(manager->versionToken(), 3u);
    EXPECT_TRUE(manager->rootURLs().empty());
}

// Answers index deletions late, from another thread, with an error.
class LateFailingHost : public RecordingHostPorterManager {
public:
    using RecordingHostPorterManager::RecordingHostPorterManager;
    ~LateFailingHost() override {
        for (auto& thread : threads_) thread.join();
    }
    void deleteSearchableItemsWithDomainIdentifiers(const std::vector<std::string>& identifiers,
                                                    Completion completion) override {
        threads_.emplace_back([this, identifiers, completion = std::move(completion)] {
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            RecordingHostPorterManager::deleteSearchableItemsWithDomainIdentifiers(identifiers,
                                                                                   nullptr);
            completed = true;
            completion(Error::posix(EIO));
        });
    }
    std::atomic<bool> completed{false};

private:
    std::vector<std::thread> threads_;
};

TEST_F(LocalAppLibraryManagerTest, ManagerAheadOfTheMainCacheTakesItsContentAnyway) {
    ASSERT_TRUE(save(kWorkingSet, {app("org.a"), app("org.b")}, 5).ok());
    ASSERT_TRUE(save(kMain, {app("org.a")}, 2).ok());
    auto manager = LocalAppLibraryManager::init(kWorkingSet);
    char address[32];
    std::snprintf(address, sizeof address, "%p", static_cast<const void*>(manager.get()));
    const std::string ahead = "<LocalAppLibraryManager:" + std::string(address) +
                              " versionToken:5 cache-source:working-set cache app-libraries:2>";
    EXPECT_EQ(manager->description(), ahead);
    auto texts = log->texts();
    EXPECT_EQ(std::count_if(texts.begin(), texts.end(),
                            [](const std::string& text) {
                                return text.starts_with("[DEBUG] \u250f") &&
                                       text.ends_with(
                                           " loading bundle proxies from "
                                           "working-set cache");
                            }),
              1);
    EXPECT_NE(LocalAppLibraryManager::shared()->description().find(" SHARED versionToken:5 "),
              std::string::npos);

    auto late = std::make_shared<LateFailingHost>(host->documentStorageURL());
    HostPorterManager::installDefaultManager(late);
    log->clear();
    EXPECT_TRUE(manager->upgradeFromMainCache(nullptr, true));
    // The upgrade waited for the host, and its failure did not stop the upgrade.
    EXPECT_TRUE(late->completed);
    EXPECT_EQ(late->deletions(), std::vector<Identifiers>{{"#org.b"}});
    EXPECT_EQ(log->count("[ERROR] version token shouldn't be greater than the main's cache "
                         "version (5 vs 2); " +
                             ahead,
                         LogLevel::Error),
              1u);
    EXPECT_EQ(log->count("[ERROR] can't delete searchable items from (#org.b); " +
                             Error::posix(EIO).description(),
                         LogLevel::Error),
              1u);
    EXPECT_EQ(manager->versionToken(), 2u);
    EXPECT_TRUE(
        log->contains("[DEBUG] upgraded manager <LocalAppLibraryManager:" + std::string(address) +
                      " versionToken:2 cache-source:working-set cache app-libraries:1>"));
    EXPECT_FALSE(manager->upgradeFromMainCache(nullptr, true));
}

// Reads the manager while it is being told, as a root enumerator would.
struct ReadingObserver : RecordingChangeObserver {
    std::shared_ptr<LocalAppLibraryManager> manager;
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        manager->versionToken();
        manager->description();
        RecordingChangeObserver::didUpdateItems(items);
    }
};

TEST_F(LocalAppLibraryManagerTest, ParallelRefreshesUpgradesAndLookupsFinish) {
    const std::vector<BundleRecordRef> lists[] = {{app("org.a"), app("org.b")}, {app("org.c")}};
    const std::vector<std::vector<Url>> allowedRoots{
        {}, {documents("org.a"), documents("org.b")}, {documents("org.c")}};
    auto shared = LocalAppLibraryManager::shared();
    auto rootManager = LocalAppLibraryManager::init(kMain);
    auto lookup = AppLibraryLookup::current();
    std::atomic<bool> stop{false};
    std::atomic<int> torn{0}, lookups{0};

    auto work = std::async(std::launch::async, [&] {
        std::vector<std::thread> writers, readers;
        for (int t = 0; t < 2; ++t)
            writers.emplace_back([&, t] {
                ReadingObserver observer;
                observer.manager = shared;
                for (int i = 0; i < 25; ++i) {
                    registry->replace(AppRegistry::kUserApplications, lists[(i + t) % 2]);
                    if (t == 0)
                        LocalAppLibraryManager::backgroundQueue().sync([&] { shared->refresh(); });
                    else
                        shared->refresh();
                    shared->upgradeFromMainCache(&observer, i % 2 == 0);
                    rootManager->upgradeFromMainCache(nullptr, false);
                    if (i % 5 == 0)
                        shared->saveToCache();
                }
            });
        for (int r = 0; r < 3; ++r)
            readers.emplace_back([&] {
                while (!stop) {
                    auto roots = lookup->rootURLsForAppLibraries();
                    if (std::find(allowedRoots.begin(), allowedRoots.end(), roots) ==
                        allowedRoots.end())
                        ++torn;
                    auto a =
                        lookup->bundleIdentifierForRoot(documents("org.a"), UrlRelationship::Same);
                    if (a && *a != "org.a")
                        ++torn;
                    shared->itemForIdentifier("#org.c");
                    shared->description();
                    ++lookups;
                }
            });
        for (auto& thread : writers) thread.join();
        stop = true;
        for (auto& thread : readers) thread.join();
    });
    if (work.wait_for(std::chrono::seconds(120)) != std::future_status::ready) {
        std::fprintf(stderr, "refreshes, upgrades and lookups deadlocked\n");
        std::abort();
    }
    EXPECT_EQ(torn.load(), 0);
    EXPECT_GT(lookups.load(), 0);

    // Once quiet, one more round leaves the shared manager on the main cache's content.
    registry->replace(AppRegistry::kUserApplications, lists[1]);
    shared->refresh();
    shared->upgradeFromMainCache(nullptr, false);
    EXPECT_EQ(shared->versionToken(), token(kMain));
    EXPECT_EQ(lookup->rootURLsForAppLibraries(), std::vector<Url>{documents("org.c")});
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(documents("org.c")), "#org.c");
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(documents("org.a")), std::nullopt);
}

}  // namespace
}  // namespace tamber::testing
