#include "platform/Url.h"
#include "platform/UrlPath.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

namespace tamber {
namespace {

TEST(UrlPathTest, PathsAreStandardisedLexicallyAndRelativeOnesResolveAgainstTheWorkingDirectory) {
    const std::pair<const char*, const char*> cases[] = {
        {"//", "/"},        {"/a//b///c", "/a/b/c"},      {"/a/./b/.", "/a/b"},
        {"/a/b/", "/a/b"},  {"/a/b/../c", "/a/c"},        {"/a/b/../../..", "/"},
        {"/../../x", "/x"}, {"/a/..b/c..", "/a/..b/c.."}, {"/a/b/c/../../d/./e//", "/a/d/e"},
    };
    for (const auto& [input, expected] : cases)
        EXPECT_EQ(Url::fileURLWithPath(input).path(), expected) << input;

    char* reported = ::getcwd(nullptr, 0);
    ASSERT_NE(reported, nullptr);
    std::string here = reported;
    ::free(reported);
    EXPECT_EQ(Url::fileURLWithPath("./a//b/").path(), (here == "/" ? "" : here) + "/a/b");
    EXPECT_EQ(Url::fileURLWithPath("../x").path(), here.substr(0, here.rfind('/')) + "/x");
    EXPECT_EQ(Url::fileURLWithPath("").path(), here);
}

TEST(UrlPathTest, ParseAndAbsoluteStringRoundTrip) {
    for (const std::string path : {"/with space/and%percent", "/caf\xC3\xA9/\xE6\x97\xA5.lumen",
                                   "/q?uestion/h#ash", "/sub-delims!$&'()*+,;=:@~_"}) {
        Url url = Url::fileURLWithPath(path);
        std::string text = url.absoluteString();
        EXPECT_TRUE(text.starts_with("file:///")) << text;
        for (unsigned char c : text) EXPECT_TRUE(c > 0x20 && c < 0x7F) << "unencoded in " << text;
        std::optional<Url> parsed = Url::parse(text);
        ASSERT_TRUE(parsed.has_value()) << text;
        EXPECT_EQ(parsed->path(), path);
        EXPECT_EQ(*parsed, url);
    }
    EXPECT_EQ(Url::fileURLWithPath("/with space/and%percent").absoluteString(),
              "file:///with%20space/and%25percent");

    const std::pair<const char*, const char*> accepted[] = {
        {"file://localhost/tmp/a%20b/../c", "/tmp/c"},
        {"FILE:///x%2fy", "/x/y"},
        {"file://", "/"},
        {"file:///a/b?x=1#frag", "/a/b"},
    };
    for (const auto& [text, path] : accepted) EXPECT_EQ(Url::parse(text).value().path(), path);
    for (const char* bad :
         {"file://otherhost/tmp", "file:///bad%2", "file:///bad%zz", "file:///nul%00byte",
          "file:relative", "/just/a/path", ":empty-scheme", "1abc:digit-first"})
        EXPECT_FALSE(Url::parse(bad)) << bad;

    std::optional<Url> other = Url::parse("https://example.invalid/a%20b");
    ASSERT_TRUE(other);
    EXPECT_FALSE(other->isFileURL());
    EXPECT_EQ(other->absoluteString(), "https://example.invalid/a%20b");
    EXPECT_FALSE(Url::parse("x:/a/b").value() == Url::fileURLWithPath("/a/b"));
}

TEST(UrlPathTest, ComponentsAndExtensions) {
    const std::pair<const char*, const char*> extensions[] = {
        {"/a/archive.tar.gz", "gz"}, {"/a/.hidden", ""},
        {"/a/.hidden.json", "json"}, {"/a/name.", ""},
        {"/a.dir/file", ""},         {"/a/..double", "double"},
    };
    for (const auto& [path, extension] : extensions)
        EXPECT_EQ(Url::fileURLWithPath(path).pathExtension(), extension) << path;

    Url url = Url::fileURLWithPath("/Users/me/Deck.lumen");
    EXPECT_EQ(url.pathComponents(), (std::vector<std::string>{"/", "Users", "me", "Deck.lumen"}));
    EXPECT_EQ(url.deletingLastPathComponent().path(), "/Users/me");
    EXPECT_EQ(Url::fileURLWithPath("/").deletingLastPathComponent().path(), "/");
    EXPECT_EQ(url.appendingPathComponent("c/d/").path(), "/Users/me/Deck.lumen/c/d");
    EXPECT_EQ(url.appendingPathComponent("../e").path(), "/Users/me/e");
}

// The one check every name from outside passes before it is joined to a path: a name that
// would climb, stay put or split in two once joined is refused.
TEST(UrlPathTest, EntryNamesAreOneComponent) {
    for (const std::string& bad :
         {std::string(""), std::string("."), std::string(".."), std::string("a/b"),
          std::string("/"), std::string("a/"), std::string("../x"), std::string("a\0b", 3),
          std::string("\0", 1)})
        EXPECT_FALSE(UrlPath::isEntryName(bad)) << bad;
    for (const std::string& good :
         {std::string("..."), std::string(".hidden"), std::string("a b"), std::string("..a"),
          std::string("\\"), std::string("\xff\xfe"), std::string(255, 'n')})
        EXPECT_TRUE(UrlPath::isEntryName(good)) << good;
}

}  // namespace
}  // namespace tamber
