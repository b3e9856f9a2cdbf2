#include <cerrno>
#include <fstream>
#include <iterator>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/Array.h"
#include "platform/objects/String.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/ScopedFileSystem.h"

namespace tamber::testing {
namespace {

using Op = FaultInjectingFileSystem::Operation;

Bytes cacheArchive(ObjectRef token, ObjectRef proxies) {
    std::map<std::string, ObjectRef> entries;
    if (token)
        entries["versionToken"] = token;
    if (proxies)
        entries["bundleProxy"] = proxies;
    return KeyedArchiver::archivedDataWithRootObject(Dictionary::make(entries)).value();
}

class LocalAppLibraryCacheTest : public AppLibraryTest {
protected:
    std::string mainPath() { return dir / "Tamber/app-libraries.plist"; }
    std::string readMain() {
        std::ifstream in(mainPath(), std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    // Replaces the main file behind the cache's back.
    void putMain(const Bytes& bytes) {
        std::filesystem::create_directories(dir / "Tamber");
        std::ofstream(mainPath(), std::ios::binary)
            .write(reinterpret_cast<const char*>(bytes.data()), std::streamsize(bytes.size()));
        log->clear();
    }
    std::shared_ptr<FaultInjectingFileSystem> faults =
        std::make_shared<FaultInjectingFileSystem>(FileSystem::currentShared());
};

TEST_F(LocalAppLibraryCacheTest, MissingFileAndRoundTrip) {
    auto empty = load(kMain);
    EXPECT_EQ(empty.versionToken, 0u);
    EXPECT_TRUE(empty.bundleRecords.empty());
    EXPECT_EQ(log->texts(), std::vector<std::string>{"[DEBUG] nothing cached on disk"});

    std::vector<BundleRecordRef> records{app("org.b"), app("org.a", std::nullopt)};
    ASSERT_EQ(save(kMain, records, 3).value(), 3u);
    ASSERT_EQ(save(kWorkingSet, {records[1]}, 9).value(), 9u);
    LocalAppLibraryCache::resetSharedForTesting();  // as in a new process
    auto loaded = load(kMain);
    EXPECT_EQ(loaded.versionToken, 3u);
    ASSERT_EQ(loaded.bundleRecords.size(), 2u);
    for (size_t i = 0; i < records.size(); ++i)
        EXPECT_TRUE(loaded.bundleRecords[i]->isEqual(*records[i])) << i;
    EXPECT_EQ(bundlesOf(load(kWorkingSet).bundleRecords), Identifiers{"org.a"});
}

TEST_F(LocalAppLibraryCacheTest, LogLinesNameTheFileByItsLastFourComponents) {
    auto cache = LocalAppLibraryCache::mainCache();
    EXPECT_EQ(cache->queue().label(), "tamber.app-library-cache.main");
    EXPECT_EQ(LocalAppLibraryCache::workingSetCache()->queue().label(),
              "tamber.app-library-cache.working-set");
    cache->queue().sync([&] {
        auto abbreviated = [&](const std::string& path) {
            return cache->abbreviatedPath(Url::fileURLWithPath(path));
        };
        EXPECT_EQ(abbreviated("/a/b/c/d/e/f.plist"), "~/c/d/e/f.plist");
        EXPECT_EQ(abbreviated("/c/d/e/f.plist"), "~/c/d/e/f.plist");
        EXPECT_EQ(abbreviated("/e/f.plist"), "~/e/f.plist");
        EXPECT_EQ(abbreviated("/f.plist"), "~/f.plist");
    });

    std::filesystem::path file = mainPath();
    std::string shown = "~/" + file.parent_path().parent_path().parent_path().filename().string() +
                        "/" + file.parent_path().parent_path().filename().string() +
                        "/Tamber/app-libraries.plist";
    ASSERT_TRUE(save(kMain, {app("org.a")}, 2).ok());
    std::string bytes = std::to_string(std::filesystem::file_size(file));
    EXPECT_EQ(log->texts(),
              std::vector<std::string>{"[DEBUG] wrote on disk " + bytes + " bytes at " + shown});
    log->clear();
    LocalAppLibraryCache::resetSharedForTesting();
    EXPECT_EQ(load(kMain).versionToken, 2u);
    EXPECT_EQ(log->texts(),
              (std::vector<std::string>{"[DEBUG] read from disk " + bytes + " bytes at " + shown,
                                        "[DEBUG] loaded 1 app library items from data",
                                        "[DEBUG] version token was set to 2 after load"}));
}

TEST_F(LocalAppLibraryCacheTest, DamagedFilesYieldNothingAndAreLeftAlone) {
    const std::string badToken =
        "[DEBUG] version token invalid; data on disk is corrupted let's reset";
    const std::string badProxies =
        "[DEBUG] bundle proxies invalid; data on disk is corrupted let's reset";
    BundleRecord::registerArchiveClass();
    auto proxies = Array::make({app("org.a")});
    auto uint5 = Number::fromUInt64(5);
    Bytes valid = cacheArchive(uint5, proxies);
    std::vector<std::pair<Bytes, std::string>> cases{
        {cacheArchive(Number::fromInt64(5), proxies), badToken},
        {cacheArchive(Number::fromDouble(5), proxies), badToken},
        {cacheArchive(uint5, nullptr), badProxies},
        {cacheArchive(uint5, Array::make({app("org.a"), String::make("org.b")})), badProxies},
        {Bytes(valid.begin(), valid.begin() + valid.size() / 2), "[ERROR] got "},
        {Bytes{'h', 'i'}, "[ERROR] got "},
    };
    for (const auto& [bytes, line] : cases) {
        SCOPED_TRACE(line);
        LocalAppLibraryCache::resetSharedForTesting();
        putMain(bytes);
        auto content = load(kMain);
        EXPECT_EQ(content.versionToken, 0u);
        EXPECT_TRUE(content.bundleRecords.empty());
        EXPECT_EQ(token(kMain), 0u);
        EXPECT_EQ(log->countStartingWith(line), 1u);
        EXPECT_EQ(log->countStartingWith("[DEBUG] loaded "), 0u);
        EXPECT_EQ(readMain(), std::string(bytes.begin(), bytes.end()));
    }

    ScopedFileSystem scoped(faults);
    LocalAppLibraryCache::resetSharedForTesting();
    putMain(valid);
    faults->inject(Op::Read, EIO, 1, "app-libraries.plist");
    EXPECT_TRUE(load(kMain).bundleRecords.empty());
    EXPECT_TRUE(log->contains("[ERROR] can't load cache from disk let's reset; " +
                              Error::posix(EIO).description()));
}

TEST_F(LocalAppLibraryCacheTest, VersionTokenRules) {
    std::vector<BundleRecordRef> records{app("org.a")};
    // Bumping ignores the given token and counts from the cache's own.
    EXPECT_EQ(save(kMain, records, 100, true).value(), 1u);
    EXPECT_EQ(save(kMain, records, 100, true).value(), 2u);

    // An older file is returned as it is but never lowers the token; a newer one raises it.
    ASSERT_EQ(save(kMain, records, 7).value(), 7u);
    putMain(cacheArchive(Number::fromUInt64(5), Array::make({})));
    EXPECT_EQ(load(kMain).versionToken, 5u);
    EXPECT_EQ(token(kMain), 7u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] version token was set"), 0u);
    putMain(cacheArchive(Number::fromUInt64(9), Array::make({})));
    EXPECT_EQ(load(kMain).versionToken, 9u);
    EXPECT_EQ(token(kMain), 9u);
    EXPECT_TRUE(log->contains("[DEBUG] version token was set to 9 after load"));

    // An explicit save may lower it, and the next bump starts from there.
    EXPECT_EQ(save(kMain, records, 3).value(), 3u);
    EXPECT_EQ(save(kMain, records, 0, true).value(), 4u);
}

TEST_F(LocalAppLibraryCacheTest, FailedSaveKeepsTheOldFileAndToken) {
    ScopedFileSystem scoped(faults);
    faults->inject(Op::Mkdir, EACCES, 1, "Tamber");
    EXPECT_EQ(save(kMain, {}, 3).error(), Error::posix(EACCES));
    EXPECT_FALSE(std::filesystem::exists(dir / "Tamber"));

    ASSERT_EQ(save(kMain, {app("org.a")}, 4).value(), 4u);
    std::string before = readMain();
    for (auto [op, code] : {std::pair{Op::Open, EACCES},
                            {Op::Write, ENOSPC},
                            {Op::Fsync, EIO},
                            {Op::Renameat2, EXDEV}}) {
        SCOPED_TRACE(FaultInjectingFileSystem::operationName(op));
        faults->inject(op, code, 1, "/Tamber/");
        log->clear();
        EXPECT_EQ(save(kMain, {app("org.b")}, 0, true).error(), Error::posix(code));
        EXPECT_EQ(token(kMain), 4u);
        EXPECT_EQ(readMain(), before);
        // No temporary file is left behind.
        EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir / "Tamber"), {}), 1);
        EXPECT_EQ(log->countStartingWith("[DEBUG] wrote on disk"), 0u);
    }
    EXPECT_EQ(save(kMain, {app("org.b")}, 0, true).value(), 5u);
}

}  // namespace
}  // namespace tamber::testing
