#include <gtest/gtest.h>

#include <string>

#include "host/ItemIdentifier.h"

namespace tamber {
namespace {

using Kind = ItemIdentifier::Kind;

// The forms the host sees ("fid=N", "did=N") give their numbers back, at the edges of the range.
TEST(ItemIdentifierTest, TheFormsTheProgramBuildsParseBack) {
    for (uint64_t n : {uint64_t{0}, uint64_t{1}, uint64_t{4294967296}, UINT64_MAX}) {
        auto file = ItemIdentifier::parse("fid=" + std::to_string(n));
        EXPECT_EQ(file.kind(), Kind::File) << n;
        EXPECT_EQ(file.number(), n);
        auto document = ItemIdentifier::parse("did=" + std::to_string(n));
        EXPECT_EQ(document.kind(), Kind::Document) << n;
        EXPECT_EQ(document.number(), n);
        EXPECT_FALSE(file.isContainer() || file.isAppLibrary() || document.isAppLibrary());
    }
    auto library = ItemIdentifier::parse("#com.example.notes");
    EXPECT_EQ(library.kind(), Kind::AppLibrary);
    EXPECT_TRUE(library.isAppLibrary());
    EXPECT_EQ(library.bundleIdentifier(), "com.example.notes");
    EXPECT_EQ(library.number(), 0u);

    EXPECT_EQ(ItemIdentifier::parse(HostPorterRootContainerItemIdentifier).kind(),
              Kind::RootContainer);
    EXPECT_EQ(ItemIdentifier::parse(HostPorterWorkingSetContainerItemIdentifier).kind(),
              Kind::WorkingSet);
    EXPECT_EQ(ItemIdentifier::parse(HostPorterAllDirectoriesContainerItemIdentifier).kind(),
              Kind::AllDirectories);
    EXPECT_EQ(ItemIdentifier::parse(HostPorterTemporaryLocalFolderItemIdentifier).kind(),
              Kind::TemporaryFolder);
    for (const auto& container :
         {HostPorterRootContainerItemIdentifier, HostPorterWorkingSetContainerItemIdentifier,
          HostPorterAllDirectoriesContainerItemIdentifier,
          HostPorterTemporaryLocalFolderItemIdentifier})
        EXPECT_TRUE(ItemIdentifier::parse(container).isContainer()) << container;
}

// A string that is almost a form names nothing: not the item of a prefix, not a number that
// wrapped, not a library with an empty or truncated name.
TEST(ItemIdentifierTest, HostileStringsAreInvalid) {
    std::string longDigits = "fid=" + std::string(100'000, '9');
    std::string longJunk(1 << 20, '#');
    longJunk[1] = '\0';
    const std::string hostile[] = {
        "",
        "fid=",
        "did=",
        "fid=-1",
        "fid=+1",
        "fid= 1",
        "fid=1 ",
        "fid=18446744073709551616",  // one past 64 bits
        "did=99999999999999999999999",
        "did=1x",
        "fid=0x10",
        "fid=04",  // another spelling of "fid=4": one item, one identifier
        "did=00",
        "fid=1=2",
        "FID=1",
        "fid",
        "xid=5",
        "=5",
        "#",
        std::string("fid=1\0", 6),
        std::string("fid=1\0"
                    "2",
                    7),
        std::string("#com.example\0evil", 17),
        std::string("\0fid=1", 6),
        "HostPorterRootContainerItemIdentifierX",
        " HostPorterRootContainerItemIdentifier",
        longDigits,
        longJunk,
    };
    for (const std::string& text : hostile) {
        auto parsed = ItemIdentifier::parse(text);
        EXPECT_EQ(parsed.kind(), Kind::Invalid) << text.substr(0, 40);
        EXPECT_FALSE(parsed.isValid());
        EXPECT_FALSE(parsed.isContainer() || parsed.isAppLibrary());
        EXPECT_EQ(parsed.number(), 0u);
        EXPECT_TRUE(parsed.bundleIdentifier().empty());
    }
    // A very long but well-formed library name is still just a name.
    std::string longBundle = "#" + std::string(100'000, 'a');
    EXPECT_EQ(ItemIdentifier::parse(longBundle).bundleIdentifier().size(), 100'000u);
}

}  // namespace
}  // namespace tamber
