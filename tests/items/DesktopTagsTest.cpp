#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "items/ItemMetadata.h"
#include "items/XdgTagList.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/Tag.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using Op = FaultInjectingFileSystem::Operation;
using Labels = std::vector<std::string>;
using Coloured = std::vector<std::pair<std::string, int64_t>>;

Bytes bytesOf(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

Coloured colouredOf(const XdgTagList::Tags& tags) {
    Coloured out;
    for (const auto& tag : tags) out.emplace_back(tag->label(), tag->colour());
    return out;
}

Bytes tagDataOf(const Coloured& tags) {
    XdgTagList::Tags list;
    for (const auto& [label, colour] : tags) list.push_back(Tag::make(label, colour));
    return GetTagsDataForTags(list);
}

TEST(XdgTagListTest, ParsingHostileListsGivesCleanLabels) {
    EXPECT_EQ(XdgTagList::parse(""), Labels{});
    EXPECT_EQ(XdgTagList::parse(",,, ,\t,"), Labels{});
    EXPECT_EQ(XdgTagList::parse(" work ,\thome\n,work,,Ünïcode 🏷"),
              (Labels{"work", "home", "Ünïcode 🏷"}));
    // Bytes that are not UTF-8, a NUL and control characters drop their entry, not the list.
    std::string hostile =
        "ok,\xff\xfe,a\x01"
        "b,";
    hostile += std::string("nul\0in", 6) + ",\xc3,fine";
    EXPECT_EQ(XdgTagList::parse(hostile), (Labels{"ok", "fine"}));
    // Too long an entry is dropped; too many entries stop at the limit.
    std::string longest(XdgTagList::kMaxLabelBytes, 'x');
    EXPECT_EQ(XdgTagList::parse(longest + "," + longest + "y,z"), (Labels{longest, "z"}));
    std::string huge;
    for (int i = 0; huge.size() < 64 * 1024; ++i) huge += "t" + std::to_string(i) + ",";
    Labels many = XdgTagList::parse(huge);
    ASSERT_EQ(many.size(), XdgTagList::kMaxTags);
    EXPECT_EQ(many.front(), "t0");
    EXPECT_EQ(many.back(), "t" + std::to_string(XdgTagList::kMaxTags - 1));
}

TEST(XdgTagListTest, FormattingLeavesOutWhatWouldNotReadBackUnchanged) {
    Labels labels{"Work", "a,b", " padded", "Home", "", "Work", "tab\there", "Travel ✈"};
    auto list = XdgTagList::format(labels);
    ASSERT_TRUE(list);
    EXPECT_EQ(std::string(list->begin(), list->end()), "Work,Home,Travel ✈");
    for (const auto& label : labels)
        EXPECT_EQ(XdgTagList::representable(label), XdgTagList::parse(label) == Labels{label})
            << label;
    // Nothing representable: no list at all, so the attribute is removed.
    EXPECT_FALSE(XdgTagList::format({"x,y", ""}));
    EXPECT_FALSE(XdgTagList::format({}));
}

TEST(XdgTagListTest, FingerprintsTellListsApart) {
    EXPECT_EQ(XdgTagList::fingerprint(bytesOf("a,b")), XdgTagList::fingerprint(bytesOf("a,b")));
    EXPECT_NE(XdgTagList::fingerprint(bytesOf("a,b")), XdgTagList::fingerprint(bytesOf("b,a")));
    EXPECT_NE(XdgTagList::fingerprint(bytesOf("")), XdgTagList::fingerprint(bytesOf(",")));
}

TEST(XdgTagListTest, MergingKeepsColoursAndWhatTheListCannotHold) {
    XdgTagList::Tags ours{Tag::make("Red", 6), Tag::make("a,b", 2), Tag::make("Gone", 3),
                          Tag::make("Plain", 0)};
    auto merged = XdgTagList::merged(ours, {"New", "Plain", "Red", "New"});
    EXPECT_EQ(colouredOf(merged), (Coloured{{"New", 0}, {"Plain", 0}, {"Red", 6}, {"a,b", 2}}));
    EXPECT_EQ(colouredOf(XdgTagList::merged(ours, {})), (Coloured{{"a,b", 2}}));
}

// A file with user attributes, on a fault-injecting file system; "another program" writes the
// desktop list through the same file system, as setfattr would.
class DesktopTagsTest : public ::testing::Test {
protected:
    void SetUp() override {
        path = dir.writeFile("doc.txt", "hello");
        file = Url::fileURLWithPath(path);
        if (::setxattr(path.c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
    }

    std::optional<std::string> attribute(const std::string& name) {
        ssize_t size = fs->lgetxattr(path, name, nullptr, 0);
        if (size < 0)
            return std::nullopt;
        std::string value(static_cast<size_t>(size), '\0');
        ssize_t got = fs->lgetxattr(path, name, value.data(), value.size());
        EXPECT_EQ(got, size);
        return value;
    }

    void setByAnotherProgram(const std::optional<std::string>& value) {
        int fd = fs->open(path, O_RDONLY | O_CLOEXEC, 0);
        ASSERT_GE(fd, 0);
        int rc = value ? fs->fsetxattr(fd, "xdg.tags", value->data(), value->size(), 0)
                       : fs->fremovexattr(fd, "xdg.tags");
        fs->close(fd);
        ASSERT_EQ(rc, 0);
    }

    Coloured recordTags() {
        ItemMetadata m = ItemMetadata::read(file);
        if (!m.tagData)
            return {};
        auto tags = GetTagsFromTagsData(*m.tagData);
        EXPECT_TRUE(tags);
        EXPECT_EQ(m.tagLabels, ItemMetadata::readTagLabels(file));
        return tags ? colouredOf(*tags) : Coloured{};
    }

    Coloured storedTags() {
        return colouredOf(ItemMetadata::readTags(file).value_or(XdgTagList::Tags{}));
    }

    testing::TempDir dir;
    std::string path;
    Url file;
    std::shared_ptr<FaultInjectingFileSystem> fs =
        std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped{fs};
};

TEST_F(DesktopTagsTest, SettingTagsWritesTheDesktopListAndClearingRemovesIt) {
    ASSERT_TRUE(
        ItemMetadata::writeTagData(file, tagDataOf({{"Work", 4}, {"a,b", 0}, {"Home", 0}})).ok());
    EXPECT_EQ(attribute("xdg.tags"), "Work,Home");
    // Tamber's own attribute keeps every label, the comma label too; colours are not stored.
    EXPECT_EQ(storedTags(), (Coloured{{"Work", 0}, {"a,b", 0}, {"Home", 0}}));
    EXPECT_EQ(recordTags(), storedTags());

    ASSERT_TRUE(ItemMetadata::writeTagData(file, std::nullopt).ok());
    EXPECT_EQ(attribute("xdg.tags"), std::nullopt);
    EXPECT_EQ(recordTags(), Coloured{});
}

TEST_F(DesktopTagsTest, AnotherProgramsListBecomesTheTagsKeepingWhatItCannotHold) {
    ASSERT_TRUE(
        ItemMetadata::writeTagData(file, tagDataOf({{"Red", 6}, {"Old", 2}, {"x,y", 5}})).ok());
    setByAnotherProgram("Red, Fresh ,,Red");
    EXPECT_EQ(recordTags(), (Coloured{{"Red", 0}, {"Fresh", 0}, {"x,y", 0}}));
    // Written to Tamber's attribute, not just shown; the foreign list keeps its own spelling.
    EXPECT_EQ(storedTags(), (Coloured{{"Red", 0}, {"Fresh", 0}, {"x,y", 0}}));
    EXPECT_EQ(attribute("xdg.tags"), "Red, Fresh ,,Red");

    setByAnotherProgram(std::nullopt);
    EXPECT_EQ(recordTags(), (Coloured{{"x,y", 0}}));
    EXPECT_EQ(storedTags(), (Coloured{{"x,y", 0}}));
}

TEST_F(DesktopTagsTest, AListSetBeforeTamberEverTaggedIsTakenIn) {
    setByAnotherProgram("from desktop");
    EXPECT_EQ(recordTags(), (Coloured{{"from desktop", 0}}));
    EXPECT_EQ(storedTags(), (Coloured{{"from desktop", 0}}));
}

// A list that holds no label, on a file Tamber never tagged, leaves it untagged: the record
// says the same on the read that takes the list in and on every read after.
TEST_F(DesktopTagsTest, AnEmptyForeignListGivesTheSameRecordOnEveryRead) {
    setByAnotherProgram(" , ");
    std::optional<Bytes> first = ItemMetadata::read(file).tagData;
    std::optional<Bytes> second = ItemMetadata::read(file).tagData;
    EXPECT_EQ(first, second);
    EXPECT_EQ(first, std::nullopt);
}

TEST_F(DesktopTagsTest, TagsFromBeforeTheDesktopListAreNotTakenForARemoval) {
    // Tamber's attribute alone, as files tagged by earlier versions have it.
    ASSERT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"Kept", 0}})).ok());
    int fd = fs->open(path, O_RDONLY | O_CLOEXEC, 0);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(fs->fremovexattr(fd, "xdg.tags"), 0);
    ASSERT_EQ(fs->fremovexattr(fd, XdgTagList::syncedAttributeName()), 0);
    fs->close(fd);
    EXPECT_EQ(recordTags(), (Coloured{{"Kept", 0}}));
    EXPECT_EQ(storedTags(), (Coloured{{"Kept", 0}}));
}

TEST_F(DesktopTagsTest, OurOwnWritesAreNeverReadBackAsChanges) {
    ASSERT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"One", 1}, {"Two", 0}})).ok());
    fs->resetCalls();
    for (int i = 0; i < 3; ++i) EXPECT_EQ(recordTags(), (Coloured{{"One", 0}, {"Two", 0}}));
    EXPECT_EQ(fs->calls(Op::Fsetxattr) + fs->calls(Op::Fremovexattr), 0u);

    // A foreign change is taken in once: Tamber's attribute and the note, then quiet again.
    setByAnotherProgram("Two,Three");
    fs->resetCalls();
    EXPECT_EQ(recordTags(), (Coloured{{"Two", 0}, {"Three", 0}}));
    EXPECT_EQ(fs->calls(Op::Fsetxattr), 2u);
    fs->resetCalls();
    for (int i = 0; i < 3; ++i) EXPECT_EQ(recordTags(), (Coloured{{"Two", 0}, {"Three", 0}}));
    EXPECT_EQ(fs->calls(Op::Fsetxattr) + fs->calls(Op::Fremovexattr), 0u);
}

// Refuses to write the desktop list, as a file system without room for it would.
class RefusingDesktopList : public FaultInjectingFileSystem {
public:
    using FaultInjectingFileSystem::FaultInjectingFileSystem;
    int fsetxattr(int fd, const std::string& name, const void* value, size_t size,
                  int flags) override {
        if (name == "xdg.tags") {
            errno = ENOSPC;
            return -1;
        }
        return FaultInjectingFileSystem::fsetxattr(fd, name, value, size, flags);
    }
};

TEST_F(DesktopTagsTest, AFailedDesktopWriteIsLoggedOnceAndTheTagsStand) {
    ASSERT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"Before", 0}})).ok());
    auto refusing = std::make_shared<RefusingDesktopList>(std::make_shared<LinuxFileSystem>());
    {
        testing::ScopedFileSystem refused(refusing);
        testing::ScopedLogCapture log;
        EXPECT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"After", 3}})).ok());
        std::vector<std::string> errors;
        for (const auto& line : log->texts())
            if (line.find("xdg.tags") != std::string::npos)
                errors.push_back(line);
        EXPECT_EQ(errors.size(), 1u);
    }
    EXPECT_EQ(attribute("xdg.tags"), "Before");
    // The stale list is not taken for another program's change.
    EXPECT_EQ(recordTags(), (Coloured{{"After", 0}}));
    EXPECT_EQ(storedTags(), (Coloured{{"After", 0}}));
    // The next write that works brings the list back in step.
    ASSERT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"After", 3}, {"More", 0}})).ok());
    EXPECT_EQ(attribute("xdg.tags"), "After,More");
}

// Another program rewrites the list while Tamber is taking in the previous one: after Tamber read
// it, before Tamber notes it as taken in.
class RewritesDuringTakeIn : public FaultInjectingFileSystem {
public:
    using FaultInjectingFileSystem::FaultInjectingFileSystem;
    int fsetxattr(int fd, const std::string& name, const void* value, size_t size,
                  int flags) override {
        if (name == XdgTagList::syncedAttributeName() && !rewritten) {
            rewritten = true;
            std::string later = "Later";
            FaultInjectingFileSystem::fsetxattr(fd, "xdg.tags", later.data(), later.size(), 0);
        }
        return FaultInjectingFileSystem::fsetxattr(fd, name, value, size, flags);
    }
    bool rewritten = false;
};

TEST_F(DesktopTagsTest, AChangeMadeWhileTakingInIsNotLost) {
    setByAnotherProgram("Earlier");
    auto racing = std::make_shared<RewritesDuringTakeIn>(std::make_shared<LinuxFileSystem>());
    {
        testing::ScopedFileSystem scopedRacing(racing);
        EXPECT_EQ(recordTags(), (Coloured{{"Earlier", 0}}));
        ASSERT_TRUE(racing->rewritten);
    }
    EXPECT_EQ(recordTags(), (Coloured{{"Later", 0}}));
    EXPECT_EQ(storedTags(), (Coloured{{"Later", 0}}));
}

TEST_F(DesktopTagsTest, HostileListsNeverBreakTheRecord) {
    ASSERT_TRUE(ItemMetadata::writeTagData(file, tagDataOf({{"Blue", 4}})).ok());
    std::string hostile =
        "\xff\xfe,,  ,Blue,\xe2\x80\xae"
        "rtl";
    hostile += std::string(",\0zero", 6);
    setByAnotherProgram(hostile);
    EXPECT_EQ(recordTags(), (Coloured{{"Blue", 0},
                                      {"\xe2\x80\xae"
                                       "rtl",
                                       0}}));

    std::string big;
    for (int i = 0; big.size() < 64 * 1024; ++i) big += " tag" + std::to_string(i) + " ,";
    int fd = fs->open(path, O_RDONLY | O_CLOEXEC, 0);
    ASSERT_GE(fd, 0);
    bool stored = fs->fsetxattr(fd, "xdg.tags", big.data(), big.size(), 0) == 0;
    fs->close(fd);
    if (!stored) {
        // Refused by the file system (most hold no value this big): the record stands.
        EXPECT_EQ(recordTags(), (Coloured{{"Blue", 0},
                                          {"\xe2\x80\xae"
                                           "rtl",
                                           0}}));
        return;
    }
    Coloured tags = recordTags();
    ASSERT_EQ(tags.size(), XdgTagList::kMaxTags);
    EXPECT_EQ(tags.front(), (std::pair<std::string, int64_t>{"tag0", 0}));
}

}  // namespace
}  // namespace tamber
