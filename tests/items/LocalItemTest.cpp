#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <deque>
#include <filesystem>
#include <optional>
#include <tuple>

#include "host/RecordingHostPorterManager.h"
#include "items/AppLibraryLookup.h"
#include "items/ItemMetadata.h"
#include "items/LocalAppLibraryItem.h"
#include "items/LocalItem.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/FakeAppLibraryLookup.h"
#include "tests/common/FakeStrataService.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/ScopedSlots.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::ScopedLogCapture;

// A document storage folder "Documents" and one app library, "Apps/app/Documents" of
// "com.example.app", on a real temporary folder, with a fault-injecting file system installed.
class ItemTest : public ::testing::Test {
protected:
    using Op = FaultInjectingFileSystem::Operation;

    // Lists one folder as empty, as a count read before its entries appeared would be.
    class EmptyListingFileSystem : public FaultInjectingFileSystem {
    public:
        explicit EmptyListingFileSystem(std::string path)
            : FaultInjectingFileSystem(std::make_shared<LinuxFileSystem>()),
              path_(std::move(path)) {}
        int open(const std::string& path, int flags, mode_t mode) override {
            int fd = FaultInjectingFileSystem::open(path, flags, mode);
            if (path == path_)
                emptyFd_ = fd;
            return fd;
        }
        bool readDirectory(int dirfd, std::vector<DirectoryEntry>& out) override {
            bool read = FaultInjectingFileSystem::readDirectory(dirfd, out);
            if (read && dirfd == emptyFd_)
                out.clear();
            return read;
        }

    private:
        std::string path_;
        int emptyFd_ = -1;
    };

    void SetUp() override {
        storage = dir.makeDir("Documents");
        library = dir.makeDir("Apps/app/Documents");
        libraries->libraries.emplace_back(Url::fileURLWithPath(library), "com.example.app");
        slots.emplace(std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storage)),
                      strata, libraries);
    }
    void TearDown() override { slots.reset(); }
    static std::string fid(const std::string& path) {
        struct stat st {};
        EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
        return "fid=" + std::to_string(st.st_ino);
    }

    LocalItemRef make(const std::string& path, const LocalItemOptions& options = {}) {
        return LocalItem::make(Url::fileURLWithPath(path), options);
    }
    BundleRecordRef libraryRecord(std::optional<std::string> container) {
        BundleRecord::Fields fields{"com.example.app", "Example", std::nullopt, std::nullopt};
        if (container)
            fields.dataContainerURL = Url::fileURLWithPath(*container);
        return BundleRecord::make(std::move(fields));
    }
    static std::optional<uint64_t> count(const std::shared_ptr<const LocalItem>& item) {
        if (!item || !item->childItemCount())
            return std::nullopt;
        return item->childItemCount()->uint64Value();
    }
    std::optional<std::string> idOf(const std::string& path) {
        return TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(path));
    }
    std::optional<Url> urlOf(const std::string& identifier) {
        return TBFileObjectIdentifier::fileURLWithItemIdentifier(identifier);
    }

    testing::TempDir dir;
    std::string storage;
    std::string library;
    std::shared_ptr<testing::FakeStrataService> strata =
        std::make_shared<testing::FakeStrataService>();
    std::shared_ptr<testing::FakeAppLibraryLookup> libraries =
        std::make_shared<testing::FakeAppLibraryLookup>();
    std::shared_ptr<FaultInjectingFileSystem> fs =
        std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scopedFileSystem{fs};
    std::optional<testing::ScopedSlots> slots;
};

TEST_F(ItemTest, RecordsAndIdentifierForms) {
    std::string folder = dir.makeDir("Documents/Projects");
    dir.makeDir("Documents/Projects/a");
    dir.makeDir("Documents/Projects/b");
    std::string file = dir.writeFile("Documents/Projects/plan.txt", "hello");
    std::string package = dir.makeDir("Documents/Talk.lumen");
    std::string link = storage + "/link";
    ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
    std::string fifo = storage + "/pipe";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    std::string inLibrary = dir.makeDir("Apps/app/Documents/sub");

    EXPECT_EQ(idOf(storage), HostPorterRootContainerItemIdentifier);
    EXPECT_EQ(urlOf(HostPorterRootContainerItemIdentifier)->path(), storage);
    EXPECT_EQ(idOf(folder), fid(folder));
    EXPECT_EQ(idOf(file), "did=1");
    EXPECT_EQ(idOf(package), "did=2");
    EXPECT_EQ(idOf(link), fid(link));
    EXPECT_EQ(idOf(fifo), fid(fifo));
    EXPECT_EQ(idOf(library), "#com.example.app");
    EXPECT_EQ(idOf(inLibrary), fid(inLibrary));

    // A document keeps its ID: a fresh URL finds it without allocating again.
    auto item = make(file);
    ASSERT_TRUE(item);
    EXPECT_EQ(item->itemIdentifier(), "did=1");
    EXPECT_EQ(strata->allocations(), 2);
    EXPECT_EQ(item->parentItemIdentifier(), fid(folder));
    EXPECT_EQ(item->typeIdentifier(), "public.plain-text");
    EXPECT_EQ(item->documentSize()->uint64Value(), 5u);
    // The version follows the modification date.
    ASSERT_TRUE(item->versionIdentifier());
    EXPECT_EQ(make(file)->versionIdentifier(), item->versionIdentifier());
    std::filesystem::last_write_time(
        file, std::filesystem::last_write_time(file) - std::chrono::hours(1));
    EXPECT_NE(make(file)->versionIdentifier(), item->versionIdentifier());

    auto projects = make(folder);
    ASSERT_TRUE(projects);
    EXPECT_EQ(projects->parentItemIdentifier(), HostPorterRootContainerItemIdentifier);
    EXPECT_EQ(count(projects), 3u);  // two sub-folders and a file
    EXPECT_EQ(make(storage)->parentItemIdentifier(), HostPorterRootContainerItemIdentifier);

    ScopedLogCapture log;
    std::string outside = dir.writeFile("elsewhere.txt", "x");
    EXPECT_FALSE(idOf(outside));
    EXPECT_EQ(log->count("can't compute file object identifier because \"" + outside +
                             "\" is not part of Tamber",
                         LogLevel::Info),
              1u);
    EXPECT_EQ(strata->allocations(), 2);
}

TEST_F(ItemTest, Capabilities) {
    // The root is never more than readable; a library folder takes only two.
    EXPECT_EQ(make(storage)->capabilities(), 0x01u);
    EXPECT_EQ(make(dir.writeFile("Documents/a.txt", "x"))->capabilities(), 0x3Fu);
    auto inLibrary = make(dir.writeFile("Apps/app/Documents/notes.txt", "x"));
    EXPECT_EQ(inLibrary->parentItemIdentifier(), "#com.example.app");
    EXPECT_EQ(inLibrary->capabilities(), 0x3Fu);
    EXPECT_EQ(LocalAppLibraryItem::initFrom(libraryRecord(dir / "Apps/app"))->capabilities(),
              0x03u);

    std::string locked = dir.writeFile("Documents/locked.txt", "x");
    fs->inject(Op::Faccessat, EACCES, -1, locked);
    EXPECT_EQ(make(locked)->capabilities(), 0x01u);
    fs->inject(Op::Faccessat, EACCES, -1, library);
    EXPECT_EQ(LocalAppLibraryItem::initFrom(libraryRecord(dir / "Apps/app"))->capabilities(),
              0x01u);
}

TEST_F(ItemTest, InboxIsHiddenOnlyDirectlyUnderTheRootOrALibrary) {
    ScopedLogCapture log;
    EXPECT_FALSE(make(dir.makeDir("Documents/Inbox")));
    EXPECT_FALSE(make(dir.makeDir("Apps/app/Documents/Inbox")));
    EXPECT_EQ(
        log->count("[DEBUG] can't create an item for the \"Inbox\" directory", LogLevel::Debug),
        2u);
    EXPECT_TRUE(make(dir.makeDir("Documents/Sub/Inbox")));
    EXPECT_TRUE(make(dir.makeDir("Apps/app/Documents/Sub/Inbox")));
}

TEST_F(ItemTest, OnlyContentsOfATopLevelTrashAreTrashed) {
    EXPECT_TRUE(make(dir.writeFile("Documents/.Trash/old.txt"))->isTrashed());
    EXPECT_TRUE(make(dir.writeFile("Apps/app/Documents/.Trash/Old/deep.txt"))->isTrashed());
    EXPECT_FALSE(make(storage + "/.Trash")->isTrashed());
    EXPECT_FALSE(make(dir.writeFile("Documents/Sub/.Trash/kept.txt"))->isTrashed());
}

TEST_F(ItemTest, DescriptionNamesParentTypeTrashAndRank) {
    auto address = [](const void* object) {
        char text[32];
        std::snprintf(text, sizeof text, "%p", object);
        return std::string(text);
    };
    auto plain = make(dir.writeFile("Documents/a.txt", "x"));
    ASSERT_TRUE(plain);
    EXPECT_EQ(plain->description(), "<LocalItem:" + address(plain.get()) + " " +
                                        plain->itemIdentifier() +
                                        " name:\"a.txt\" parent:root type:public.plain-text>");

    std::string old = dir.writeFile("Documents/.Trash/old.txt", "x");
    if (!ItemMetadata::writeFavoriteRank(Url::fileURLWithPath(old), Number::fromInt64(3)).ok())
        GTEST_SKIP() << "no user attributes on this file system";
    auto trashed = make(old);
    ASSERT_TRUE(trashed);
    EXPECT_EQ(trashed->description(), "<LocalItem:" + address(trashed.get()) + " " +
                                          trashed->itemIdentifier() +
                                          " name:\"old.txt\" parent:" + fid(storage + "/.Trash") +
                                          " type:public.plain-text trashed favorite:3>");

    auto libraryItem = LocalAppLibraryItem::initFrom(libraryRecord(dir / "Apps/app"));
    ASSERT_TRUE(libraryItem);
    EXPECT_EQ(libraryItem->description(),
              "<LocalAppLibraryItem:" + address(libraryItem.get()) +
                  " #com.example.app name:\"Example\" parent:root type:public.folder>");
}

TEST_F(ItemTest, OnlyLumenAndResonaPackagesReportTheirSummedSize) {
    dir.writeFile("Documents/Talk.lumen/slides.txt", "abc");
    dir.writeFile("Documents/Talk.lumen/media/clip", "defg");
    dir.writeFile("Documents/Song.resona/track", "hi");
    dir.writeFile("Documents/Tool.bundle/binary", "12345");
    dir.writeFile("Documents/Broken.lumen/x", "12345");
    auto size = [&](const std::string& name) -> std::optional<uint64_t> {
        auto item = make(storage + "/" + name);
        EXPECT_TRUE(item) << name;
        if (!item || !item->documentSize())
            return std::nullopt;
        return item->documentSize()->uint64Value();
    };
    EXPECT_EQ(size("Talk.lumen"), 7u);
    EXPECT_EQ(size("Song.resona"), 2u);
    EXPECT_EQ(size("Tool.bundle"), std::nullopt);
    // A walk that fails leaves the size out, not the record.
    fs->inject(Op::ReadDirectory, EIO, 1, "Broken.lumen");
    EXPECT_EQ(size("Broken.lumen"), std::nullopt);
    EXPECT_EQ(fs->pendingInjections(), 0u);
}

TEST_F(ItemTest, ChildCountIsEveryEntryOfAFolder) {
    std::string folder = dir.makeDir("Documents/Counted");
    EXPECT_EQ(count(make(folder)), 0u);
    dir.makeDir("Documents/Counted/a");
    dir.writeFile("Documents/Counted/b.txt");
    dir.writeFile("Documents/Counted/.hidden");
    EXPECT_EQ(count(make(folder)), 3u);
    EXPECT_EQ(count(make(dir.writeFile("Documents/file.txt"))), std::nullopt);
    // A folder that can't be read has no count, and still a record.
    fs->inject(Op::ReadDirectory, EACCES, 1, "Counted");
    auto unreadable = make(folder);
    ASSERT_TRUE(unreadable);
    EXPECT_EQ(count(unreadable), std::nullopt);
}

TEST_F(ItemTest, AppLibraryCountLeavesOutWhatListingsLeaveOut) {
    std::string container = dir / "Apps/app";
    dir.makeDir("Apps/app/Documents/.Trash");
    dir.makeDir("Apps/app/Documents/Work");
    dir.writeFile("Apps/app/Documents/a.txt");
    EXPECT_EQ(count(LocalAppLibraryItem::initFrom(libraryRecord(container))), 2u);
    dir.makeDir("Apps/app/Documents/Inbox");
    EXPECT_EQ(count(LocalAppLibraryItem::initFrom(libraryRecord(container))), 2u);
    // A plain file named "Inbox" is listed like any other and not taken off.
    dir.makeDir("Apps/other/Documents/Work");
    dir.writeFile("Apps/other/Documents/Inbox");
    EXPECT_EQ(count(LocalAppLibraryItem::initFrom(libraryRecord(dir / "Apps/other"))), 2u);

    // A count that says there is nothing while ".Trash" is there stops the process.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            testing::ScopedFileSystem scoped(std::make_shared<EmptyListingFileSystem>(library));
            LocalAppLibraryItem::initFrom(libraryRecord(container));
        },
        "would drop below 0");
}

TEST_F(ItemTest, AFailedStatusQueryStillGivesARecord) {
    std::string file = dir.writeFile("Documents/a.txt", "x");
    Url url = Url::fileURLWithPath(file);
    ASSERT_TRUE(url.prefetchResourceValues(LocalItem::urlKeys()).ok());
    ASSERT_TRUE(LocalItem::make(url, {.customItemID = "did=1", .customParentItemID = "fid=2"}));
    ASSERT_TRUE(LocalItem::make(url));
    for (int error : {ENOENT, EIO}) {
        ScopedLogCapture log;
        fs->inject(Op::Statx, error, 1, file);
        auto item = LocalItem::make(url);
        ASSERT_TRUE(item);
        EXPECT_EQ(fs->pendingInjections(), 0u);
        EXPECT_EQ(item->itemIdentifier(), "did=1");
        EXPECT_FALSE(item->fileID());
        std::string line =
            "can't find fileID for item \"" + file + "\"; " + Error::posix(error).description();
        if (error == ENOENT)
            EXPECT_EQ(log->count("[DEBUG] " + line, LogLevel::Debug), 1u);
        else
            EXPECT_EQ(log->count("[ERROR] " + line, LogLevel::Error), 1u);
    }
}

TEST_F(ItemTest, EachFailingCheckLogsItsLineAndStops) {
    std::string outside = dir.writeFile("Elsewhere/x.txt", "x");
    std::string missing = storage + "/gone.txt";
    const std::tuple<std::string, LocalItemOptions, std::string> cases[] = {
        {outside, {}, "[DEBUG] can't create an item without an ID"},
        {outside,
         {.customItemID = "did=9"},
         "[ERROR] can't create an item without a parent ID (itemIdentifier: did=9)"},
        {missing,
         {.customItemID = "did=9", .customParentItemID = "fid=1"},
         "[ERROR] can't create an item without a filename (itemIdentifier: did=9, "
         "parentItemIdentifier: fid=1)"},
        {missing,
         {.customItemID = "did=9", .customParentItemID = "fid=1", .customFilename = "x"},
         "[ERROR] can't create an item without a type identifier (itemIdentifier: did=9, "
         "parentItemIdentifier: fid=1, filename: x)"},
        {"", {}, "[ERROR] can't create an app library item without a data container URL"},
    };
    for (const auto& [path, options, line] : cases) {
        ScopedLogCapture log;
        EXPECT_FALSE(path.empty() ? !!LocalAppLibraryItem::initFrom(libraryRecord(std::nullopt))
                                  : !!make(path, options))
            << line;
        auto lines = log->lines();
        ASSERT_FALSE(lines.empty());
        EXPECT_EQ(lines.back().text, line);
        bool error = line.starts_with("[ERROR]");
        EXPECT_EQ(lines.back().level, error ? LogLevel::Error : LogLevel::Debug);
        EXPECT_EQ(log->countStartingWith("[ERROR] can't create"), error ? 1u : 0u);
    }
}

TEST_F(ItemTest, IdentifiersResolveBackOrAreRejected) {
    std::string folder = dir.makeDir("Documents/F");
    std::string file = dir.writeFile("Documents/F/doc.txt", "x");
    strata->publish(folder);
    strata->publish(file);
    EXPECT_EQ(urlOf(*idOf(file))->path(), file);
    EXPECT_EQ(urlOf(*idOf(folder))->path(), folder);

    std::string outside = dir.writeFile("outside.txt");
    for (const auto& [identifier, line] : std::vector<std::pair<std::string, std::string>>{
             {"fid=1=2", "invalid identifier; identifier should have 2 components, not 3"},
             {"fid", "invalid identifier; identifier should have 2 components, not 1"},
             {"#com.example.app", "invalid identifier; identifier should have 2 components, not 1"},
             {"xid=5", "invalid host for identifier \"xid=5\""},
             {"=5", "invalid host for identifier \"=5\""},
             {fid(outside), ""}}) {
        ScopedLogCapture log;
        EXPECT_FALSE(urlOf(identifier)) << identifier;
        if (line.empty())  // an inode the index does not know never resolves
            EXPECT_EQ(log->countStartingWith("can't resolve path matching file ID \""), 1u);
        else
            EXPECT_EQ(log->count(line, LogLevel::Error), 1u) << identifier;
    }
}

TEST_F(ItemTest, IdentifiersNeverNameAnythingOutsideThePublishedTrees) {
    // The index still knows a tree that is no longer published, and a path through a link.
    std::string forgotten = dir.writeFile("Unpublished/old.txt", "o");
    std::string away = dir.makeDir("Away");
    std::string behind = dir.writeFile("Away/behind.txt", "b");
    std::filesystem::create_directory_symlink(away, storage + "/link");
    std::string throughLink = storage + "/link/behind.txt";
    strata->publish(forgotten);
    strata->publish(throughLink);
    strata->publish(storage + "/link");
    for (const std::string& path : {forgotten, behind}) {
        ScopedLogCapture log;
        EXPECT_FALSE(urlOf(fid(path))) << path;
        EXPECT_FALSE(
            TBFileObjectIdentifier::fileURLWithFileIdentifier(std::stoull(fid(path).substr(4))))
            << path;
    }
    // Nor is an identifier computed for them; the link itself is an item.
    EXPECT_FALSE(idOf(forgotten));
    EXPECT_FALSE(idOf(throughLink));
    ASSERT_TRUE(idOf(storage + "/link"));
    EXPECT_EQ(urlOf(*idOf(storage + "/link"))->path(), storage + "/link");
}

TEST_F(ItemTest, DocumentResolutionRetriesOnlyPassingFailures) {
    std::string file = dir.writeFile("Documents/doc.txt", "x");
    strata->publish(file);
    ASSERT_EQ(idOf(file), "did=1");
    struct Case {
        std::deque<int> errors;
        int expectedResolutions;
        bool resolves;
    };
    for (const auto& c : std::vector<Case>{
             {{EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN}, 6, false},
             {{ENOENT}, 1, false},
             {{EBUSY, ESTALE}, 3, true},
             {{EAGAIN, EAGAIN, EAGAIN, EAGAIN, EAGAIN}, 6, true},
         }) {
        int before = strata->resolutions();
        strata->failResolutions(c.errors);
        ScopedLogCapture log;
        auto url = urlOf("did=1");
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

}  // namespace
}  // namespace tamber
