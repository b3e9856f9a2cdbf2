#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "host/RecordingHostPorterManager.h"
#include "items/AppLibraryLookup.h"
#include "items/TBFileObjectIdentifier.h"
#include "items/TBPFileObjectIdentifier.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/FakeStrataService.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::FakeStrataService;
using testing::ScopedLogCapture;
using testing::TempDir;
using Op = FaultInjectingFileSystem::Operation;

uint64_t inodeOf(const std::string& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st.st_ino;
}

class FakeLibraries : public AppLibraryLookup {
public:
    std::vector<std::pair<Url, std::string>> libraries;
    std::vector<Url> rootURLsForAppLibraries() override {
        std::vector<Url> roots;
        for (auto& [url, bundle] : libraries) roots.push_back(url);
        return roots;
    }
    std::optional<std::string> bundleIdentifierForRoot(const Url& url,
                                                       UrlRelationship relationship) override {
        for (auto& [root, bundle] : libraries)
            if (pt_relationshipToItemAtURL(root, url) == relationship)
                return bundle;
        return std::nullopt;
    }
};

class ItemIdentifierTest : public ::testing::Test {
protected:
    void SetUp() override {
        storagePath = dir.makeDir("Documents");
        previousManager = HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storagePath)));
        previousStrata = StrataService::setCurrent(strata);
        previousLibraries = AppLibraryLookup::setCurrent(libraries);
    }
    void TearDown() override {
        HostPorterManager::installDefaultManager(previousManager);
        StrataService::setCurrent(previousStrata);
        AppLibraryLookup::setCurrent(previousLibraries);
    }
    std::optional<std::string> idOf(const std::string& path) {
        return TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(path));
    }

    TempDir dir;
    std::string storagePath;
    std::shared_ptr<FakeStrataService> strata = std::make_shared<FakeStrataService>();
    std::shared_ptr<FakeLibraries> libraries = std::make_shared<FakeLibraries>();
    std::shared_ptr<HostPorterManager> previousManager;
    std::shared_ptr<StrataService> previousStrata;
    std::shared_ptr<AppLibraryLookup> previousLibraries;
};

TEST_F(ItemIdentifierTest, StorageFolderIsTheRootAndBack) {
    EXPECT_EQ(idOf(storagePath), HostPorterRootContainerItemIdentifier);
    auto url =
        TBFileObjectIdentifier::fileURLWithItemIdentifier(HostPorterRootContainerItemIdentifier);
    ASSERT_TRUE(url);
    EXPECT_EQ(url->path(), storagePath);
}

TEST_F(ItemIdentifierTest, FoldersGetFileIdsDocumentsAndPackagesGetDocumentIds) {
    std::string folder = dir.makeDir("Documents/Projects");
    std::string file = dir.writeFile("Documents/Projects/plan.txt", "x");
    std::string package = dir.makeDir("Documents/Talk.lumen");
    std::string link = storagePath + "/link";
    ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
    std::string fifo = storagePath + "/pipe";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);

    EXPECT_EQ(idOf(folder), "fid=" + std::to_string(inodeOf(folder)));
    EXPECT_EQ(idOf(file), "did=1");
    EXPECT_EQ(idOf(package), "did=2");
    EXPECT_EQ(idOf(link), "fid=" + std::to_string(inodeOf(link)));
    EXPECT_EQ(idOf(fifo), "fid=" + std::to_string(inodeOf(fifo)));
    // A document keeps its ID: a fresh URL finds it without allocating again.
    EXPECT_EQ(idOf(file), "did=1");
    EXPECT_EQ(strata->allocations(), 2);
}

TEST_F(ItemIdentifierTest, SecondCallOnTheSameUrlUsesTheCache) {
    Url file = Url::fileURLWithPath(dir.writeFile("Documents/a.txt", "x"));
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    ASSERT_EQ(TBFileObjectIdentifier::itemIdentifier(file), "did=1");
    EXPECT_EQ(fs->calls(Op::Open), 1u);  // the event-only descriptor
    fs->resetCalls();
    ASSERT_EQ(TBFileObjectIdentifier::itemIdentifier(file), "did=1");
    EXPECT_EQ(fs->calls(Op::Open), 0u);
    EXPECT_EQ(strata->allocations(), 1);
}

TEST_F(ItemIdentifierTest, FailuresOnTheWayAreLoggedAndGiveNothing) {
    std::string file = dir.writeFile("Documents/a.txt", "x");
    {
        strata->failAllocation(EIO);
        ScopedLogCapture log;
        EXPECT_FALSE(idOf(file));
        EXPECT_TRUE(log->contains("can't get permanent storage for \"" + file + "\""));
        strata->failAllocation(0);
    }
    {
        auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
        testing::ScopedFileSystem scoped(fs);
        fs->inject(Op::Open, EMFILE);
        ScopedLogCapture log;
        EXPECT_FALSE(idOf(file));
        EXPECT_TRUE(log->contains("can't open file at \"" + file + "\"; [" +
                                  std::to_string(EMFILE) + ": " + std::strerror(EMFILE) + "]"));
    }
    {
        ScopedLogCapture log;
        EXPECT_FALSE(idOf(storagePath + "/missing.txt"));
        ASSERT_EQ(log->lines().size(), 1u);
        EXPECT_EQ(log->lines()[0].level, LogLevel::Info);
        EXPECT_EQ(log->lines()[0].text.rfind(
                      "can't get resource value for HostURLDocumentIdentifierKey; ", 0),
                  0u);
    }
    {
        ScopedLogCapture log;
        EXPECT_FALSE(TBFileObjectIdentifier::itemIdentifier(*Url::parse("https://example.org/x")));
        EXPECT_EQ(
            log->count("can't compute file object identifier if not a file URL", LogLevel::Error),
            1u);
    }
}

TEST_F(ItemIdentifierTest, OutsideThePublishedFoldersThereIsNoIdentifier) {
    std::string outside = dir.writeFile("elsewhere.txt", "x");
    ScopedLogCapture log;
    EXPECT_FALSE(idOf(outside));
    EXPECT_EQ(log->count("can't compute file object identifier because \"" + outside +
                             "\" is not part of Tamber",
                         LogLevel::Info),
              1u);
    EXPECT_EQ(strata->allocations(), 0);
}

TEST_F(ItemIdentifierTest, AppLibraryRootsAndTheirContents) {
    std::string library = dir.makeDir("apps/com.example.notes/Documents");
    std::string note = dir.writeFile("apps/com.example.notes/Documents/n.txt", "x");
    std::string folder = dir.makeDir("apps/com.example.notes/Documents/sub");
    libraries->libraries.emplace_back(Url::fileURLWithPath(library), "com.example.notes");

    EXPECT_EQ(idOf(library), "#com.example.notes");
    EXPECT_EQ(idOf(note), "did=1");
    EXPECT_EQ(idOf(folder), "fid=" + std::to_string(inodeOf(folder)));

    // A root whose record cannot be found says so.
    ScopedLogCapture log;
    EXPECT_FALSE(TBPFileObjectIdentifier::fromAppLibraryDataContainerURL(
        Url::fileURLWithPath(dir.makeDir("apps/gone/Documents"))));
    EXPECT_EQ(log->countStartingWith("[ERROR] can't find bundle proxy at file://"), 1u);
}

TEST_F(ItemIdentifierTest, MalformedIdentifiersAreRejected) {
    struct Case {
        std::string identifier;
        std::string line;
    };
    for (const auto& c : std::vector<Case>{
             {"fid=1=2", "invalid identifier; identifier should have 2 components, not 3"},
             {"fid", "invalid identifier; identifier should have 2 components, not 1"},
             {"#com.example.app", "invalid identifier; identifier should have 2 components, not 1"},
             {"xid=5", "invalid host for identifier \"xid=5\""},
             {"=5", "invalid host for identifier \"=5\""}}) {
        ScopedLogCapture log;
        EXPECT_FALSE(TBFileObjectIdentifier::fileURLWithItemIdentifier(c.identifier));
        EXPECT_EQ(log->count(c.line, LogLevel::Error), 1u) << c.identifier;
    }
}

TEST_F(ItemIdentifierTest, IdentifiersResolveBackToTheirFiles) {
    std::string folder = dir.makeDir("Documents/F");
    std::string file = dir.writeFile("Documents/F/doc.txt", "x");
    strata->publish(folder);
    strata->publish(file);
    auto fileId = idOf(file);
    auto folderId = idOf(folder);
    ASSERT_TRUE(fileId && folderId);
    EXPECT_EQ(TBFileObjectIdentifier::fileURLWithItemIdentifier(*fileId)->path(), file);
    EXPECT_EQ(TBFileObjectIdentifier::fileURLWithItemIdentifier(*folderId)->path(), folder);

    // An inode the index does not know (outside the trees) never resolves.
    ScopedLogCapture log;
    std::string outside = dir.writeFile("outside.txt");
    EXPECT_FALSE(TBFileObjectIdentifier::fileURLWithItemIdentifier(
        "fid=" + std::to_string(inodeOf(outside))));
    EXPECT_EQ(log->countStartingWith("can't resolve path matching file ID \""), 1u);
}

TEST_F(ItemIdentifierTest, DocumentResolutionRetriesOnlyPassingFailures) {
    std::string file = dir.writeFile("Documents/doc.txt", "x");
    strata->publish(file);
    ASSERT_EQ(idOf(file), "did=1");

    struct Case {
        std::deque<int> errors;
        int expectedResolutions;
        bool resolves;
    };
    std::vector<Case> cases = {
        {{EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN}, 6, false},
        {{ENOENT}, 1, false},
        {{EBUSY, ESTALE}, 3, true},
        {{EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN}, 6, true},
    };
    for (const auto& c : cases) {
        int before = strata->resolutions();
        strata->failResolutions(c.errors);
        ScopedLogCapture log;
        auto url = TBFileObjectIdentifier::fileURLWithItemIdentifier("did=1");
        EXPECT_EQ(strata->resolutions() - before, c.expectedResolutions);
        EXPECT_EQ(url.has_value(), c.resolves);
        if (c.errors.front() == ENOENT) {
            EXPECT_EQ(log->countStartingWith("can't resolve doc ID \"1\"; [2: "), 1u);
        } else if (!c.resolves) {
            EXPECT_EQ(log->count("doc ID resolution failed with errno(" + std::to_string(EAGAIN) +
                                     "), let's try again after resting",
                                 LogLevel::Info),
                      5u);
            EXPECT_EQ(log->count("can't resolve doc ID \"1\" after five attempts", LogLevel::Info),
                      1u);
        }
    }
}

TEST_F(ItemIdentifierTest, DeviceIdIsZeroWithAnErrorForAMissingItem) {
    Error error;
    EXPECT_EQ(TBFileObjectIdentifier::deviceIDWithError(Url::fileURLWithPath(dir / "nope"), &error),
              0u);
    EXPECT_EQ(error, Error::posix(ENOENT));
    EXPECT_NE(TBFileObjectIdentifier::deviceID(Url::fileURLWithPath(storagePath)), 0u);
}

}  // namespace
}  // namespace tamber
