#include "items/ItemMetadata.h"

#include <gtest/gtest.h>
#include <sys/xattr.h>

#include "items/ExtendedAttributes.h"
#include "items/LocalItem.h"
#include "items/ResourceValueGetter.h"
#include "items/UnarchiveLogged.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/Tag.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/Array.h"
#include "platform/objects/Dictionary.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::ScopedFileSystem;
using testing::ScopedLogCapture;
using testing::TempDir;

Bytes archive(const ObjectRef& object) {
    auto data = KeyedArchiver::archivedDataWithRootObject(object);
    EXPECT_TRUE(data.ok());
    return data.ok() ? data.value() : Bytes{};
}

class ItemMetadataTest : public ::testing::Test {
protected:
    void SetUp() override {
        file = Url::fileURLWithPath(dir.writeFile("doc.txt", "hello"));
        if (::setxattr(file.path().c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
        ::removexattr(file.path().c_str(), "user.probe");
    }
    void store(const std::string& name, const Bytes& bytes) {
        ASSERT_FALSE(WriteXattrAtURL(file, bytes, name).has_value());
    }

    TempDir dir;
    Url file;
};

TEST_F(ItemMetadataTest, ThreeStoredLabelsBecomeThreeUncolouredTagsInOrder) {
    store(
        LocalItem::xattrTagDataName(),
        archive(Array::make({String::make("Work"), String::make("Ünïcode"), String::make("a,b")})));
    ItemMetadata m = ItemMetadata::read(file);
    ASSERT_TRUE(m.tagData.has_value());
    auto tags = GetTagsFromTagsData(*m.tagData);
    ASSERT_TRUE(tags.has_value());
    ASSERT_EQ(tags->size(), 3u);
    EXPECT_EQ((*tags)[0]->label(), "Work");
    EXPECT_EQ((*tags)[1]->label(), "Ünïcode");
    EXPECT_EQ((*tags)[2]->label(), "a,b");
    for (const auto& t : *tags) EXPECT_EQ(t->colour(), 0);
}

TEST_F(ItemMetadataTest, TagsAreStoredAsArchivedLabelsAndColoursAreDropped) {
    Bytes tagData = GetTagsDataForTags({Tag::make("Red", 6), Tag::make("Home", 0)});
    ASSERT_FALSE(ItemMetadata::writeTagData(file, tagData).has_value());
    // The attribute holds an archive of the labels, not the tag data itself.
    auto raw = ReadXattrData(LocalItem::xattrTagDataName(), file);
    ASSERT_TRUE(raw.has_value());
    EXPECT_NE(*raw, tagData);
    EXPECT_EQ(ItemMetadata::readTagLabels(file), (std::vector<std::string>{"Red", "Home"}));
}

TEST_F(ItemMetadataTest, AbsentOrGarbageTagDataWritesAnEmptyListNeverRemoves) {
    ASSERT_FALSE(ItemMetadata::writeTagData(file, ItemMetadata::tagDataForLabels({"x"})));
    for (const std::optional<Bytes>& input : {std::optional<Bytes>(), std::optional(Bytes{1, 2})}) {
        ASSERT_FALSE(ItemMetadata::writeTagData(file, input).has_value());
        EXPECT_TRUE(ReadXattrData(LocalItem::xattrTagDataName(), file).has_value());
        EXPECT_EQ(ItemMetadata::readTagLabels(file), std::vector<std::string>{});
    }
}

TEST_F(ItemMetadataTest, NothingRemovesDateRankAndTrashDate) {
    ASSERT_FALSE(ItemMetadata::writeLastUsedDate(file, Date::make(1700000000.25)));
    ASSERT_FALSE(ItemMetadata::writeFavoriteRank(file, Number::fromInt64(-3)));
    ASSERT_FALSE(ItemMetadata::writeTrashDate(file, Date::make(42)));
    ASSERT_FALSE(ItemMetadata::writePutBack(file, String::make("Documents/a/b.txt")));

    ItemMetadata m = ItemMetadata::read(file);
    ASSERT_TRUE(m.lastUsedDate && m.favoriteRank && m.trashDate && m.putBack);
    EXPECT_EQ(m.lastUsedDate->timeIntervalSince1970(), 1700000000.25);
    EXPECT_EQ(m.favoriteRank->int64Value(), -3);
    EXPECT_EQ(m.favoriteRank->kind(), Number::Kind::Signed);
    EXPECT_EQ(m.trashDate->timeIntervalSince1970(), 42);
    EXPECT_EQ(m.putBack->value(), "Documents/a/b.txt");

    ASSERT_FALSE(ItemMetadata::writeLastUsedDate(file, nullptr));
    ASSERT_FALSE(ItemMetadata::writeFavoriteRank(file, nullptr));
    ASSERT_FALSE(ItemMetadata::writeTrashDate(file, nullptr));
    for (const auto& name : {LocalItem::xattrLastUsedDateName(), LocalItem::xattrFavoriteRankName(),
                             LocalItem::xattrTrashDateName()})
        EXPECT_FALSE(ReadXattrData(name, file).has_value()) << name;
    EXPECT_TRUE(ItemMetadata::read(file).putBack);
}

TEST_F(ItemMetadataTest, ValuesOfTheWrongClassReadAsAbsent) {
    store(LocalItem::xattrLastUsedDateName(), archive(String::make("yesterday")));
    store(LocalItem::xattrFavoriteRankName(), archive(Date::make(1)));
    store(LocalItem::xattrTagDataName(), archive(Array::make({Number::fromInt64(1)})));
    store(LocalItem::xattrTrashPutBackName(), Bytes{'b', 'p', 'l', 'i', 's', 't'});
    ItemMetadata m = ItemMetadata::read(file);
    EXPECT_FALSE(m.lastUsedDate);
    EXPECT_FALSE(m.favoriteRank);
    EXPECT_FALSE(m.tagLabels.has_value());
    EXPECT_FALSE(m.tagData.has_value());
    EXPECT_FALSE(m.putBack);
}

TEST_F(ItemMetadataTest, TrashDateHoldingAStringLogsOneGotLine) {
    store(LocalItem::xattrTrashDateName(), archive(String::make("not a date")));
    ScopedLogCapture log;
    EXPECT_FALSE(ItemMetadata::readTrashDate(file));
    ASSERT_EQ(log->lines().size(), 1u);
    EXPECT_EQ(log->lines()[0].level, LogLevel::Error);
    EXPECT_EQ(log->countStartingWith("[ERROR] got "), 1u);
    EXPECT_NE(log->lines()[0].text.find("invalidResultingClass"), std::string::npos);
}

TEST_F(ItemMetadataTest, ListingFirstGivesTheSameResultAsReadingEachAttribute) {
    ASSERT_FALSE(ItemMetadata::writeLastUsedDate(file, Date::make(5)));
    ASSERT_FALSE(ItemMetadata::writeTagData(file, ItemMetadata::tagDataForLabels({"a", "b"})));
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(fs);
    using Op = FaultInjectingFileSystem::Operation;

    ItemMetadata listed = ItemMetadata::read(file);
    size_t readsWithListing = fs->calls(Op::Lgetxattr);
    fs->inject(Op::Llistxattr, ENOTSUP, -1);
    fs->resetCalls();
    ItemMetadata oneByOne = ItemMetadata::read(file);

    EXPECT_LT(readsWithListing, fs->calls(Op::Lgetxattr));
    for (const ItemMetadata* m : {&listed, &oneByOne}) {
        ASSERT_TRUE(m->lastUsedDate);
        EXPECT_EQ(m->lastUsedDate->timeIntervalSince1970(), 5);
        EXPECT_EQ(m->tagLabels, (std::vector<std::string>{"a", "b"}));
        EXPECT_FALSE(m->favoriteRank);
    }
}

TEST_F(ItemMetadataTest, ItemWithoutMetadataCostsOneListing) {
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(fs);
    using Op = FaultInjectingFileSystem::Operation;
    ItemMetadata m = ItemMetadata::read(file);
    EXPECT_FALSE(m.lastUsedDate || m.favoriteRank || m.trashDate || m.putBack || m.tagData);
    EXPECT_EQ(fs->calls(Op::Llistxattr), 1u);
    EXPECT_EQ(fs->calls(Op::Lgetxattr), 0u);
}

TEST(UnarchiveLoggedTest, EmptyDataIsSilentGarbageIsLogged) {
    ScopedLogCapture log;
    EXPECT_FALSE(UnarchiveLogged<Date>(Bytes{}));
    EXPECT_TRUE(log->lines().empty());

    Bytes garbage{0xde, 0xad, 0xbe, 0xef};
    EXPECT_FALSE(UnarchiveLogged<Dictionary>(garbage));
    ASSERT_EQ(log->lines().size(), 1u);
    const std::string line = log->lines()[0].text;
    EXPECT_EQ(line.rfind("[ERROR] got ", 0), 0u);
    EXPECT_NE(line.find(" while unarchiving object from " + describeBytes(garbage)),
              std::string::npos);
}

TEST(UnarchiveLoggedTest, DictionaryRoundTrip) {
    auto dict = Dictionary::make({{"k", Number::fromUInt64(7)}, {"s", String::make("v")}});
    auto back = UnarchiveLogged<Dictionary>(archive(dict));
    ASSERT_TRUE(back);
    EXPECT_TRUE(back->isEqual(*dict));
}

TEST(ResourceValueGetterTest, FailureIsLoggedAndAbsentWrongClassIsAbsent) {
    TempDir dir;
    Url gone = Url::fileURLWithPath(dir / "gone");
    ScopedLogCapture log;
    EXPECT_FALSE(ResourceValueGetter<Number>(gone, ResourceKeys::kFileSize));
    ASSERT_EQ(log->lines().size(), 1u);
    EXPECT_EQ(log->lines()[0].text.rfind("[ERROR] can't get resource \"HostURLFileSizeKey\" for " +
                                             gone.absoluteString() + "; ",
                                         0),
              0u);

    Url present = Url::fileURLWithPath(dir.writeFile("f", "abc"));
    auto size = ResourceValueGetter<Number>(present, ResourceKeys::kFileSize);
    ASSERT_TRUE(size);
    EXPECT_EQ(size->uint64Value(), 3u);
    EXPECT_FALSE(ResourceValueGetter<Date>(present, ResourceKeys::kFileSize));
}

}  // namespace
}  // namespace tamber
