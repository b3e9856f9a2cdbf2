#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/imaging/PixbufThumbnailRenderer.h"
#include "server/DesktopThumbnails.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"
#include "tests/server/TestImages.h"

namespace tamber {
namespace {

using testing::decodedSize;
using testing::encodedImage;
using testing::ScopedFileSystem;
using testing::ScopedLogCapture;
using testing::TempDir;
using Operation = FaultInjectingFileSystem::Operation;
namespace fs = std::filesystem;

constexpr double kThumbnailTestPatience = 20;  // seconds: only a hang gets near it

std::string fileBytes(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

Bytes toBytes(const std::string& text) {
    return Bytes(text.begin(), text.end());
}

ScopedFd openForReading(const std::string& path) {
    return ScopedFd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
}

int64_t mtimeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::stat(path.c_str(), &st), 0) << path;
    return st.st_mtim.tv_sec;
}

void setMtime(const std::string& path, int64_t seconds) {
    struct timespec times[2] = {{seconds, 0}, {seconds, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
}

template <class Condition>
bool settlesInTime(Condition condition) {
    auto deadline =
        std::chrono::steady_clock::now() + std::chrono::duration<double>(kThumbnailTestPatience);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

// The real renderer, counted.
class CountingRenderer : public ThumbnailRenderer {
public:
    Result<Bytes> render(const Bytes& source, int edge, const TextChunks& text) override {
        ++calls;
        return real.render(source, edge, text);
    }
    std::atomic<int> calls{0};
    PixbufThumbnailRenderer real;
};

// A renderer that holds every rendering until opened, and records how many ran at once.
class GateRenderer : public ThumbnailRenderer {
public:
    Result<Bytes> render(const Bytes&, int, const TextChunks& text) override {
        std::unique_lock lock(mutex);
        ++calls;
        ++active;
        most = std::max(most, active);
        changed.notify_all();
        changed.wait(lock, [this] { return open; });
        --active;
        Bytes png = toBytes(encodedImage(4, 4, "png"));
        (void)text;
        return png;
    }
    void release() {
        std::lock_guard lock(mutex);
        open = true;
        changed.notify_all();
    }
    int activeNow() {
        std::lock_guard lock(mutex);
        return active;
    }
    std::mutex mutex;
    std::condition_variable changed;
    int calls = 0;
    int active = 0;
    int most = 0;
    bool open = false;
};

class DesktopThumbnailsTest : public ::testing::Test {
protected:
    std::unique_ptr<DesktopThumbnails> make(std::shared_ptr<ThumbnailRenderer> renderer,
                                            double patience = kThumbnailTestPatience) {
        DesktopThumbnails::Options options;
        options.cacheFolder = cache.path() + "/thumbnails";
        options.renderer = std::move(renderer);
        options.patience = patience;
        return std::make_unique<DesktopThumbnails>(std::move(options));
    }

    std::string cacheFile(const std::string& kind, const std::string& path) {
        return cache.path() + "/thumbnails/" + kind + "/" +
               DesktopThumbnails::cacheNameForUri(DesktopThumbnails::uriForPath(path));
    }

    TempDir files;
    TempDir cache;
};

// The cache is named as the desktop names it: an MD5 of the percent-encoded file URI.
TEST_F(DesktopThumbnailsTest, NamesFollowTheDesktopCache) {
    EXPECT_EQ(DesktopThumbnails::uriForPath("/home/ada/Pictures/a b.png"),
              "file:///home/ada/Pictures/a%20b.png");
    EXPECT_EQ(DesktopThumbnails::cacheNameForUri("file:///home/ada/Pictures/a%20b.png"),
              "15f65b62306efc5662adef849c339d9b.png");
    EXPECT_EQ(DesktopThumbnails::uriForPath("/p/#1 100%.png"), "file:///p/%231%20100%25.png");
}

// A PNG and a JPEG get thumbnails of the right size, stored under the right name with the
// file's URI and mtime, private to the user.
TEST_F(DesktopThumbnailsTest, RendersAndStoresPngAndJpeg) {
    auto renderer = std::make_shared<CountingRenderer>();
    auto thumbnails = make(renderer);
    const std::string png = files.writeFile("wide photo.png", encodedImage(400, 200, "png"));
    const std::string jpeg = files.writeFile("tall.jpg", encodedImage(300, 600, "jpeg"));

    auto small = thumbnails->thumbnail(png, openForReading(png), 64);
    ASSERT_TRUE(small.ok()) << small.error().description();
    EXPECT_EQ(decodedSize(small.value()), std::make_pair(128, 64));
    auto large = thumbnails->thumbnail(jpeg, openForReading(jpeg), 256);
    ASSERT_TRUE(large.ok()) << large.error().description();
    EXPECT_EQ(decodedSize(large.value()), std::make_pair(128, 256));

    for (auto [kind, path, served] :
         {std::tuple{"normal", png, small.value()}, std::tuple{"large", jpeg, large.value()}}) {
        const std::string stored = cacheFile(kind, path);
        ASSERT_TRUE(fs::exists(stored)) << stored;
        EXPECT_EQ(toBytes(fileBytes(stored)), served);
        auto text = DesktopThumbnails::pngText(served);
        EXPECT_EQ(text["Thumb::URI"],
                  "file://" + files.path() + "/" + (path == png ? "wide%20photo.png" : "tall.jpg"));
        EXPECT_EQ(text["Thumb::MTime"], std::to_string(mtimeOf(path)));
        struct stat st {};
        ASSERT_EQ(::stat(stored.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0600u);
        ASSERT_EQ(::stat(fs::path(stored).parent_path().c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 0777, 0700u);
        // Nothing temporary is left beside it.
        EXPECT_EQ(std::distance(fs::directory_iterator(fs::path(stored).parent_path()),
                                fs::directory_iterator()),
                  1);
    }
    EXPECT_EQ(renderer->calls, 2);

    // An image smaller than the thumbnail is not enlarged.
    const std::string tiny = files.writeFile("tiny.bmp", encodedImage(20, 10, "bmp"));
    auto kept = thumbnails->thumbnail(tiny, openForReading(tiny), 256);
    ASSERT_TRUE(kept.ok()) << kept.error().description();
    EXPECT_EQ(decodedSize(kept.value()), std::make_pair(20, 10));
}

// A valid cached thumbnail (ours or another program's) is served as it is; a changed mtime
// makes a new one.
TEST_F(DesktopThumbnailsTest, ReusesValidThumbnailsAndRemakesStaleOnes) {
    auto renderer = std::make_shared<CountingRenderer>();
    auto thumbnails = make(renderer);
    const std::string path = files.writeFile("a.png", encodedImage(300, 300, "png"));
    setMtime(path, 1700000000);

    auto first = thumbnails->thumbnail(path, openForReading(path), 128);
    ASSERT_TRUE(first.ok()) << first.error().description();
    auto second = thumbnails->thumbnail(path, openForReading(path), 100);
    ASSERT_TRUE(second.ok()) << second.error().description();
    EXPECT_EQ(second.value(), first.value());
    EXPECT_EQ(renderer->calls, 1);

    setMtime(path, 1700000500);
    auto third = thumbnails->thumbnail(path, openForReading(path), 128);
    ASSERT_TRUE(third.ok()) << third.error().description();
    EXPECT_EQ(renderer->calls, 2);
    EXPECT_EQ(DesktopThumbnails::pngText(third.value())["Thumb::MTime"], "1700000500");
    EXPECT_EQ(
        DesktopThumbnails::pngText(toBytes(fileBytes(cacheFile("normal", path))))["Thumb::MTime"],
        "1700000500");

    // Another program's thumbnail for the current mtime is taken as it is.
    PixbufThumbnailRenderer real;
    auto foreign = real.render(
        toBytes(encodedImage(50, 60, "png")), 256,
        {{"Thumb::URI", DesktopThumbnails::uriForPath(path)}, {"Thumb::MTime", "1700000500"}});
    ASSERT_TRUE(foreign.ok());
    fs::create_directories(cache.path() + "/thumbnails/large");
    std::ofstream(cacheFile("large", path), std::ios::binary)
        .write(reinterpret_cast<const char*>(foreign.value().data()),
               std::streamsize(foreign.value().size()));
    auto reused = thumbnails->thumbnail(path, openForReading(path), 256);
    ASSERT_TRUE(reused.ok());
    EXPECT_EQ(reused.value(), foreign.value());
    EXPECT_EQ(renderer->calls, 2);

    // One that names another file is not.
    auto misnamed =
        real.render(toBytes(encodedImage(50, 60, "png")), 256,
                    {{"Thumb::URI", "file:///elsewhere.png"}, {"Thumb::MTime", "1700000500"}});
    ASSERT_TRUE(misnamed.ok());
    std::ofstream(cacheFile("large", path), std::ios::binary | std::ios::trunc)
        .write(reinterpret_cast<const char*>(misnamed.value().data()),
               std::streamsize(misnamed.value().size()));
    auto remade = thumbnails->thumbnail(path, openForReading(path), 256);
    ASSERT_TRUE(remade.ok());
    EXPECT_EQ(renderer->calls, 3);
    EXPECT_EQ(decodedSize(remade.value()), std::make_pair(256, 256));
}

// Too large a file is refused before anything is read; bytes that are no image give an error
// and leave nothing in the cache.
TEST_F(DesktopThumbnailsTest, RefusesHugeFilesAndUndecodableBytes) {
    auto renderer = std::make_shared<CountingRenderer>();
    auto thumbnails = make(renderer);
    const std::string huge = files.writeFile("huge.png", encodedImage(8, 8, "png"));
    ASSERT_EQ(::truncate(huge.c_str(), off_t(DesktopThumbnails::kMaxSourceBytes + 1)), 0);
    auto refused = thumbnails->thumbnail(huge, openForReading(huge), 128);
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().is(kPosixErrorDomain, EFBIG)) << refused.error().description();
    EXPECT_EQ(renderer->calls, 0);
    // One another program made for it is still served.
    PixbufThumbnailRenderer real;
    auto made = real.render(toBytes(encodedImage(8, 8, "png")), 128,
                            {{"Thumb::URI", DesktopThumbnails::uriForPath(huge)},
                             {"Thumb::MTime", std::to_string(mtimeOf(huge))}});
    ASSERT_TRUE(made.ok());
    fs::create_directories(cache.path() + "/thumbnails/normal");
    std::ofstream(cacheFile("normal", huge), std::ios::binary)
        .write(reinterpret_cast<const char*>(made.value().data()),
               std::streamsize(made.value().size()));
    auto foreign = thumbnails->thumbnail(huge, openForReading(huge), 128);
    ASSERT_TRUE(foreign.ok()) << foreign.error().description();
    EXPECT_EQ(foreign.value(), made.value());
    EXPECT_EQ(renderer->calls, 0);

    // So is an image that would take too much memory to decode, however small its file.
    const std::string bomb = files.writeFile("bomb.png", testing::pngHeaderClaiming(30000, 30000));
    auto defused = thumbnails->thumbnail(bomb, openForReading(bomb), 128);
    ASSERT_FALSE(defused.ok());
    EXPECT_TRUE(defused.error().is(kPosixErrorDomain, EFBIG)) << defused.error().description();

    const std::string whole = encodedImage(64, 64, "png");
    for (std::string bad : {std::string("not an image at all"), whole.substr(0, 20), std::string(),
                            std::string("\x89PNG\r\n\x1a\n\xff\xff\xff\xff", 12)}) {
        // Each its own file: a failure is remembered by name and mtime.
        const std::string path = files.writeFile("bad" + std::to_string(bad.size()) + ".png", bad);
        const int before = renderer->calls;
        auto failed = thumbnails->thumbnail(path, openForReading(path), 128);
        ASSERT_FALSE(failed.ok()) << bad.size();
        EXPECT_TRUE(failed.error().is(kPosixErrorDomain, EBADMSG)) << failed.error().description();
        EXPECT_FALSE(fs::exists(cacheFile("normal", path)));
        EXPECT_EQ(renderer->calls, before + 1);
    }

    // A failure is remembered as the desktop remembers its own, so the file is not decoded
    // again until it changes.
    const std::string broken = files.writeFile("broken.jpg", "JFIF? no.");
    setMtime(broken, 1600000000);
    ASSERT_FALSE(thumbnails->thumbnail(broken, openForReading(broken), 128).ok());
    const int tried = renderer->calls;
    const std::string marker =
        cache.path() + "/thumbnails/fail/" + DesktopThumbnails::kFailureFolder + "/" +
        DesktopThumbnails::cacheNameForUri(DesktopThumbnails::uriForPath(broken));
    auto markerText = DesktopThumbnails::pngText(toBytes(fileBytes(marker)));
    EXPECT_EQ(markerText["Thumb::URI"], DesktopThumbnails::uriForPath(broken));
    EXPECT_EQ(markerText["Thumb::MTime"], "1600000000");
    EXPECT_EQ(decodedSize(fileBytes(marker)), std::make_pair(1, 1));
    auto again = thumbnails->thumbnail(broken, openForReading(broken), 256);
    ASSERT_FALSE(again.ok());
    EXPECT_TRUE(again.error().is(kPosixErrorDomain, EBADMSG)) << again.error().description();
    EXPECT_EQ(renderer->calls, tried);
    // Once it is a real image, it gets its thumbnail.
    files.writeFile("broken.jpg", encodedImage(30, 30, "jpeg"));
    setMtime(broken, 1600000001);
    auto mended = thumbnails->thumbnail(broken, openForReading(broken), 128);
    ASSERT_TRUE(mended.ok()) << mended.error().description();
    EXPECT_EQ(renderer->calls, tried + 1);

    // A file cut short in its pixel data may give a partial picture, but never a crash nor
    // anything other than a valid thumbnail or that error.
    for (size_t cut = 33; cut < whole.size(); cut += 9) {
        const std::string path =
            files.writeFile("cut" + std::to_string(cut) + ".png", whole.substr(0, cut));
        auto partial = thumbnails->thumbnail(path, openForReading(path), 128);
        if (partial.ok())
            EXPECT_EQ(decodedSize(partial.value()), std::make_pair(64, 64)) << cut;
        else
            EXPECT_TRUE(partial.error().is(kPosixErrorDomain, EBADMSG)) << cut;
    }
}

// At most two renderings run at once, the rest wait their turn; a caller that waits too long
// gets a clear error, and the thumbnail is still made.
TEST_F(DesktopThumbnailsTest, RendersAtMostTwoAtOnce) {
    auto gate = std::make_shared<GateRenderer>();
    auto thumbnails = make(gate);
    constexpr int kRequests = 5;
    std::vector<std::string> paths;
    for (int i = 0; i < kRequests; ++i)
        paths.push_back(files.writeFile(std::to_string(i) + ".png", "x"));
    std::vector<std::optional<Result<Bytes>>> results(kRequests);
    std::vector<std::thread> callers;
    for (int i = 0; i < kRequests; ++i)
        callers.emplace_back([&, i] {
            results[i] = thumbnails->thumbnail(paths[i], openForReading(paths[i]), 128);
        });
    const bool allWaiting = settlesInTime(
        [&] { return gate->activeNow() == 2 && thumbnails->queuedForTesting() == kRequests - 2; });
    EXPECT_TRUE(allWaiting);
    gate->release();
    for (auto& caller : callers) caller.join();
    EXPECT_EQ(gate->most, 2);
    EXPECT_EQ(gate->calls, kRequests);
    for (auto& result : results) {
        ASSERT_TRUE(result.has_value());
        EXPECT_TRUE(result->ok()) << result->error().description();
    }
}

TEST_F(DesktopThumbnailsTest, ImpatientCallerGetsTimeoutAndTheThumbnailIsStillMade) {
    auto gate = std::make_shared<GateRenderer>();
    auto thumbnails = make(gate, 0.05);
    const std::string path = files.writeFile("slow.png", "x");
    auto late = thumbnails->thumbnail(path, openForReading(path), 128);
    ASSERT_FALSE(late.ok());
    EXPECT_TRUE(late.error().is(kPosixErrorDomain, ETIMEDOUT)) << late.error().description();
    gate->release();
    EXPECT_TRUE(settlesInTime([&] { return fs::exists(cacheFile("normal", path)); }));
}

// Two callers asking for the same thumbnail share one rendering.
TEST_F(DesktopThumbnailsTest, SimultaneousRequestsShareOneRendering) {
    auto gate = std::make_shared<GateRenderer>();
    auto thumbnails = make(gate);
    const std::string path = files.writeFile("same.png", "x");
    std::optional<Result<Bytes>> a, b;
    std::thread first([&] { a = thumbnails->thumbnail(path, openForReading(path), 128); });
    ASSERT_TRUE(settlesInTime([&] { return gate->activeNow() == 1; }));
    std::thread second([&] { b = thumbnails->thumbnail(path, openForReading(path), 128); });
    ASSERT_TRUE(settlesInTime([&] { return thumbnails->waitingForTesting() == 2; }));
    gate->release();
    first.join();
    second.join();
    ASSERT_TRUE(a && a->ok() && b && b->ok());
    EXPECT_EQ(a->value(), b->value());
    EXPECT_EQ(gate->calls, 1);
}

// Text chunks are read only from a well-formed PNG; damaged input gives none, never a crash.
TEST_F(DesktopThumbnailsTest, PngTextSurvivesDamagedFiles) {
    PixbufThumbnailRenderer real;
    auto png = real.render(toBytes(encodedImage(10, 10, "png")), 128,
                           {{"Thumb::URI", "file:///x.png"}, {"Thumb::MTime", "12"}});
    ASSERT_TRUE(png.ok());
    auto text = DesktopThumbnails::pngText(png.value());
    EXPECT_EQ(text["Thumb::URI"], "file:///x.png");
    EXPECT_EQ(text["Thumb::MTime"], "12");
    for (size_t cut = 0; cut < png.value().size(); cut += 7) {
        Bytes part(png.value().begin(), png.value().begin() + long(cut));
        auto partial = DesktopThumbnails::pngText(part);
        EXPECT_LE(partial.size(), 2u);
    }
    Bytes lying = png.value();
    lying[8] = 0xff;  // the first chunk claims to be enormous
    EXPECT_TRUE(DesktopThumbnails::pngText(lying).empty());
}

// The cache is best-effort: a thumbnail that cannot be stored is still served, and nothing
// half-written is left behind. A source that cannot be read is an error, not a broken image.
TEST_F(DesktopThumbnailsTest, FileSystemFaultsNeitherLoseThumbnailsNorLeaveDebris) {
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem installed(faults);
    ScopedLogCapture log;
    auto renderer = std::make_shared<CountingRenderer>();
    auto thumbnails = make(renderer);
    const std::string normal = cache.path() + "/thumbnails/normal";

    struct Fault {
        Operation operation;
        int error;
    };
    int served = 0;
    for (Fault fault : {Fault{Operation::Mkdir, EACCES}, Fault{Operation::Write, ENOSPC},
                        Fault{Operation::Renameat2, EIO}}) {
        const std::string path =
            files.writeFile("f" + std::to_string(served) + ".png", encodedImage(90, 30, "png"));
        faults->inject(fault.operation, fault.error, -1, "/thumbnails");
        auto thumb = thumbnails->thumbnail(path, openForReading(path), 128);
        faults->clearInjections();
        ASSERT_TRUE(thumb.ok()) << FaultInjectingFileSystem::operationName(fault.operation) << ": "
                                << thumb.error().description();
        EXPECT_EQ(decodedSize(thumb.value()), std::make_pair(90, 30));
        EXPECT_FALSE(fs::exists(cacheFile("normal", path)));
        if (fs::exists(normal)) {
            EXPECT_TRUE(fs::is_empty(normal))
                << FaultInjectingFileSystem::operationName(fault.operation);
        }
        ++served;
    }
    // Each lost write is said in the log, for whoever wonders why the cache stays empty.
    const auto texts = log->texts();
    EXPECT_EQ(std::count_if(texts.begin(), texts.end(),
                            [](const std::string& line) {
                                return line.find("thumbnail cache ") != std::string::npos;
                            }),
              3)
        << ::testing::PrintToString(texts);

    const std::string unreadable = files.writeFile("unreadable.png", encodedImage(10, 10, "png"));
    faults->inject(Operation::Read, EIO, -1, "unreadable.png");
    auto failed = thumbnails->thumbnail(unreadable, openForReading(unreadable), 128);
    faults->clearInjections();
    ASSERT_FALSE(failed.ok());
    EXPECT_TRUE(failed.error().is(kPosixErrorDomain, EIO)) << failed.error().description();
    EXPECT_FALSE(fs::exists(cache.path() + "/thumbnails/fail"));
    // Readable again, it gets its thumbnail at once.
    auto later = thumbnails->thumbnail(unreadable, openForReading(unreadable), 128);
    ASSERT_TRUE(later.ok()) << later.error().description();
}

}  // namespace
}  // namespace tamber
