#include "enumeration/LocalRootEnumerator.h"

#include <gtest/gtest.h>

#include "tests/enumeration/EnumerationTest.h"

namespace tamber {
namespace {

using testing::EnumerationTest;
using Names = std::vector<std::string>;

class LocalRootEnumeratorTest : public EnumerationTest {
protected:
    // Publishes these apps' libraries in the main cache (its version goes up by one).
    void publish(std::initializer_list<std::string> bundles) {
        install(bundles);
        ASSERT_TRUE(LocalAppLibraryManager::shared()->refresh());
    }
    LocalRootEnumeratorRef root(const HostPorterItemIdentifier& container) {
        auto enumerator = LocalRootEnumerator::initWithContainer(container);
        enumerators.push_back(enumerator);
        return enumerator;
    }
    HostPorterSyncAnchor anchor(uint64_t appLibraryVersion) {
        return FSChangeToken{0, deviceUUID(), TremorReader::currentEventID(), 0, appLibraryVersion}
            .encode();
    }
    static uint64_t libraryVersionOf(const testing::WaitingChangeObserver& observer) {
        return observer.anchor ? FSChangeToken::decode(*observer.anchor)->appLibraryVersionToken
                               : UINT64_MAX;
    }
};

TEST_F(LocalRootEnumeratorTest, LibrariesComeOnTheInitialPagesOnlyBeforeTheStorageFiles) {
    publish({"com.b", "com.a"});
    dir.writeFile("s/x.txt");
    dir.writeFile("s/.hidden");
    dir.writeFile("apps/com.a/Documents/in-library.txt");
    auto enumerator = root(HostPorterRootContainerItemIdentifier);
    EXPECT_EQ(
        enumerator->localFileEnumerator()->urls(),
        (std::vector<Url>{documents("com.a"), documents("com.b"), Url::fileURLWithPath(storage)}));

    for (const auto& page :
         {HostPorterInitialPageSortedByName(), HostPorterInitialPageSortedByDate()}) {
        auto listed = list(*enumerator, page);
        ASSERT_FALSE(listed.error);
        EXPECT_EQ(listed.names, (Names{"com.a app", "com.b app", "x.txt"}));
        EXPECT_EQ(listed.callSizes.front(), 2u) << "the libraries in one call";
    }
    EXPECT_EQ(log->count("[DEBUG] discovered 2 app-libraries", LogLevel::Debug), 2u);

    auto resumed = list(*enumerator, pageToken(0));
    ASSERT_FALSE(resumed.error);
    EXPECT_EQ(resumed.names, Names{"x.txt"});
}

TEST_F(LocalRootEnumeratorTest, LibraryVersionInTheAnchorDecidesWhatTheHostIsTold) {
    publish({"com.a", "com.b"});
    auto enumerator = root(HostPorterRootContainerItemIdentifier);

    // First change enumeration: every library, although nothing changed.
    auto first = changes(*enumerator, anchor(0));
    ASSERT_FALSE(first->error) << first->error->description();
    EXPECT_EQ(first->updateCalls.front(), 2u);
    EXPECT_EQ(Names(first->updated.begin(), first->updated.begin() + 2),
              (Names{"com.a app", "com.b app"}));
    EXPECT_EQ(libraryVersionOf(*first), 1u);

    // Up to date: no library news.
    auto current = changes(*enumerator, anchor(1));
    ASSERT_FALSE(current->error);
    EXPECT_EQ(std::count(current->updated.begin(), current->updated.end(), "com.a app"), 0);
    EXPECT_EQ(libraryVersionOf(*current), 1u);
    EXPECT_EQ(log->count("[DEBUG] change token version matches local version", LogLevel::Debug),
              1u);

    auto ahead = changes(*enumerator, anchor(5));
    EXPECT_TRUE(isExpired(ahead->error));
    EXPECT_EQ(log->count("[ERROR] app-library version is in advance, need to restart from scratch "
                         "[changeTokenVersion: 5, localVersion: 1, mainCacheVersion: 1]",
                         LogLevel::Error),
              1u);

    // A new app: the host with the current version hears of it, and its library is watched.
    publish({"com.a", "com.b", "com.c"});
    auto upgraded = changes(*enumerator, anchor(1));
    ASSERT_FALSE(upgraded->error);
    EXPECT_EQ(std::count(upgraded->updated.begin(), upgraded->updated.end(), "com.c app"), 1);
    EXPECT_EQ(libraryVersionOf(*upgraded), 2u);
    EXPECT_EQ(enumerator->localFileEnumerator()->urls().size(), 4u);
    EXPECT_EQ(log->count("[DEBUG] updated root enumerator to monitor [" +
                             documents("com.a").path() + ", " + documents("com.b").path() + ", " +
                             documents("com.c").path() + ", " + storage + "]",
                         LogLevel::Debug),
              1u);

    // A host still at the old version can't be brought up to date: it starts over.
    auto stale = changes(*enumerator, anchor(1));
    EXPECT_TRUE(isExpired(stale->error));
    EXPECT_EQ(log->count("[ERROR] change token version matches nothing, need to restart from "
                         "scratch [changeTokenVersion: 1, localVersion: 2, mainCacheVersion: 2]",
                         LogLevel::Error),
              1u);
    auto garbage = changes(*enumerator, HostPorterSyncAnchor{'x'});
    EXPECT_TRUE(isExpired(garbage->error));
    EXPECT_TRUE(detachesAll(*enumerator->localFileEnumerator()));

    auto current2 = currentAnchor(*enumerator);
    ASSERT_TRUE(current2);
    EXPECT_EQ(FSChangeToken::decode(*current2)->appLibraryVersionToken, 2u);
}

TEST_F(LocalRootEnumeratorTest, WorkingSetUpgradesAndSavesItsOwnCache) {
    publish({"com.a"});
    auto workingSet = root(HostPorterWorkingSetContainerItemIdentifier);
    EXPECT_EQ(workingSet->appLibraryManager()->versionToken(), 0u) << "its cache is still empty";

    auto ahead = changes(*workingSet, anchor(7));
    EXPECT_TRUE(isExpired(ahead->error));
    EXPECT_EQ(log->count("[ERROR] app-library version is in advance, need to restart from scratch "
                         "[changeTokenVersion: 7, localVersion: 0, workingSetVersion: 0, "
                         "mainCacheVersion: 1]",
                         LogLevel::Error),
              1u);

    auto first = changes(*workingSet, anchor(0));
    ASSERT_FALSE(first->error);
    EXPECT_EQ(first->updateCalls.front(), 1u);
    EXPECT_EQ(first->updated.front(), "com.a app");
    EXPECT_EQ(libraryVersionOf(*first), 1u);
    EXPECT_EQ(load(kWorkingSet).versionToken, 1u) << "what the host was told is saved";
    EXPECT_EQ(bundlesOf(load(kWorkingSet).bundleRecords), Names{"com.a"});
    EXPECT_EQ(workingSet->localFileEnumerator()->urls().front(), documents("com.a"));
}

}  // namespace
}  // namespace tamber
