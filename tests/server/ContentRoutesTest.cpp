#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>

#include <httplib.h>
#include <nlohmann/json.hpp>

#include "host/StagingCopies.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/device/DeviceAnswer.h"
#include "platform/imaging/Image.h"
#include "platform/imaging/ImageEncoder.h"
#include "platform/imaging/PixbufThumbnailRenderer.h"
#include "platform/objects/Number.h"
#include "platform/tremors/TremorService.h"
#include "runtime/ProviderRuntime.h"
#include "server/ContentRoutes.h"
#include "server/DesktopThumbnails.h"
#include "support/DispatchSemaphore.h"
#include "support/DispatchTimer.h"
#include "support/WorkerPool.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/TempStagingLedger.h"
#include "tests/server/TestImages.h"

namespace tamber {

// Defined with the provider's thumbnails.
void ResetThumbnailDeviceTraitsForTesting();

namespace {

using namespace testing;
using nlohmann::json;
namespace fs = std::filesystem;

const auto* const contentLedger = ::testing::AddGlobalTestEnvironment(new TempStagingLedger);

constexpr double kRoutePatience = 20;  // seconds: only a hang gets near it
constexpr const char* kIconApp = "com.example.icon";

std::string fileText(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

void writeText(const std::string& path, const std::string& contents) {
    std::ofstream(path, std::ios::binary) << contents;
}

// Bytes that differ at every offset in a short cycle, so a slice from the wrong place shows.
std::string patternBytes(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i) text[i] = static_cast<char>('a' + (i * 7 + i / 26) % 26);
    return text;
}

bool hasStagingFile(const std::string& folder) {
    for (const auto& entry : fs::directory_iterator(folder))
        if (entry.path().filename().string().starts_with(StagingCopies::kPrefix))
            return true;
    return false;
}

std::vector<std::string> namesInFolder(const std::string& folder) {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(folder))
        names.push_back(entry.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

template <class Condition>
bool becomesTrueInTime(Condition condition) {
    auto deadline =
        std::chrono::steady_clock::now() + std::chrono::duration<double>(kRoutePatience);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
}

// A real provider on a temporary storage, behind a real HTTP server on an ephemeral loopback
// port that carries the content routes, driven by a real client.
class ContentRoutesTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        DispatchTimer::shared().shutdown();
        WorkerPool::shared().shutdown();
        storage = dir.makeDir("Documents");
        installIconApp();

        faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
        ProviderRuntimeOptions options;
        options.storagePath = storage;
        options.stateDir = state.path();
        options.fileSystem = faults;
        runtime = std::make_unique<ProviderRuntime>(options);
        auto porter = runtime->provider();
        ASSERT_TRUE(porter.ok()) << porter.error().description();
        context = std::make_shared<ApiContext>();
        context->provider = porter.value();
        context->storage = runtime->storageURL();
        DesktopThumbnails::Options thumbnailOptions;
        thumbnailOptions.cacheFolder = thumbnailCache.path() + "/thumbnails";
        thumbnailOptions.renderer = std::make_shared<PixbufThumbnailRenderer>();
        context->thumbnails = std::make_shared<DesktopThumbnails>(std::move(thumbnailOptions));

        ContentRoutes::add(server, context);
        ContentRoutes::addChildrenPost(
            server, context,
            [this](const httplib::Request&, httplib::Response& response, const std::string& body) {
                std::lock_guard lock(otherPostsMutex);
                otherPosts.push_back(body);
                response.set_content("{}", "application/json");
            },
            1024);
        port = server.bind_to_any_port("127.0.0.1");
        ASSERT_GT(port, 0);
        listener = std::thread([this] { server.listen_after_bind(); });
        ASSERT_TRUE(becomesTrueInTime([this] { return server.is_running(); }));
    }

    void TearDown() override {
        server.stop();
        if (listener.joinable())
            listener.join();
        context.reset();
        runtime.reset();
        ClearDeviceAnswerOverrides();
        ResetThumbnailDeviceTraitsForTesting();
        TremorService::resetForTesting();
        AppLibraryTest::TearDown();
    }

    // An app whose library has a PNG icon in the user's icon theme.
    void installIconApp() {
        SetDeviceAnswerOverride("DeviceClassNumber", Number::fromInt64(kDeviceClassComputer));
        SetDeviceAnswerOverride("main-screen-scale", Number::fromDouble(1.0));
        ResetThumbnailDeviceTraitsForTesting();
        const uint32_t side = 48;
        auto png = std::make_shared<Bytes>();
        auto encoder = ImageEncoder::create(png, ImageEncoder::kPNGType, 1);
        ASSERT_TRUE(encoder);
        encoder->addImage(Image::make(side, side, Bytes(side * side * 4, 0x7f)));
        ASSERT_TRUE(encoder->finalize());
        std::string folder = dir / "icons/hicolor/48x48/apps";
        fs::create_directories(folder);
        writeText(folder + "/tamber-test-icon.png", std::string(png->begin(), png->end()));
        auto fields = app(kIconApp)->fields();
        fields.iconName = "tamber-test-icon";
        auto plain = app(kIconApp);
        registry->replace(AppRegistry::kUserApplications,
                          {AppRecord::make(fields, {false, false, plain->infoDictionary()})});
    }

    // The journal has seen everything written so far.
    void settle() {
        auto journal = runtime->startJournal();
        ASSERT_TRUE(journal.ok());
        journal.value()->sync();
    }

    std::string identifierOf(const std::string& path) {
        settle();
        auto item = context->provider->itemAtURL(Url::fileURLWithPath(path));
        EXPECT_TRUE(item.ok()) << path << ": " << item.error().description();
        return item.ok() ? item.value()->itemIdentifier() : std::string("none");
    }

    httplib::Client client() {
        httplib::Client c("127.0.0.1", port);
        c.set_read_timeout(static_cast<time_t>(kRoutePatience), 0);
        return c;
    }

    static std::string contentPath(const std::string& identifier) {
        std::string path = "/api/v1/items/";
        for (char c : identifier) path += c == '#' ? std::string("%23") : std::string(1, c);
        return path + "/content";
    }

    TempDir state;
    TempDir thumbnailCache;
    std::string storage;
    std::shared_ptr<FaultInjectingFileSystem> faults;
    std::unique_ptr<ProviderRuntime> runtime;
    std::shared_ptr<ApiContext> context;
    httplib::Server server;
    int port = 0;
    std::thread listener;
    // Written on the server's thread: a socket is no synchronisation the sanitizer can see.
    std::mutex otherPostsMutex;
    std::vector<std::string> otherPosts;
    std::vector<std::string> postsSoFar() {
        std::lock_guard lock(otherPostsMutex);
        return otherPosts;
    }
};

// Downloads: the whole file and its ranges, byte-exact, labelled by type; ranges past the end
// refused with the size; an end past the size cut to it.
TEST_F(ContentRoutesTest, DownloadServesTheWholeFileAndSingleRanges) {
    const std::string body = patternBytes(300 * 1024);  // several chunks
    writeText(storage + "/notes \"draft\".txt", body);
    const std::string id = identifierOf(storage + "/notes \"draft\".txt");
    auto c = client();

    auto whole = c.Get(contentPath(id));
    ASSERT_TRUE(whole);
    EXPECT_EQ(whole->status, 200);
    EXPECT_TRUE(whole->body == body) << "whole body differs";
    EXPECT_EQ(whole->get_header_value("Content-Type"), "text/plain; charset=utf-8");
    EXPECT_EQ(whole->get_header_value("Accept-Ranges"), "bytes");
    // (The client decodes header values; the encoding itself is checked with ContentTypes.)
    EXPECT_EQ(whole->get_header_value("Content-Disposition"),
              "attachment; filename*=UTF-8''notes \"draft\".txt");
    auto middle = c.Get(contentPath(id), {{"Range", "bytes=70000-70009"}});
    ASSERT_TRUE(middle);
    EXPECT_EQ(middle->status, 206);
    EXPECT_EQ(middle->body, body.substr(70000, 10));
    EXPECT_EQ(middle->get_header_value("Content-Range"),
              "bytes 70000-70009/" + std::to_string(body.size()));

    auto tail = c.Get(contentPath(id), {{"Range", "bytes=-5"}});
    ASSERT_TRUE(tail);
    EXPECT_EQ(tail->status, 206);
    EXPECT_EQ(tail->body, body.substr(body.size() - 5));

    auto overlong = c.Get(contentPath(id), {{"Range", "bytes=307000-999999999"}});
    ASSERT_TRUE(overlong);
    EXPECT_EQ(overlong->status, 206);
    EXPECT_EQ(overlong->body, body.substr(307000));
    EXPECT_EQ(overlong->get_header_value("Content-Range"),
              "bytes 307000-307199/" + std::to_string(body.size()));

    auto past = c.Get(contentPath(id), {{"Range", "bytes=307200-"}});
    ASSERT_TRUE(past);
    EXPECT_EQ(past->status, 416);
    EXPECT_EQ(past->get_header_value("Content-Range"), "bytes */307200");
    EXPECT_TRUE(json::parse(past->body).contains("error"));

    writeText(storage + "/photo.PNG", "\x89PNG");
    auto png = c.Get(contentPath(identifierOf(storage + "/photo.PNG")));
    ASSERT_TRUE(png);
    EXPECT_EQ(png->get_header_value("Content-Type"), "image/png");
    writeText(storage + "/empty.bin", "");
    auto empty = c.Get(contentPath(identifierOf(storage + "/empty.bin")));
    ASSERT_TRUE(empty);
    EXPECT_EQ(empty->status, 200);
    EXPECT_EQ(empty->body, "");
    EXPECT_EQ(empty->get_header_value("Content-Type"), "application/octet-stream");
}

// Only files inside the published trees are served: a folder, an unknown identifier and a link
// that leads out of the tree get the error object, never the bytes behind them.
TEST_F(ContentRoutesTest, DownloadRefusesFoldersUnknownItemsAndLinksOutOfTheTree) {
    TempDir outside;
    const std::string secret = "the secret outside the tree";
    std::string target = outside.writeFile("secret.txt", secret);
    fs::create_symlink(target, storage + "/escape.txt");
    fs::create_directory(storage + "/folder");
    auto c = client();

    auto link = c.Get(contentPath(identifierOf(storage + "/escape.txt")));
    ASSERT_TRUE(link);
    EXPECT_EQ(link->status, 400);
    EXPECT_EQ(link->body.find(secret), std::string::npos);
    EXPECT_EQ(link->body.find(outside.path()), std::string::npos);

    auto folder = c.Get(contentPath(identifierOf(storage + "/folder")));
    ASSERT_TRUE(folder);
    EXPECT_EQ(folder->status, 400);
    EXPECT_TRUE(json::parse(folder->body).contains("error"));

    auto root = c.Get(contentPath(HostPorterRootContainerItemIdentifier));
    ASSERT_TRUE(root);
    EXPECT_EQ(root->status, 400);

    for (std::string id : {"did=987654", "fid=1x", "nonsense"}) {
        auto missing = c.Get(contentPath(id));
        ASSERT_TRUE(missing);
        EXPECT_EQ(missing->status, 404) << id;
    }
}

// A safe save: the new bytes arrive whole under the same name, the document keeps its
// identifier and every extended attribute (the tags, the rank), and no staging file is left.
TEST_F(ContentRoutesTest, SafeSaveKeepsTheIdentifierAndTheMetadata) {
    const std::string path = storage + "/report.txt";
    writeText(path, "first version");
    const std::string id = identifierOf(path);
    ASSERT_TRUE(id.starts_with("did=")) << id;
    ASSERT_EQ(::setxattr(path.c_str(), "user.tamber.test", "kept", 4, 0), 0);
    DispatchSemaphore ranked;
    context->provider->setFavoriteRank(Number::fromInt64(7), id, [&](auto item) {
        EXPECT_TRUE(item.ok());
        ranked.signal();
    });
    ASSERT_TRUE(ranked.wait(kRoutePatience));
    ::chmod(path.c_str(), 0640);
    struct stat before {};
    ASSERT_EQ(::stat(path.c_str(), &before), 0);

    const std::string second = patternBytes(200 * 1024);
    auto c = client();
    auto saved = c.Put(contentPath(id), second, "application/octet-stream");
    ASSERT_TRUE(saved);
    ASSERT_EQ(saved->status, 200) << saved->body;
    auto item = json::parse(saved->body);
    EXPECT_EQ(item.value("identifier", ""), id) << saved->body;
    EXPECT_EQ(item.value("filename", ""), "report.txt");

    struct stat after {};
    ASSERT_EQ(::stat(path.c_str(), &after), 0);
    EXPECT_NE(after.st_ino, before.st_ino) << "written in place, not saved beside and renamed";
    EXPECT_EQ(after.st_mode & 07777, 0640u);
    EXPECT_TRUE(fileText(path) == second);
    char value[16] = {};
    EXPECT_EQ(::getxattr(path.c_str(), "user.tamber.test", value, sizeof value), 4);
    EXPECT_STREQ(value, "kept");
    EXPECT_FALSE(hasStagingFile(storage));

    // The identifier still leads to the document, now holding the new bytes.
    settle();
    auto again = c.Get(contentPath(id));
    ASSERT_TRUE(again);
    EXPECT_EQ(again->status, 200);
    EXPECT_TRUE(again->body == second);
    auto record = context->provider->itemForIdentifier(id);
    ASSERT_TRUE(record.ok()) << record.error().description();
    ASSERT_TRUE(record.value()->favoriteRank());
    EXPECT_EQ(record.value()->favoriteRank()->int64Value(), 7);
}

// A save that cannot reach the disk changes nothing: the old content stays, the identifier
// still resolves, and the staging file is gone. Saves over a folder or an unknown item too.
TEST_F(ContentRoutesTest, FailedSaveLeavesTheFileAsItWas) {
    const std::string path = storage + "/keep.txt";
    writeText(path, "the content to keep");
    const std::string id = identifierOf(path);
    auto c = client();

    faults->inject(FaultInjectingFileSystem::Operation::Fsync, EIO, 1, StagingCopies::kPrefix);
    auto failed = c.Put(contentPath(id), "would-be new content", "text/plain");
    ASSERT_TRUE(failed);
    EXPECT_EQ(failed->status, 500);
    EXPECT_TRUE(json::parse(failed->body).contains("error"));
    EXPECT_EQ(fileText(path), "the content to keep");
    EXPECT_FALSE(hasStagingFile(storage));

    fs::create_directory(storage + "/box");
    auto folder = c.Put(contentPath(identifierOf(storage + "/box")), "x", "text/plain");
    ASSERT_TRUE(folder);
    EXPECT_EQ(folder->status, 400);
    auto missing = c.Put(contentPath("did=987654"), "x", "text/plain");
    ASSERT_TRUE(missing);
    EXPECT_EQ(missing->status, 404);
    EXPECT_FALSE(hasStagingFile(storage));
    EXPECT_EQ(namesInFolder(storage), (std::vector<std::string>{"box", "keep.txt"}));
}

httplib::MultipartFormData filePart(const std::string& name, const std::string& content) {
    return {"file", content, name, "application/octet-stream"};
}

// Uploads: every part lands whole under its own name, a taken name bounces, and the answer
// lists the items in the order sent.
TEST_F(ContentRoutesTest, UploadImportsEveryPartAndBouncesTakenNames) {
    fs::create_directory(storage + "/inbox");
    writeText(storage + "/inbox/a.txt", "already here");
    const std::string folder = identifierOf(storage + "/inbox");
    const std::string big = patternBytes(512 * 1024);
    auto c = client();
    auto answer = c.Post(
        "/api/v1/containers/" + folder + "/children",
        httplib::MultipartFormDataItems{filePart("a.txt", "new a"), filePart("big.bin", big)});
    ASSERT_TRUE(answer);
    ASSERT_EQ(answer->status, 200) << answer->body;
    auto items = json::parse(answer->body).at("items");
    ASSERT_EQ(items.size(), 2u);
    EXPECT_EQ(items[0].value("filename", ""), "a 2.txt");
    EXPECT_EQ(items[1].value("filename", ""), "big.bin");
    EXPECT_EQ(items[0].value("parentIdentifier", ""), folder);
    EXPECT_EQ(fileText(storage + "/inbox/a.txt"), "already here");
    EXPECT_EQ(fileText(storage + "/inbox/a 2.txt"), "new a");
    EXPECT_TRUE(fileText(storage + "/inbox/big.bin") == big);
    EXPECT_FALSE(hasStagingFile(storage + "/inbox"));

    // Into an app library too; never into the root, which holds only the libraries.
    auto library = c.Post("/api/v1/containers/%23" + std::string(kIconApp) + "/children",
                          httplib::MultipartFormDataItems{filePart("in-app.txt", "x")});
    ASSERT_TRUE(library);
    EXPECT_EQ(library->status, 200) << library->body;
    auto root = c.Post("/api/v1/containers/" + HostPorterRootContainerItemIdentifier + "/children",
                       httplib::MultipartFormDataItems{filePart("x.txt", "x")});
    ASSERT_TRUE(root);
    EXPECT_EQ(root->status, 403);
}

// A name the user may not give refuses the whole upload before anything is placed.
TEST_F(ContentRoutesTest, UploadRefusesBadNamesAndPlacesNothing) {
    fs::create_directory(storage + "/inbox");
    const std::string folder = identifierOf(storage + "/inbox");
    auto c = client();
    for (const std::string& bad :
         {std::string("../escape.txt"), std::string("a/b.txt"), std::string(".."),
          std::string(256, 'n'), std::string("nul\0.txt", 8)}) {
        auto answer =
            c.Post("/api/v1/containers/" + folder + "/children",
                   httplib::MultipartFormDataItems{filePart("fine.txt", "ok"), filePart(bad, "x")});
        ASSERT_TRUE(answer);
        EXPECT_EQ(answer->status, 400) << bad.size() << " " << answer->body;
        EXPECT_TRUE(namesInFolder(storage + "/inbox").empty()) << bad.size();
    }
    EXPECT_EQ(namesInFolder(storage), (std::vector<std::string>{"inbox"}));

    auto none = c.Post("/api/v1/containers/" + folder + "/children",
                       httplib::MultipartFormDataItems{filePart("", "x")});
    ASSERT_TRUE(none);
    EXPECT_EQ(none->status, 400);
    auto missing = c.Post("/api/v1/containers/did=987654/children",
                          httplib::MultipartFormDataItems{filePart("x.txt", "x")});
    ASSERT_TRUE(missing);
    EXPECT_EQ(missing->status, 404);
}

// A client that goes away in the middle of an upload leaves nothing: the staging file that
// held its bytes is removed and no name appears.
TEST_F(ContentRoutesTest, UploadCutShortLeavesNoFile) {
    fs::create_directory(storage + "/inbox");
    const std::string folder = identifierOf(storage + "/inbox");
    int sock = ::socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_GE(sock, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(::connect(sock, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    const std::string head =
        "POST /api/v1/containers/" + folder +
        "/children HTTP/1.1\r\nHost: 127.0.0.1\r\n"
        "Content-Type: multipart/form-data; boundary=cut\r\nContent-Length: 10000000\r\n\r\n"
        "--cut\r\nContent-Disposition: form-data; name=\"file\"; filename=\"half.txt\"\r\n"
        "Content-Type: text/plain\r\n\r\n";
    const std::string half = head + patternBytes(256 * 1024);
    ASSERT_EQ(::send(sock, half.data(), half.size(), MSG_NOSIGNAL), ssize_t(half.size()));
    EXPECT_TRUE(becomesTrueInTime([&] { return hasStagingFile(storage + "/inbox"); }))
        << "the upload never started";
    ::close(sock);
    EXPECT_TRUE(becomesTrueInTime([&] { return namesInFolder(storage + "/inbox").empty(); }))
        << "left behind after the client went away";
}

// A request to the same path that is not an upload reaches the other handler with its body;
// a body over the limit does not.
TEST_F(ContentRoutesTest, OtherPostsToChildrenGetTheirBodyWithinTheLimit) {
    auto c = client();
    auto small = c.Post("/api/v1/containers/x/children", R"({"folder":"New"})", "application/json");
    ASSERT_TRUE(small);
    EXPECT_EQ(small->status, 200);
    ASSERT_EQ(postsSoFar().size(), 1u);
    EXPECT_EQ(postsSoFar()[0], R"({"folder":"New"})");
    auto large =
        client().Post("/api/v1/containers/x/children", std::string(4096, ' '), "application/json");
    ASSERT_TRUE(large);
    EXPECT_EQ(large->status, 413);
    EXPECT_EQ(postsSoFar().size(), 1u);
}

// Thumbnails: an app library's icon as PNG; files and unknown items 404; sizes checked.
TEST_F(ContentRoutesTest, ThumbnailsOfAppLibrariesAndNoneForFiles) {
    auto c = client();
    auto icon = c.Get("/api/v1/items/%23" + std::string(kIconApp) + "/thumbnail?size=64");
    ASSERT_TRUE(icon);
    ASSERT_EQ(icon->status, 200) << icon->body;
    EXPECT_EQ(icon->get_header_value("Content-Type"), "image/png");
    EXPECT_TRUE(icon->body.starts_with("\x89PNG\r\n\x1a\n"));

    writeText(storage + "/plain.txt", "x");
    auto file = c.Get("/api/v1/items/" + identifierOf(storage + "/plain.txt") + "/thumbnail");
    ASSERT_TRUE(file);
    EXPECT_EQ(file->status, 404);
    EXPECT_TRUE(json::parse(file->body).contains("error"));

    for (std::string size : {"8", "2048", "abc", "64px", ""}) {
        auto bad = c.Get("/api/v1/items/%23" + std::string(kIconApp) + "/thumbnail?size=" + size);
        ASSERT_TRUE(bad);
        EXPECT_EQ(bad->status, 400) << size;
    }
}

// Image files: a thumbnail from the desktop's cache, made there when missing; bad or huge
// images refused with an error object; links out of the tree never followed.
TEST_F(ContentRoutesTest, ThumbnailsOfImageFilesComeFromTheDesktopCache) {
    auto c = client();
    const std::string photo = storage + "/Photo 1.jpg";
    writeText(photo, testing::encodedImage(640, 480, "jpeg"));
    auto thumb = c.Get("/api/v1/items/" + identifierOf(photo) + "/thumbnail?size=128");
    ASSERT_TRUE(thumb);
    ASSERT_EQ(thumb->status, 200) << thumb->body;
    EXPECT_EQ(thumb->get_header_value("Content-Type"), "image/png");
    EXPECT_EQ(testing::decodedSize(thumb->body), std::make_pair(128, 96));
    const std::string stored =
        thumbnailCache.path() + "/thumbnails/normal/" +
        DesktopThumbnails::cacheNameForUri(DesktopThumbnails::uriForPath(photo));
    EXPECT_EQ(fileText(stored), thumb->body);

    auto large = c.Get("/api/v1/items/" + identifierOf(photo) + "/thumbnail?size=512");
    ASSERT_TRUE(large);
    ASSERT_EQ(large->status, 200) << large->body;
    EXPECT_EQ(testing::decodedSize(large->body), std::make_pair(256, 192));

    // Any format the loaders read, not only the common two.
    writeText(storage + "/scan.bmp", testing::encodedImage(100, 400, "bmp"));
    auto bitmap = c.Get("/api/v1/items/" + identifierOf(storage + "/scan.bmp") + "/thumbnail");
    ASSERT_TRUE(bitmap);
    ASSERT_EQ(bitmap->status, 200) << bitmap->body;
    EXPECT_EQ(testing::decodedSize(bitmap->body), std::make_pair(64, 256));

    writeText(storage + "/broken.png", "<img src=x onerror=alert(1)>");
    auto broken = c.Get("/api/v1/items/" + identifierOf(storage + "/broken.png") + "/thumbnail");
    ASSERT_TRUE(broken);
    EXPECT_EQ(broken->status, 415);
    EXPECT_TRUE(json::parse(broken->body).contains("error"));

    writeText(storage + "/huge.png", testing::encodedImage(8, 8, "png"));
    fs::resize_file(storage + "/huge.png", DesktopThumbnails::kMaxSourceBytes + 1);
    auto huge = c.Get("/api/v1/items/" + identifierOf(storage + "/huge.png") + "/thumbnail");
    ASSERT_TRUE(huge);
    EXPECT_EQ(huge->status, 413);
    EXPECT_TRUE(json::parse(huge->body).contains("error"));

    TempDir outside;
    const std::string secret =
        outside.writeFile("secret.png", testing::encodedImage(32, 32, "png"));
    fs::create_symlink(secret, storage + "/secret.png");
    auto linked = c.Get("/api/v1/items/" + identifierOf(storage + "/secret.png") + "/thumbnail");
    ASSERT_TRUE(linked);
    EXPECT_NE(linked->status, 200);
    EXPECT_EQ(testing::decodedSize(linked->body), std::make_pair(0, 0));
    EXPECT_FALSE(fs::exists(thumbnailCache.path() + "/thumbnails/large/" +
                            DesktopThumbnails::cacheNameForUri(
                                DesktopThumbnails::uriForPath(storage + "/secret.png"))));

    auto unknown = c.Get("/api/v1/items/fid=987654321/thumbnail");
    ASSERT_TRUE(unknown);
    EXPECT_EQ(unknown->status, 404);
}

}  // namespace
}  // namespace tamber
