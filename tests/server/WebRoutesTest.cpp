#include <gtest/gtest.h>

#include <filesystem>
#include <regex>
#include <thread>

#include <httplib.h>

#include "server/EmbeddedWeb.h"
#include "server/WebRoutes.h"
#include "tests/common/TempDir.h"
#include "tests/server/ServerTest.h"

namespace tamber::testing {
namespace {

std::string embeddedText(const EmbeddedWebFile& file) {
    return std::string(reinterpret_cast<const char*>(file.data), file.size);
}

// The page through the whole server: access control, the error handler and the web routes.
class WebRoutesTest : public ServerTest {};

TEST_F(WebRoutesTest, IndexNamesTheCurrentAssetsAndIsNeverCached) {
    auto index = anonymous()->Get("/");
    ASSERT_EQ(status(index), 200) << "the page itself needs no token";
    EXPECT_EQ(index->get_header_value("Content-Type"), "text/html; charset=utf-8");
    EXPECT_EQ(index->get_header_value("Cache-Control"), "no-cache");
    EXPECT_EQ(index->get_header_value("X-Content-Type-Options"), "nosniff");
    const std::string csp = index->get_header_value("Content-Security-Policy");
    EXPECT_NE(csp.find("default-src 'self'"), std::string::npos) << csp;
    EXPECT_NE(csp.find("script-src 'self'"), std::string::npos) << csp;
    EXPECT_EQ(csp.find("unsafe"), std::string::npos) << "no inline script or eval: " << csp;
    EXPECT_EQ(csp.find("http"), std::string::npos) << "no other origin: " << csp;
    EXPECT_EQ(index->body.find("{{static}}"), std::string::npos) << "every placeholder filled";
    EXPECT_NE(index->body.find("/static/" + std::string(EmbeddedWeb::treeHash()) + "/"),
              std::string::npos);
}

TEST_F(WebRoutesTest, EveryEmbeddedFileIsServedImmutableWithItsTypeAndBytes) {
    ASSERT_FALSE(EmbeddedWeb::files().empty());
    ASSERT_TRUE(std::regex_match(EmbeddedWeb::treeHash(), std::regex("[0-9a-f]{16}")));
    size_t total = 0;
    for (const auto& file : EmbeddedWeb::files()) {
        SCOPED_TRACE(file.path);
        total += file.size;
        auto got =
            anonymous()->Get("/static/" + std::string(EmbeddedWeb::treeHash()) + "/" + file.path);
        ASSERT_EQ(status(got), 200);
        EXPECT_EQ(got->body, embeddedText(file));
        EXPECT_EQ(got->get_header_value("Content-Type"), WebRoutes::contentTypeFor(file.path));
        EXPECT_NE(got->get_header_value("Content-Type"), "application/octet-stream")
            << "every file of the page has a known type";
        EXPECT_EQ(got->get_header_value("Cache-Control"), "public, max-age=31536000, immutable");
        EXPECT_EQ(got->get_header_value("ETag"), "\"" + std::string(file.hash) + "\"");
        EXPECT_FALSE(got->get_header_value("Content-Security-Policy").empty());
    }
    EXPECT_LE(total, 150u * 1024u) << "the page stays small";
}

TEST_F(WebRoutesTest, FileHashesFollowTheirBytes) {
    // Two files with the same hash but different bytes would share a cache entry.
    auto files = EmbeddedWeb::files();
    for (size_t i = 0; i < files.size(); ++i) {
        ASSERT_TRUE(std::regex_match(files[i].hash, std::regex("[0-9a-f]{16}")));
        for (size_t j = i + 1; j < files.size(); ++j)
            if (std::string(files[i].hash) == files[j].hash) {
                EXPECT_EQ(embeddedText(files[i]), embeddedText(files[j]));
            }
    }
}

TEST_F(WebRoutesTest, PageNeedsNothingTheSecurityPolicyWouldBlock) {
    const std::regex inlineScript("<script(?![^>]*\\ssrc=)[^>]*>", std::regex::icase);
    const std::regex handlerOrStyle("\\s(on[a-z]+|style)\\s*=", std::regex::icase);
    const std::regex otherOrigin("(src|href)\\s*=\\s*\"(https?:)?//", std::regex::icase);
    for (const auto& file : EmbeddedWeb::files()) {
        std::string text = embeddedText(file);
        SCOPED_TRACE(file.path);
        if (WebRoutes::contentTypeFor(file.path).starts_with("text/html")) {
            EXPECT_FALSE(std::regex_search(text, inlineScript));
            EXPECT_FALSE(std::regex_search(text, handlerOrStyle));
            EXPECT_FALSE(std::regex_search(text, otherOrigin));
        }
        if (WebRoutes::contentTypeFor(file.path).starts_with("text/javascript")) {
            EXPECT_EQ(text.find("innerHTML"), std::string::npos) << "names go in as text";
            EXPECT_EQ(text.find("eval("), std::string::npos);
        }
    }
}

TEST_F(WebRoutesTest, OtherVersionsAndUnknownFilesAreNotFound) {
    const std::string version = EmbeddedWeb::treeHash();
    for (const std::string& path : std::vector<std::string>{
             "/static/0000000000000000/index.html", "/static/" + version + "/missing.js",
             "/static/" + version + "/../CMakeLists.txt", "/static/" + version + "/%2e%2e/x",
             "/static/" + version + "/js//main.js", "/index.html.bak",
             "/static/" + version + "/"}) {
        SCOPED_TRACE(path);
        auto got = anonymous()->Get(path);
        EXPECT_EQ(status(got), 404);
        if (got) {
            EXPECT_EQ(got->body.find("CMake"), std::string::npos);
        }
    }
}

// The routes alone, over a web root on disk.
class WebRootTest : public ::testing::Test {
protected:
    void SetUp() override {
        root = dir.makeDir("web");
        dir.writeFile("web/index.html", "<script type=module src=\"{{static}}/a.js\"></script>");
        dir.writeFile("web/a.js", "export const a = 1;");
        dir.writeFile("web/.hidden.js", "hidden");
        dir.writeFile("web/sub/b.css", "body{}");
        dir.writeFile("secret.txt", "outside the root");
        std::filesystem::create_symlink(dir / "secret.txt", root + "/link.js");
        std::filesystem::create_directory_symlink(dir.path(), root + "/up");
        WebRoutes::add(server, nullptr, root);
        port = server.bind_to_any_port("127.0.0.1");
        thread = std::thread([this] { server.listen_after_bind(); });
        while (!server.is_running()) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    void TearDown() override {
        server.stop();
        thread.join();
    }
    httplib::Result get(const std::string& path) {
        httplib::Client client("127.0.0.1", port);
        return client.Get(path);
    }

    TempDir dir;
    std::string root;
    httplib::Server server;
    int port = 0;
    std::thread thread;
};

TEST_F(WebRootTest, ServesTheFolderUncachedUnderTheDevelopmentVersion) {
    auto index = get("/");
    ASSERT_TRUE(index);
    EXPECT_EQ(index->status, 200);
    EXPECT_EQ(index->body, "<script type=module src=\"/static/dev/a.js\"></script>");
    auto script = get("/static/dev/a.js");
    ASSERT_TRUE(script);
    EXPECT_EQ(script->status, 200);
    EXPECT_EQ(script->body, "export const a = 1;");
    EXPECT_EQ(script->get_header_value("Cache-Control"), "no-cache");
    EXPECT_EQ(script->get_header_value("Content-Type"), "text/javascript; charset=utf-8");
    auto nested = get("/static/dev/sub/b.css");
    ASSERT_TRUE(nested);
    EXPECT_EQ(nested->status, 200);
    EXPECT_EQ(nested->get_header_value("Content-Type"), "text/css; charset=utf-8");
    auto embeddedVersion = get("/static/" + std::string(EmbeddedWeb::treeHash()) + "/a.js");
    ASSERT_TRUE(embeddedVersion);
    EXPECT_EQ(embeddedVersion->status, 404) << "the disk's files are not the embedded version";
}

TEST_F(WebRootTest, NothingOutsideTheFolderIsServed) {
    for (const std::string& path : std::vector<std::string>{
             "/static/dev/link.js", "/static/dev/up/secret.txt", "/static/dev/../secret.txt",
             "/static/dev/%2e%2e/secret.txt", "/static/dev/sub/../../secret.txt",
             "/static/dev/.hidden.js", "/static/dev/sub", "/static/dev/" + root + "/a.js"}) {
        SCOPED_TRACE(path);
        auto got = get(path);
        ASSERT_TRUE(got);
        EXPECT_NE(got->status, 200);
        EXPECT_EQ(got->body.find("outside the root"), std::string::npos);
    }
}

TEST_F(WebRootTest, MissingIndexIsNotFound) {
    std::filesystem::remove(root + "/index.html");
    auto got = get("/");
    ASSERT_TRUE(got);
    EXPECT_EQ(got->status, 404);
}

TEST(WebRoutesPathTest, OnlyPlainRelativePathsAreServable) {
    for (const char* good : {"index.html", "js/main.js", "a/b/c.css", "x..y.js"})
        EXPECT_TRUE(WebRoutes::servablePath(good)) << good;
    for (const char* bad : {"", "/etc/passwd", "..", "../x", "a/../b", "a/./b", "a//b", "a/",
                            ".hidden", "a/.git/config", "a\\b"})
        EXPECT_FALSE(WebRoutes::servablePath(bad)) << bad;
    EXPECT_FALSE(WebRoutes::servablePath(std::string("a\0b", 3)));
}

TEST(WebRoutesPathTest, TypesFollowTheExtension) {
    EXPECT_EQ(WebRoutes::contentTypeFor("js/app.js"), "text/javascript; charset=utf-8");
    EXPECT_EQ(WebRoutes::contentTypeFor("app.css"), "text/css; charset=utf-8");
    EXPECT_EQ(WebRoutes::contentTypeFor("icon.svg"), "image/svg+xml");
    EXPECT_EQ(WebRoutes::contentTypeFor("index.html"), "text/html; charset=utf-8");
    EXPECT_EQ(WebRoutes::contentTypeFor("app.css.map.unknown"), "application/octet-stream");
    EXPECT_EQ(WebRoutes::contentTypeFor("js"), "application/octet-stream");
}

}  // namespace
}  // namespace tamber::testing
