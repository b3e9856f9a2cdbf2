#include "items/ExtendedAttributes.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <set>
#include <vector>

#include "items/ItemMetadata.h"
#include "items/LocalItem.h"
#include "items/XdgTagList.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/Tag.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/Array.h"
#include "platform/strata/DocumentAttributes.h"
#include "platform/strata/StrataService.h"
#include "tests/common/FakeStrataService.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::ScopedLogCapture;
using Op = FaultInjectingFileSystem::Operation;

const std::string kName = "com.velk.test#PS";

// A file that takes user attributes, on a fault-injecting file system.
class ExtendedAttributesTest : public ::testing::Test {
protected:
    void SetUp() override {
        file = Url::fileURLWithPath(dir.writeFile("doc.txt", "hello"));
        if (::setxattr(file.path().c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
    }

    void store(const std::string& name, const ObjectRef& object) {
        auto data = KeyedArchiver::archivedDataWithRootObject(object);
        ASSERT_TRUE(data.ok());
        ASSERT_TRUE(ItemMetadata::writeAttributeData(file, name, data.value()).ok());
    }

    testing::TempDir dir;
    Url file;
    std::shared_ptr<FaultInjectingFileSystem> fs =
        std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped{fs};
};

TEST_F(ExtendedAttributesTest, RoundTripAndMissingAttributesAreSilent) {
    ScopedLogCapture log;
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    Bytes value{0, 1, 2, 0xff, 0};
    ASSERT_TRUE(ItemMetadata::writeAttributeData(file, kName, value).ok());
    EXPECT_EQ(ReadXattrData(kName, file), value);
    char raw[16];  // stored in the user namespace under the same name
    EXPECT_EQ(::getxattr(file.path().c_str(), ("user." + kName).c_str(), raw, sizeof raw), 5);
    ASSERT_TRUE(ItemMetadata::writeAttributeData(file, kName, std::nullopt).ok());
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    EXPECT_TRUE(ItemMetadata::writeAttributeData(file, kName, std::nullopt).ok());
    EXPECT_TRUE(log->lines().empty());
}

TEST_F(ExtendedAttributesTest, ReadFailureLevels) {
    {
        ScopedLogCapture log;
        EXPECT_FALSE(ReadXattrData(kName, Url::fileURLWithPath(dir / "gone.txt")).has_value());
        ASSERT_EQ(log->texts(), std::vector<std::string>{"[DEBUG] can't get xattr " + kName + "; " +
                                                         Error::posix(ENOENT).description()});
        EXPECT_EQ(log->lines()[0].level, LogLevel::Debug);
    }
    ScopedLogCapture log;
    fs->inject(Op::Lgetxattr, EIO);
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    EXPECT_EQ(
        log->count("[ERROR] can't get xattr " + kName + "; " + Error::posix(EIO).description(),
                   LogLevel::Error),
        1u);
}

TEST_F(ExtendedAttributesTest, RefusedSetIsDebugOtherFailuresAreErrors) {
    int fd = ::open(file.path().c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    struct Case {
        Op op;
        int error;
        std::string line;
    };
    for (const auto& c : std::vector<Case>{
             {Op::Fsetxattr, EACCES, "[DEBUG] can't set xattr \""},
             {Op::Fsetxattr, ENOSPC, "[ERROR] can't set xattr \""},
             {Op::Fremovexattr, EACCES, "[DEBUG] can't remove xattr \""},
             {Op::Fremovexattr, EIO, "[ERROR] can't remove xattr \""},
         }) {
        ScopedLogCapture log;
        fs->inject(c.op, c.error);
        auto data = c.op == Op::Fsetxattr ? std::optional(Bytes{1}) : std::nullopt;
        Status status = SetOrRemoveXattr(fd, data, kName);
        ASSERT_FALSE(status.ok()) << c.line;
        EXPECT_EQ(status.error(), Error::posix(c.error));
        EXPECT_EQ(log->texts(), std::vector<std::string>{c.line + kName + "\"; " +
                                                         Error::posix(c.error).description()});
    }
    ::close(fd);
}

TEST_F(ExtendedAttributesTest, MetadataReadsBackAndOnlyNothingRemovesIt) {
    ASSERT_TRUE(ItemMetadata::writeTagData(
                    file, GetTagsDataForTags({Tag::make("Red", 6), Tag::make("Home", 0)}))
                    .ok());
    ASSERT_TRUE(ItemMetadata::writeLastUsedDate(file, Date::make(1700000000.25)).ok());
    ASSERT_TRUE(ItemMetadata::writeFavoriteRank(file, Number::fromInt64(-3)).ok());
    ItemMetadata m = ItemMetadata::read(file);
    ASSERT_TRUE(m.lastUsedDate && m.favoriteRank && m.tagData);
    EXPECT_EQ(m.lastUsedDate->timeIntervalSince1970(), 1700000000.25);
    EXPECT_EQ(m.favoriteRank->int64Value(), -3);
    // Tags are stored as labels: colours are dropped, order is kept.
    EXPECT_EQ(m.tagLabels, (std::vector<std::string>{"Red", "Home"}));
    auto tags = GetTagsFromTagsData(*m.tagData);
    ASSERT_TRUE(tags && tags->size() == 2);
    EXPECT_EQ((*tags)[0]->colour(), 0);
    EXPECT_EQ((*tags)[1]->colour(), 0);

    ASSERT_TRUE(ItemMetadata::writeLastUsedDate(file, nullptr).ok());
    ASSERT_TRUE(ItemMetadata::writeFavoriteRank(file, nullptr).ok());
    // Garbage tag data writes an empty list, never removes.
    ASSERT_TRUE(ItemMetadata::writeTagData(file, Bytes{1, 2}).ok());
    m = ItemMetadata::read(file);
    EXPECT_FALSE(m.lastUsedDate || m.favoriteRank);
    EXPECT_TRUE(ReadXattrData(LocalItem::xattrTagDataName(), file).has_value());
    EXPECT_EQ(ItemMetadata::readTagLabels(file), std::vector<std::string>{});
}

TEST_F(ExtendedAttributesTest, ValuesOfTheWrongClassOrGarbageReadAsAbsent) {
    store(LocalItem::xattrLastUsedDateName(), String::make("yesterday"));
    store(LocalItem::xattrFavoriteRankName(), Date::make(1));
    store(LocalItem::xattrTagDataName(), Array::make({Number::fromInt64(1)}));
    ASSERT_TRUE(ItemMetadata::writeAttributeData(file, LocalItem::xattrTrashPutBackName(),
                                                 Bytes{'b', 'p', 'l', 'i', 's', 't'})
                    .ok());
    ItemMetadata m = ItemMetadata::read(file);
    EXPECT_FALSE(m.lastUsedDate || m.favoriteRank || m.putBack);
    EXPECT_FALSE(m.tagLabels.has_value() || m.tagData.has_value());

    store(LocalItem::xattrTrashDateName(), String::make("not a date"));
    ScopedLogCapture log;
    EXPECT_FALSE(ItemMetadata::readTrashDate(file));
    ASSERT_EQ(log->lines().size(), 1u);
    EXPECT_EQ(log->lines()[0].level, LogLevel::Error);
    EXPECT_EQ(log->countStartingWith("[ERROR] got "), 1u);
    EXPECT_NE(log->lines()[0].text.find("invalidResultingClass"), std::string::npos);
}

// What the document-ID service was told about Tamber's own attribute writes.
class RecordingStrataService : public testing::FakeStrataService {
public:
    struct Write {
        uint64_t inode;
        std::string name;
        std::optional<std::vector<uint8_t>> value;
        friend bool operator==(const Write&, const Write&) = default;
    };
    void metadataAttributeWritten(int fd, const std::string& name,
                                  const std::optional<std::vector<uint8_t>>& value) override {
        struct stat st {};
        ASSERT_EQ(::fstat(fd, &st), 0) << "told with a live descriptor";
        writes.push_back({st.st_ino, name, value});
    }
    std::vector<Write> writes;
};

TEST_F(ExtendedAttributesTest, TheDocumentIdServiceHearsOfEveryWriteThatHappened) {
    auto strata = std::make_shared<RecordingStrataService>();
    auto previous = StrataService::setCurrent(strata);
    struct stat st {};
    ASSERT_EQ(::stat(file.path().c_str(), &st), 0);
    const std::string& tags = LocalItem::xattrTagDataName();
    Bytes value{1, 2, 3};
    EXPECT_TRUE(ItemMetadata::writeAttributeData(file, tags, value).ok());
    EXPECT_TRUE(ItemMetadata::writeAttributeData(file, tags, std::nullopt).ok());
    EXPECT_TRUE(ItemMetadata::writeAttributeData(file, tags, std::nullopt)
                    .ok());  // not there: still a removal
    {
        ScopedLogCapture quiet;
        fs->inject(Op::Fsetxattr, ENOSPC);
        EXPECT_FALSE(ItemMetadata::writeAttributeData(file, tags, value).ok());
        fs->inject(Op::Fremovexattr, EACCES);
        EXPECT_FALSE(ItemMetadata::writeAttributeData(file, tags, std::nullopt).ok());
    }
    StrataService::setCurrent(previous);
    using Write = RecordingStrataService::Write;
    EXPECT_EQ(strata->writes, (std::vector<Write>{{st.st_ino, tags, value},
                                                  {st.st_ino, tags, std::nullopt},
                                                  {st.st_ino, tags, std::nullopt}}));
}

// The journal keeps copies of exactly the attributes that items keep their metadata in.
TEST(DocumentAttributeNamesTest, AreTheFiveMetadataAttributesAndTheDesktopTagList) {
    std::set<std::string> items{LocalItem::xattrLastUsedDateName(), LocalItem::xattrTagDataName(),
                                LocalItem::xattrFavoriteRankName(), LocalItem::xattrTrashDateName(),
                                LocalItem::xattrTrashPutBackName(), XdgTagList::attributeName(),
                                XdgTagList::syncedAttributeName()};
    const auto& kept = DocumentAttributes::names();
    EXPECT_EQ(std::set<std::string>(kept.begin(), kept.end()), items);
    EXPECT_EQ(kept.size(), items.size());
    EXPECT_FALSE(DocumentAttributes::isKept("com.velk.other"));
}

}  // namespace
}  // namespace tamber
