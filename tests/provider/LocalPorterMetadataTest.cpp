#include <gtest/gtest.h>
#include <sys/stat.h>

#include "items/ExtendedAttributes.h"
#include "items/ItemMetadata.h"
#include "items/XdgTagList.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/Tag.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {
namespace {

using namespace testing;
using MetadataTest = ProviderOperationsTest;

TEST_F(MetadataTest, LastUsedDateRefusesHashIdentifiersWhileFavoriteRankProceeds) {
    Url libraryURL = Url::fileURLWithPath(library);
    ItemOutcome refused;
    porter->setLastUsedDate(Date::make(1000), kAppIdentifier, refused.handler());
    EXPECT_EQ(refused.calls, 1);
    EXPECT_FALSE(refused.item);
    ASSERT_TRUE(refused.error);
    EXPECT_EQ(refused.error->code(), kHostPorterInvalidParameter);
    EXPECT_EQ(refused.error->userInfo().at("parameter"), "itemIdentifier");
    EXPECT_EQ(refused.error->userInfo().at("value"), kAppIdentifier);
    EXPECT_FALSE(ReadXattrData(LocalItem::xattrLastUsedDateName(), libraryURL));

    ItemOutcome ranked;
    porter->setFavoriteRank(Number::fromInt64(7), kAppIdentifier, ranked.handler());
    EXPECT_EQ(ranked.calls, 1);
    ASSERT_TRUE(ranked.item) << ranked.error->description();
    EXPECT_EQ(ranked.item->itemIdentifier(), kAppIdentifier);
    ASSERT_TRUE(ranked.item->favoriteRank());
    EXPECT_EQ(ranked.item->favoriteRank()->int64Value(), 7);
    ASSERT_TRUE(ItemMetadata::readFavoriteRank(libraryURL));
}

TEST_F(MetadataTest, LastUsedDateAndRankAreWrittenAndCleared) {
    std::string file = writeFile(library + "/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    Url url = Url::fileURLWithPath(file);

    // Clearing what was never set is no error.
    ItemOutcome clearedFirst;
    porter->setLastUsedDate(nullptr, identifier, clearedFirst.handler());
    EXPECT_EQ(clearedFirst.calls, 1);
    ASSERT_TRUE(clearedFirst.item);
    EXPECT_FALSE(clearedFirst.error);

    ItemOutcome set;
    porter->setLastUsedDate(Date::make(1234.5), identifier, set.handler());
    ASSERT_TRUE(set.item);
    ASSERT_TRUE(set.item->lastUsedDate());
    EXPECT_EQ(set.item->lastUsedDate()->timeIntervalSince1970(), 1234.5);
    EXPECT_EQ(set.item->itemIdentifier(), identifier);

    ItemOutcome cleared;
    porter->setLastUsedDate(nullptr, identifier, cleared.handler());
    ASSERT_TRUE(cleared.item);
    EXPECT_FALSE(cleared.item->lastUsedDate());
    EXPECT_FALSE(ReadXattrData(LocalItem::xattrLastUsedDateName(), url));

    ItemOutcome ranked, unranked;
    porter->setFavoriteRank(Number::fromInt64(2), identifier, ranked.handler());
    ASSERT_TRUE(ranked.item && ranked.item->favoriteRank());
    EXPECT_EQ(ranked.item->favoriteRank()->int64Value(), 2);
    porter->setFavoriteRank(nullptr, identifier, unranked.handler());
    ASSERT_TRUE(unranked.item);
    EXPECT_FALSE(unranked.item->favoriteRank());
    EXPECT_FALSE(ReadXattrData(LocalItem::xattrFavoriteRankName(), url));

    EXPECT_EQ(sectionsTitled("clearing last used date for item \"" + identifier), 2u);
    EXPECT_EQ(
        sectionsTitled("set last used date \"1970-01-01T00:20:34.500Z\" to item \"" + identifier),
        1u);
    EXPECT_EQ(sectionsTitled("set favorite rank \"nil\" to item \"" + identifier), 1u);
    EXPECT_EQ(log->countStartingWith("[ERROR]"), 0u);
}

TEST_F(MetadataTest, TagsKeepOnlyLabelsMirrorTheDesktopListAndClearingStoresAnEmptyList) {
    std::string file = writeFile(storage + "/Projects/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    Url url = Url::fileURLWithPath(file);

    Bytes tagData = GetTagsDataForTags({Tag::make("Work", 4), Tag::make("Travel", 6)});
    ItemOutcome tagged;
    porter->setTagData(tagData, identifier, tagged.handler());
    EXPECT_EQ(tagged.calls, 1);
    ASSERT_TRUE(tagged.item && tagged.item->tagData());
    EXPECT_EQ(ItemMetadata::readTagLabels(url), (std::vector<std::string>{"Work", "Travel"}));
    auto tags = GetTagsFromTagsData(*tagged.item->tagData());
    ASSERT_TRUE(tags);
    ASSERT_EQ(tags->size(), 2u);
    EXPECT_EQ((*tags)[0]->label(), "Work");
    EXPECT_EQ((*tags)[0]->colour(), 0);
    EXPECT_EQ((*tags)[1]->colour(), 0);
    // The desktop's list holds the names, in order.
    auto desktop = ReadXattrData("xdg.tags", url);
    ASSERT_TRUE(desktop);
    EXPECT_EQ(std::string(desktop->begin(), desktop->end()), "Work,Travel");

    for (const std::optional<Bytes>& cleared :
         {std::optional<Bytes>(), std::optional<Bytes>(Bytes{1, 2, 3})}) {
        ItemOutcome outcome;
        porter->setTagData(cleared, identifier, outcome.handler());
        EXPECT_EQ(outcome.calls, 1);
        ASSERT_TRUE(outcome.item);
        // Still there, holding an archived empty list.
        ASSERT_TRUE(ReadXattrData(LocalItem::xattrTagDataName(), url));
        EXPECT_EQ(ItemMetadata::readTagLabels(url), std::vector<std::string>{});
        EXPECT_FALSE(ReadXattrData("xdg.tags", url));
        // Put something back so that the next round clears again.
        porter->setTagData(tagData, identifier, ItemOutcome().handler());
    }
}

TEST_F(MetadataTest, UnknownIdentifiersFailOnceWithNoSuchItem) {
    const HostPorterItemIdentifier unknown = "did=4242";
    ItemOutcome date, tags, rank;
    porter->setLastUsedDate(Date::make(1), unknown, date.handler());
    porter->setTagData(std::nullopt, unknown, tags.handler());
    porter->setFavoriteRank(Number::fromInt64(1), unknown, rank.handler());
    for (ItemOutcome* outcome : {&date, &tags, &rank}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_FALSE(outcome->item);
        expectNoSuchItem(outcome->error, unknown);
    }
    EXPECT_EQ(log->countStartingWith("[ERROR] can't find URL for item; "), 2u);
}

// The disk fills while metadata is written: every update fails with ENOSPC and the item keeps
// each old value, the desktop's copy of the tags included.
TEST_F(MetadataTest, OnAFullDiskEveryUpdateFailsAndTheOldValuesStand) {
    std::string file = writeFile(library + "/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    Url url = Url::fileURLWithPath(file);
    ItemOutcome before;
    porter->setTagData(GetTagsDataForTags({Tag::make("Old")}), identifier, before.handler());
    porter->setFavoriteRank(Number::fromInt64(1), identifier, before.handler());
    porter->setLastUsedDate(Date::make(100), identifier, before.handler());
    ASSERT_EQ(before.calls, 3);
    ASSERT_FALSE(before.error);
    auto desktopList = ReadXattrData(XdgTagList::attributeName(), url);
    ASSERT_TRUE(desktopList);

    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(faults);
    faults->inject(FaultInjectingFileSystem::Operation::Fsetxattr, ENOSPC, -1);
    ItemOutcome tags, rank, date;
    porter->setTagData(GetTagsDataForTags({Tag::make("New"), Tag::make("Newer")}), identifier,
                       tags.handler());
    porter->setFavoriteRank(Number::fromInt64(5), identifier, rank.handler());
    porter->setLastUsedDate(Date::make(200), identifier, date.handler());
    for (ItemOutcome* outcome : {&tags, &rank, &date}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_FALSE(outcome->item);
        ASSERT_TRUE(outcome->error);
        EXPECT_TRUE(outcome->error->is(kPosixErrorDomain, ENOSPC)) << outcome->error->description();
    }
    faults->clearInjections();

    EXPECT_EQ(ItemMetadata::readTagLabels(url), std::vector<std::string>{"Old"});
    EXPECT_EQ(ReadXattrData(XdgTagList::attributeName(), url), desktopList)
        << "the desktop's tags changed although the item's did not";
    ASSERT_TRUE(ItemMetadata::readFavoriteRank(url));
    EXPECT_EQ(ItemMetadata::readFavoriteRank(url)->int64Value(), 1);
    ASSERT_TRUE(ItemMetadata::readLastUsedDate(url));
    EXPECT_EQ(ItemMetadata::readLastUsedDate(url)->timeIntervalSince1970(), 100);
    // And the record the host gets next says the same.
    ItemOutcome after;
    porter->setFavoriteRank(Number::fromInt64(1), identifier, after.handler());
    ASSERT_TRUE(after.item) << after.error->description();
    ASSERT_TRUE(after.item->lastUsedDate());
    EXPECT_EQ(after.item->lastUsedDate()->timeIntervalSince1970(), 100);
}

TEST_F(MetadataTest, FailedWritesAreLoggedAndFailTheUpdate) {
    std::string file = writeFile(library + "/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    Url url = Url::fileURLWithPath(file);
    porter->setFavoriteRank(Number::fromInt64(1), identifier, ItemOutcome().handler());
    log->clear();

    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(faults);
    faults->inject(FaultInjectingFileSystem::Operation::Fsetxattr, ENOTSUP, -1);

    ItemOutcome date, tags, rank;
    porter->setLastUsedDate(Date::make(99), identifier, date.handler());
    porter->setTagData(GetTagsDataForTags({Tag::make("Work")}), identifier, tags.handler());
    porter->setFavoriteRank(Number::fromInt64(5), identifier, rank.handler());
    // The caller asked for a change that did not happen: it gets the cause, naming the item.
    for (ItemOutcome* outcome : {&date, &tags, &rank}) {
        EXPECT_EQ(outcome->calls, 1);
        EXPECT_FALSE(outcome->item);
        ASSERT_TRUE(outcome->error);
        EXPECT_TRUE(outcome->error->is(kPosixErrorDomain, ENOTSUP))
            << outcome->error->description();
        EXPECT_NE(outcome->error->reason().find(identifier), std::string::npos)
            << outcome->error->reason();
    }
    EXPECT_FALSE(ItemMetadata::readLastUsedDate(url));
    ASSERT_TRUE(ItemMetadata::readFavoriteRank(url));
    EXPECT_EQ(ItemMetadata::readFavoriteRank(url)->int64Value(), 1);
    EXPECT_EQ(faults->calls(FaultInjectingFileSystem::Operation::Fsetxattr), 3u);

    EXPECT_EQ(
        log->countStartingWith("[ERROR] can't set xattr " + LocalItem::xattrLastUsedDateName() +
                               " on " + url.absoluteString() + "; "),
        1u);
    EXPECT_EQ(log->countStartingWith("[ERROR] can't set xattr " + LocalItem::xattrTagDataName() +
                                     " on " + url.absoluteString() + "; "),
              1u);
    EXPECT_EQ(
        log->countStartingWith("[ERROR] can't set xattr " + LocalItem::xattrFavoriteRankName() +
                               " on " + url.absoluteString() + "; "),
        1u);
}

// The document-ID service as far as the journal's copy of metadata is concerned: which
// attributes of which file it was told were written.
class WriteRecordingStrata : public FakeStrataService {
public:
    void metadataAttributeWritten(int fd, const std::string& name,
                                  const std::optional<std::vector<uint8_t>>& value) override {
        struct stat st {};
        ASSERT_EQ(::fstat(fd, &st), 0);
        writes.push_back({st.st_ino, name, value.has_value()});
    }
    struct Write {
        uint64_t inode;
        std::string name;
        bool set;  // false: removed
        friend bool operator==(const Write&, const Write&) = default;
    };
    std::vector<Write> writes;
};

class MetadataJournalTest : public ProviderOperationsTest {
protected:
    MetadataJournalTest() { strata = recorder; }
    std::shared_ptr<WriteRecordingStrata> recorder = std::make_shared<WriteRecordingStrata>();
};

// Every path the provider writes metadata by (the three setters, trash and put-back, the
// by-path changes) ends in the one writer, so the journal's copy misses none of them: a write
// it did not hear of is lost at the next safe save.
TEST_F(MetadataJournalTest, EveryProviderMetadataWriteIsToldToTheJournal) {
    std::string file = writeFile(library + "/sub/a.txt");
    HostPorterItemIdentifier identifier = identifierOf(file);
    struct stat st {};
    ASSERT_EQ(::stat(file.c_str(), &st), 0);
    using Write = WriteRecordingStrata::Write;
    const uint64_t inode = st.st_ino;

    ItemOutcome tags, rank, date;
    porter->setTagData(GetTagsDataForTags({Tag::make("Work")}), identifier, tags.handler());
    porter->setFavoriteRank(Number::fromInt64(3), identifier, rank.handler());
    porter->setLastUsedDate(Date::make(50), identifier, date.handler());
    ASSERT_TRUE(tags.item && rank.item && date.item);
    LocalPorter::MetadataChanges changes;
    changes.favoriteRank = std::shared_ptr<const Number>();
    changes.tagData = Bytes();
    ASSERT_TRUE(LocalPorter::changeMetadataAtURL(Url::fileURLWithPath(file), changes).ok());
    EXPECT_EQ(recorder->writes,
              (std::vector<Write>{{inode, LocalItem::xattrTagDataName(), true},
                                  {inode, XdgTagList::attributeName(), true},
                                  {inode, XdgTagList::syncedAttributeName(), true},
                                  {inode, LocalItem::xattrFavoriteRankName(), true},
                                  {inode, LocalItem::xattrLastUsedDateName(), true},
                                  {inode, LocalItem::xattrFavoriteRankName(), false},
                                  {inode, LocalItem::xattrTagDataName(), true},
                                  {inode, XdgTagList::attributeName(), false},
                                  {inode, XdgTagList::syncedAttributeName(), false}}));
    auto after = LocalPorter::metadataAtURL(Url::fileURLWithPath(file));
    EXPECT_FALSE(after.favoriteRank);
    ASSERT_TRUE(after.tagLabels);
    EXPECT_TRUE(after.tagLabels->empty());
    ASSERT_TRUE(after.lastUsedDate);
    EXPECT_EQ(after.lastUsedDate->timeIntervalSince1970(), 50);

    recorder->writes.clear();
    ItemOutcome trashed;
    porter->trashItemWithIdentifier(identifier, trashed.handler());
    ASSERT_TRUE(trashed.item) << trashed.error->description();
    strata->publish(trashed.item->fileURL().path());
    ItemOutcome back;
    porter->untrashItemWithIdentifier(identifier, std::nullopt, back.handler());
    ASSERT_TRUE(back.item) << back.error->description();
    EXPECT_EQ(recorder->writes,
              (std::vector<Write>{{inode, LocalItem::xattrTrashDateName(), true},
                                  {inode, LocalItem::xattrTrashPutBackName(), true},
                                  {inode, LocalItem::xattrTrashDateName(), false}}));
}

}  // namespace
}  // namespace tamber
