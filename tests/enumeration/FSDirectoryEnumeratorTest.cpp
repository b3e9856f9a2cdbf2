#include "enumeration/FSDirectoryEnumerator.h"

#include <dirent.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <thread>

#include "enumeration/DirectoryListingCache.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using Op = FaultInjectingFileSystem::Operation;
using Names = std::vector<std::string>;

// Remembers the path of every statx call, and can hide the entry types as some file systems do.
class RecordingFileSystem : public FaultInjectingFileSystem {
public:
    RecordingFileSystem() : FaultInjectingFileSystem(std::make_shared<LinuxFileSystem>()) {}
    int statx(int dirfd, const std::string& path, int flags, unsigned int mask,
              struct statx* out) override {
        {
            std::lock_guard lock(mutex_);
            statted_.push_back(path);
        }
        return FaultInjectingFileSystem::statx(dirfd, path, flags, mask, out);
    }
    bool readDirectory(int dirfd, std::vector<DirectoryEntry>& out) override {
        bool ok = FaultInjectingFileSystem::readDirectory(dirfd, out);
        if (hideTypes)
            for (auto& entry : out) entry.type = DT_UNKNOWN;
        return ok;
    }
    Names statted() const {
        std::lock_guard lock(mutex_);
        return statted_;
    }
    bool hideTypes = false;

private:
    mutable std::mutex mutex_;
    Names statted_;
};

class FSDirectoryEnumeratorTest : public ::testing::Test {
protected:
    void SetUp() override { DirectoryListingCache::shared().clear(); }
    void TearDown() override { DirectoryListingCache::shared().clear(); }

    // The paths (relative to the temporary folder) of one page, and the walk's counter.
    std::pair<Names, uint64_t> page(std::vector<std::string> roots, bool recursively,
                                    uint64_t offset, uint64_t limit) {
        FSDirectoryEnumerator walk;
        for (const auto& root : roots) walk.urls.push_back(Url::fileURLWithPath(dir / root));
        walk.recursively = recursively;
        walk.offset = offset;
        walk.limit = limit;
        Names names;
        uint64_t counter = walk.enumerate(
            [&](const Url& url) { names.push_back(url.path().substr(dir.path().size() + 1)); });
        return {names, counter};
    }
    // Every page of `limit` until a short one, concatenated; checks the offsets on the way.
    Names allPages(std::vector<std::string> roots, bool recursively, uint64_t limit) {
        Names all;
        for (uint64_t offset = 0;; offset += limit) {
            auto [names, counter] = page(roots, recursively, offset, limit);
            EXPECT_EQ(counter, offset + names.size());
            all.insert(all.end(), names.begin(), names.end());
            if (names.size() < limit)
                return all;
        }
    }
    static std::string numbered(int i) {
        char name[16];
        std::snprintf(name, sizeof name, "f%04d", i);
        return name;
    }
    // File times tick coarsely: listings are kept only once the folder's last change is
    // safely in the past.
    static void letTimestampsSettle() {
        std::this_thread::sleep_for(
            std::chrono::nanoseconds(DirectoryListingCache::kFineMarginNanoseconds + 20'000'000));
    }

    testing::TempDir dir;
    testing::ScopedLogCapture log;
};

// A folder larger than the cache's bound is still kept while it is listed, alone: its pages do
// not each read it again, and the memory held stays that of one folder.
TEST_F(FSDirectoryEnumeratorTest, AListingOverTheBoundIsKeptAloneAndEvictsTheRest) {
    for (int i = 0; i < 3; ++i) dir.writeFile("small/" + numbered(i));
    for (int i = 0; i < 25; ++i) dir.writeFile("large/" + numbered(i));
    letTimestampsSettle();
    DirectoryListingCache cache(4, 10);
    auto small = cache.listing(dir / "small");
    ASSERT_TRUE(small.ok());
    EXPECT_EQ(cache.listing(dir / "small").value(), small.value()) << "a small folder is kept";

    auto large = cache.listing(dir / "large");
    ASSERT_TRUE(large.ok());
    EXPECT_EQ(large.value()->all.size(), 25u);
    EXPECT_EQ(cache.listing(dir / "large").value(), large.value()) << "read once for its pages";
    EXPECT_EQ(cache.listingCount(), 1u);
    EXPECT_NE(cache.listing(dir / "small").value(), small.value()) << "evicted by the large one";
    EXPECT_EQ(cache.listingCount(), 1u) << "the small one fits only once the large one is gone";
}

TEST_F(FSDirectoryEnumeratorTest, FlatFolderPagesInNameOrderWithConsistentOffsets) {
    for (int count : {199, 200, 450}) {
        std::string folder = "flat" + std::to_string(count);
        Names expected;
        // Created in reverse so that the listing order can't be the creation order.
        for (int i = count - 1; i >= 0; --i) dir.writeFile(folder + "/" + numbered(i));
        for (int i = 0; i < count; ++i) expected.push_back(folder + "/" + numbered(i));
        dir.writeFile(folder + "/.hidden");
        dir.writeFile(folder + "/.Trash/old.txt");

        std::vector<size_t> sizes;
        Names all;
        for (uint64_t offset = 0;; offset += 200) {
            auto [names, counter] = page({folder}, false, offset, 200);
            EXPECT_EQ(counter, offset + names.size()) << folder;
            sizes.push_back(names.size());
            all.insert(all.end(), names.begin(), names.end());
            if (names.size() < 200)
                break;
        }
        EXPECT_EQ(all, expected);
        std::vector<size_t> expectedSizes = count == 199   ? std::vector<size_t>{199}
                                            : count == 200 ? std::vector<size_t>{200, 0}
                                                           : std::vector<size_t>{200, 200, 50};
        EXPECT_EQ(sizes, expectedSizes) << folder;

        // An offset past the end delivers nothing and reports how far the walk got.
        auto [beyond, counter] = page({folder}, false, 10'000, 200);
        EXPECT_TRUE(beyond.empty());
        EXPECT_EQ(counter, static_cast<uint64_t>(count));
    }
    auto [none, counter] = page({"flat199"}, false, 0, 0);
    EXPECT_TRUE(none.empty()) << "a limit of 0 delivers nothing";
    EXPECT_EQ(counter, 0u);
}

TEST_F(FSDirectoryEnumeratorTest,
       RecursiveWalkIsDepthFirstByteOrderWithoutHiddenOrPackageContents) {
    dir.writeFile("a/B.txt");
    dir.writeFile("a/a.txt");
    dir.writeFile("a/sub/deep/x.txt");
    dir.writeFile("a/sub/y.txt");
    dir.writeFile("a/.git/config");
    dir.writeFile("a/sub/.cache/z");
    dir.writeFile("a/Deck.lumen/slide1.xml");
    dir.writeFile("a/Song.resona/Contents/track");
    dir.writeFile("a/zz.txt");
    dir.writeFile("b/only.txt");
    dir.writeFile("b/.Trash/t1.txt");

    const Names expected = {"a/B.txt",  "a/Deck.lumen", "a/Song.resona",    "a/a.txt",
                            "a/sub",    "a/sub/deep",   "a/sub/deep/x.txt", "a/sub/y.txt",
                            "a/zz.txt", "b/only.txt"};
    for (uint64_t limit : {1, 3, 200}) {
        EXPECT_EQ(allPages({"a", "b"}, true, limit), expected) << "pages of " << limit;
    }

    // Not recursive: direct children only; packages are items, not folders to open.
    EXPECT_EQ(allPages({"a"}, false, 200),
              (Names{"a/B.txt", "a/Deck.lumen", "a/Song.resona", "a/a.txt", "a/sub", "a/zz.txt"}));

    // A per-root override: the second root's top level only, hidden entries included.
    FSDirectoryEnumerator walk;
    walk.urls = {Url::fileURLWithPath(dir / "a/sub"), Url::fileURLWithPath(dir / "b")};
    walk.recursively = true;
    walk.limit = 100;
    walk.directoryEnumerationOptionsFor =
        [&](const Url& root) -> std::optional<DirectoryEnumerationOptions> {
        if (root.lastPathComponent() == "b")
            return DirectoryEnumerationOption::kSkipsSubdirectoryDescendants;
        return std::nullopt;
    };
    Names names;
    walk.enumerate([&](const Url& url) { names.push_back(url.lastPathComponent()); });
    EXPECT_EQ(names, (Names{"deep", "x.txt", "y.txt", ".Trash", "only.txt"}));
}

// A tree's next page goes on where the last one stopped instead of walking everything before
// its offset again; a folder on that path that changed since makes it count from the start.
TEST_F(FSDirectoryEnumeratorTest, ANextPageResumesWhereTheLastStoppedUnlessItsFolderChanged) {
    for (int i = 0; i < 5; ++i) {
        dir.writeFile("t/a" + std::to_string(i));
        dir.writeFile("t/sub/b" + std::to_string(i));
    }
    letTimestampsSettle();
    EXPECT_EQ(page({"t"}, true, 0, 4).first, (Names{"t/a0", "t/a1", "t/a2", "t/a3"}));
    EXPECT_EQ(page({"t"}, true, 4, 4).first, (Names{"t/a4", "t/sub", "t/sub/b0", "t/sub/b1"}));

    dir.writeFile("t/sub/0new");
    auto [third, counter] = page({"t"}, true, 8, 4);
    Names all = page({"t"}, true, 0, 100).first;
    ASSERT_EQ(all.size(), 12u);
    EXPECT_EQ(third, Names(all.begin() + 8, all.end()));
    EXPECT_EQ(counter, 12u);
}

TEST_F(FSDirectoryEnumeratorTest, SkippedEntriesAreNeverStattedAndUnknownTypesAreResolved) {
    for (int i = 0; i < 50; ++i) dir.writeFile("tree/" + numbered(i));
    dir.writeFile("tree/.hidden/secret");
    dir.writeFile("tree/Deck.lumen/inner");
    dir.writeFile("tree/sub/leaf");

    auto fs = std::make_shared<RecordingFileSystem>();
    testing::ScopedFileSystem scoped(fs);
    // "Deck.lumen" sorts first (upper case), so offset 41 is "f0040".
    auto [names, counter] = page({"tree"}, true, 41, 5);
    EXPECT_EQ(names, (Names{"tree/f0040", "tree/f0041", "tree/f0042", "tree/f0043", "tree/f0044"}));
    EXPECT_EQ(counter, 46u);
    for (const auto& path : fs->statted()) {
        EXPECT_EQ(path.find("secret"), std::string::npos) << path;
        EXPECT_EQ(path.find("inner"), std::string::npos) << path;
        EXPECT_EQ(path.find("f0039"), std::string::npos) << "skipped entries cost no stat";
        EXPECT_EQ(path.find("f0045"), std::string::npos) << "nothing past the page is read";
    }

    // Without entry types, a stat tells folders from files; packages are still not entered.
    fs->hideTypes = true;
    DirectoryListingCache::shared().clear();
    Names all = allPages({"tree"}, true, 200);
    ASSERT_EQ(all.size(), 53u);
    EXPECT_EQ(all[0], "tree/Deck.lumen");
    EXPECT_EQ(all[51], "tree/sub");
    EXPECT_EQ(all[52], "tree/sub/leaf");
    for (const auto& path : fs->statted()) EXPECT_EQ(path.find(".hidden"), std::string::npos);
}

TEST_F(FSDirectoryEnumeratorTest, UnreadableEntriesAreLoggedAndTheWalkGoesOn) {
    dir.writeFile("root/a/inside.txt");
    dir.writeFile("root/locked/inside.txt");
    dir.writeFile("root/z.txt");
    std::string file = dir.writeFile("plain.txt");

    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    fs->inject(Op::Open, EACCES, -1, "/locked");

    std::vector<std::string> handled;
    FSDirectoryEnumerator walk;
    walk.urls = {Url::fileURLWithPath(dir / "missing"), Url::fileURLWithPath(file),
                 Url::fileURLWithPath(dir / "root")};
    walk.recursively = true;
    walk.limit = 200;
    walk.errorHandler = [&](const Url& url, const Error& error) {
        handled.push_back(url.lastPathComponent() + ":" + std::to_string(error.code()));
        return FSDirectoryEnumerator::logEnumerationError(url, error);
    };
    Names names;
    uint64_t counter =
        walk.enumerate([&](const Url& url) { names.push_back(url.lastPathComponent()); });
    EXPECT_EQ(names, (Names{"a", "inside.txt", "locked", "z.txt"}));
    EXPECT_EQ(counter, 4u);
    EXPECT_EQ(handled, (Names{"missing:260", "locked:" + std::to_string(EACCES)}));
    EXPECT_EQ(log->count("[DEBUG] can't enumerate " + dir / "missing" + "; " +
                             Error::fileNoSuchFile(dir / "missing").description(),
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(log->count("[ERROR] can't enumerate " + dir / "root/locked" + "; " +
                             Error::posix(EACCES).description(),
                         LogLevel::Error),
              1u);
    EXPECT_EQ(log->count("[ERROR] can't create file enumerator at " + file, LogLevel::Error), 1u);

    // A handler that says stop ends that root's walk; the next root is still walked.
    walk.urls = {Url::fileURLWithPath(dir / "root"), Url::fileURLWithPath(dir / "root/a")};
    walk.errorHandler = [](const Url&, const Error&) { return false; };
    names.clear();
    walk.enumerate([&](const Url& url) { names.push_back(url.lastPathComponent()); });
    EXPECT_EQ(names, (Names{"a", "inside.txt", "locked", "inside.txt"}));
}

TEST_F(FSDirectoryEnumeratorTest, KeptListingServesLaterPagesButNeverAStaleFolder) {
    for (int i = 0; i < 600; ++i) dir.writeFile("big/" + numbered(i));
    letTimestampsSettle();

    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    EXPECT_EQ(allPages({"big"}, false, 200).size(), 600u);
    EXPECT_EQ(fs->calls(Op::ReadDirectory), 1u) << "four pages, one read of the folder";

    // A change right after the listing was kept: the next page must show it.
    dir.writeFile("big/a-new-first");
    std::filesystem::remove(dir / "big/f0599");
    auto [first, counter] = page({"big"}, false, 0, 2);
    EXPECT_EQ(first, (Names{"big/a-new-first", "big/f0000"}));
    EXPECT_EQ(fs->calls(Op::ReadDirectory), 2u);
    letTimestampsSettle();
    Names again = allPages({"big"}, false, 250);
    ASSERT_EQ(again.size(), 600u);
    EXPECT_EQ(again.back(), "big/f0598");
    EXPECT_EQ(fs->calls(Op::ReadDirectory), 3u);

    // A folder replaced by another under the same name is read again.
    std::filesystem::rename(dir / "big", dir / "old");
    dir.writeFile("big/only");
    EXPECT_EQ(allPages({"big"}, false, 200), Names{"big/only"});
}

TEST_F(FSDirectoryEnumeratorTest, ListingCacheStaysBounded) {
    for (int d = 0; d < 4; ++d)
        for (int i = 0; i < 10; ++i) dir.writeFile("d" + std::to_string(d) + "/" + numbered(i));
    letTimestampsSettle();

    auto listAll = [&](DirectoryListingCache& cache) {
        for (int d = 0; d < 4; ++d) {
            auto listing = cache.listing(dir / ("d" + std::to_string(d)));
            ASSERT_TRUE(listing.ok());
            EXPECT_EQ((*listing)->all.size(), 10u);
        }
    };
    DirectoryListingCache fewListings(2, 1000);
    listAll(fewListings);
    EXPECT_EQ(fewListings.listingCount(), 2u);
    DirectoryListingCache fewEntries(10, 25);
    listAll(fewEntries);
    EXPECT_EQ(fewEntries.listingCount(), 2u) << "a third listing of 10 would pass 25 entries";

    auto missing = fewEntries.listing(dir / "nope");
    ASSERT_FALSE(missing.ok());
    EXPECT_TRUE(missing.error().is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile));
}

}  // namespace
}  // namespace tamber
