#include "platform/Url.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "tests/common/TempDir.h"

namespace tamber {
namespace {

struct StandardisationCase {
    const char* input;
    const char* expected;
};

TEST(UrlPathTest, FileUrlPathsAreStandardisedLexically) {
    const StandardisationCase cases[] = {
        {"/", "/"},
        {"//", "/"},
        {"/a/b", "/a/b"},
        {"/a//b///c", "/a/b/c"},
        {"/a/./b/.", "/a/b"},
        {"/a/b/", "/a/b"},
        {"/a/b/../c", "/a/c"},
        {"/a/b/../../..", "/"},
        {"/../../x", "/x"},
        {"/a/..b/c..", "/a/..b/c.."},
        {"/a/.../b", "/a/.../b"},
        {"/./", "/"},
        {"/a/b/c/../../d/./e//", "/a/d/e"},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(Url::fileURLWithPath(c.input).path(), c.expected) << "input " << c.input;
        EXPECT_TRUE(Url::fileURLWithPath(c.input).isFileURL());
    }
}

// Changes the working directory for a scope.
class ScopedWorkingDirectory {
public:
    explicit ScopedWorkingDirectory(const std::string& path) {
        char* old = ::getcwd(nullptr, 0);
        previous_ = old ? old : "/";
        ::free(old);
        if (::chdir(path.c_str()) != 0)
            ADD_FAILURE() << "chdir " << path;
    }
    ~ScopedWorkingDirectory() {
        if (::chdir(previous_.c_str()) != 0)
            ADD_FAILURE() << "chdir back";
    }

private:
    std::string previous_;
};

TEST(UrlPathTest, RelativePathsResolveAgainstTheWorkingDirectory) {
    testing::TempDir dir;
    std::string sub = dir.makeDir("work/sub");
    ScopedWorkingDirectory cwd(sub);
    // The temporary directory may itself be reached through a link; compare with what the
    // process reports as its working directory.
    char* reported = ::getcwd(nullptr, 0);
    ASSERT_NE(reported, nullptr);
    std::string here = reported;
    ::free(reported);
    std::string parent = here.substr(0, here.rfind('/'));

    EXPECT_EQ(Url::fileURLWithPath("file.txt").path(), here + "/file.txt");
    EXPECT_EQ(Url::fileURLWithPath("./a//b/").path(), here + "/a/b");
    EXPECT_EQ(Url::fileURLWithPath("../x").path(), parent + "/x");
    EXPECT_EQ(Url::fileURLWithPath("").path(), here);
    EXPECT_EQ(Url::fileURLWithPath(".").path(), here);
}

TEST(UrlPathTest, ParseAndAbsoluteStringRoundTrip) {
    const std::string paths[] = {
        "/plain/path.txt",
        "/with space/and%percent",
        "/caf\xC3\xA9/\xE6\x97\xA5\xE6\x9C\xAC.lumen",
        "/q?uestion/h#ash",
        "/sub-delims!$&'()*+,;=:@~_",
    };
    for (const std::string& path : paths) {
        Url url = Url::fileURLWithPath(path);
        std::string text = url.absoluteString();
        EXPECT_TRUE(text.starts_with("file:///")) << text;
        for (unsigned char c : text) {
            EXPECT_TRUE(c > 0x20 && c < 0x7F) << "unencoded byte in " << text;
        }
        std::optional<Url> parsed = Url::parse(text);
        ASSERT_TRUE(parsed.has_value()) << text;
        EXPECT_EQ(parsed->path(), path);
        EXPECT_EQ(*parsed, url);
    }

    EXPECT_EQ(Url::fileURLWithPath("/with space/and%percent").absoluteString(),
              "file:///with%20space/and%25percent");
    EXPECT_EQ(Url::fileURLWithPath("/caf\xC3\xA9").absoluteString(), "file:///caf%C3%A9");
    EXPECT_EQ(Url::fileURLWithPath("/a:b@c;d=e").absoluteString(), "file:///a:b@c;d=e");
    EXPECT_EQ(Url::fileURLWithPath("/").absoluteString(), "file:///");
}

TEST(UrlPathTest, ParseAcceptsFileUrlsAndOtherSchemes) {
    std::optional<Url> local = Url::parse("file://localhost/tmp/a%20b/../c");
    ASSERT_TRUE(local);
    EXPECT_EQ(local->path(), "/tmp/c");
    std::optional<Url> upper = Url::parse("FILE:///x%2fy");
    ASSERT_TRUE(upper);
    EXPECT_EQ(upper->path(), "/x/y");
    std::optional<Url> root = Url::parse("file://");
    ASSERT_TRUE(root);
    EXPECT_EQ(root->path(), "/");
    std::optional<Url> query = Url::parse("file:///a/b?x=1#frag");
    ASSERT_TRUE(query);
    EXPECT_EQ(query->path(), "/a/b");

    EXPECT_FALSE(Url::parse("file://otherhost/tmp"));
    EXPECT_FALSE(Url::parse("file:///bad%2"));
    EXPECT_FALSE(Url::parse("file:///bad%zz"));
    EXPECT_FALSE(Url::parse("file:///nul%00byte"));
    EXPECT_FALSE(Url::parse("file:relative"));
    EXPECT_FALSE(Url::parse("/just/a/path"));
    EXPECT_FALSE(Url::parse("no scheme here"));
    EXPECT_FALSE(Url::parse(":empty-scheme"));
    EXPECT_FALSE(Url::parse("1abc:digit-first"));

    std::optional<Url> other = Url::parse("https://example.invalid/a%20b");
    ASSERT_TRUE(other);
    EXPECT_FALSE(other->isFileURL());
    EXPECT_FALSE(other->isEmpty());
    EXPECT_EQ(other->path(), "");
    EXPECT_EQ(other->absoluteString(), "https://example.invalid/a%20b");
    EXPECT_EQ(*other, *Url::parse("https://example.invalid/a%20b"));
    EXPECT_FALSE(*other == *Url::parse("https://example.invalid/a b"));
    EXPECT_TRUE(Url().isEmpty());
}

TEST(UrlPathTest, ComponentsAndExtensions) {
    struct ExtensionCase {
        const char* path;
        const char* extension;
    };
    const ExtensionCase extensions[] = {
        {"/a/b.txt", "txt"},       {"/a/archive.tar.gz", "gz"},
        {"/a/.hidden", ""},        {"/a/.hidden.json", "json"},
        {"/a/name.", ""},          {"/a/noext", ""},
        {"/a.dir/file", ""},       {"/", ""},
        {"/a/..double", "double"},
    };
    for (const auto& c : extensions) {
        EXPECT_EQ(Url::fileURLWithPath(c.path).pathExtension(), c.extension) << c.path;
    }

    Url url = Url::fileURLWithPath("/Users/me/Deck.lumen");
    EXPECT_EQ(url.lastPathComponent(), "Deck.lumen");
    EXPECT_EQ(url.pathComponents(), (std::vector<std::string>{"/", "Users", "me", "Deck.lumen"}));
    EXPECT_EQ(Url::fileURLWithPath("/").pathComponents(), std::vector<std::string>{"/"});
    EXPECT_EQ(Url::fileURLWithPath("/").lastPathComponent(), "/");

    EXPECT_EQ(url.deletingLastPathComponent().path(), "/Users/me");
    EXPECT_EQ(Url::fileURLWithPath("/top").deletingLastPathComponent().path(), "/");
    EXPECT_EQ(Url::fileURLWithPath("/").deletingLastPathComponent().path(), "/");

    Url dir = Url::fileURLWithPath("/a/b");
    EXPECT_EQ(dir.appendingPathComponent("c").path(), "/a/b/c");
    EXPECT_EQ(dir.appendingPathComponent("c/d/").path(), "/a/b/c/d");
    EXPECT_EQ(dir.appendingPathComponent("../e").path(), "/a/e");
    EXPECT_EQ(dir.appendingPathComponent("").path(), "/a/b");
    EXPECT_EQ(Url::fileURLWithPath("/").appendingPathComponent("x").path(), "/x");
}

TEST(UrlPathTest, Equality) {
    EXPECT_EQ(Url::fileURLWithPath("/a/./b"), Url::fileURLWithPath("/a/b/"));
    EXPECT_FALSE(Url::fileURLWithPath("/a/b") == Url::fileURLWithPath("/a/B"));
    // A file URL and a non-file URL whose text is the same path are different URLs.
    std::optional<Url> other = Url::parse("x:/a/b");
    ASSERT_TRUE(other);
    EXPECT_FALSE(*other == Url::fileURLWithPath("/a/b"));

    UrlObject objectA(Url::fileURLWithPath("/a"));
    EXPECT_TRUE(objectA.isEqual(UrlObject(Url::fileURLWithPath("/x/../a"))));
    EXPECT_FALSE(objectA.isEqual(UrlObject(Url::fileURLWithPath("/b"))));
    EXPECT_EQ(objectA.description(), "file:///a");
}

}  // namespace
}  // namespace tamber
