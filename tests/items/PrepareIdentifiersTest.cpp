#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "host/PublishedTrees.h"
#include "host/RecordingHostPorterManager.h"
#include "items/LocalItem.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/objects/Number.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorService.h"
#include "tests/common/FakeAppLibraryLookup.h"
#include "tests/common/FakeStrataService.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/ScopedSlots.h"
#include "tests/common/TempDir.h"

// Document IDs given to a page of a listing at once, on a real journal: what the batch gives is
// what itemIdentifier answers, before and after a restart, and a batch that fails leaves every
// file to itemIdentifier.

namespace tamber {
namespace {

namespace fs = std::filesystem;

const std::string kTags = "com.velk.metadata:_kHostItemUserTags";

// The document ID stored in the URL's own cache: with the index look-up switched off, a URL that
// has none answers nothing.
std::optional<uint32_t> cachedDocumentId(const Url& url) {
    setDocumentIdLookup(nullptr);
    auto value = url.resourceValue(ResourceKeys::kDocumentID);
    TremorStrataService::installDocumentIdLookup();
    if (!value.ok() || !value.value())
        return std::nullopt;
    return static_cast<uint32_t>(objectCast<Number>(value.value())->uint64Value());
}

class PrepareIdentifiersTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage_ = dir_.makeDir("Documents");
        ASSERT_NO_FATAL_FAILURE(start());
    }
    void TearDown() override { stop(); }

    void start() {
        auto service = TremorService::create(state_.path());
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        ASSERT_TRUE(service_->watchTree(storage_).ok());
        ASSERT_TRUE(TremorService::installShared(service_).ok());
        slots_.emplace(std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storage_)),
                       StrataService::current(), libraries_);
    }
    void stop() {
        slots_.reset();
        if (service_) {
            TremorService::uninstallShared(service_);
            service_->shutdown();
            service_.reset();
        }
    }
    TremorStore& store() { return *service_->storeForDevice(deviceOf(storage_)); }
    static uint32_t deviceOf(const std::string& path) {
        struct statx st {};
        EXPECT_EQ(::statx(AT_FDCWD, path.c_str(), 0, STATX_INO, &st), 0);
        return encodeDevice(st.stx_dev_major, st.stx_dev_minor);
    }
    static uint64_t inodeOf(const std::string& path) {
        struct statx st {};
        EXPECT_EQ(::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_INO, &st), 0);
        return st.stx_ino;
    }
    std::optional<std::string> freshIdentifier(const std::string& path) {
        return TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(path));
    }
    std::vector<std::string> writeFiles(const std::string& folder, int count) {
        std::vector<std::string> paths;
        for (int i = 0; i < count; ++i)
            paths.push_back(dir_.writeFile(folder + "/file-" + std::to_string(i) + ".txt", "x"));
        service_->sync();
        return paths;
    }
    std::string journalDatabase() {
        for (const auto& entry : fs::recursive_directory_iterator(state_.path())) {
            if (entry.path().filename() == "journal.sqlite")
                return entry.path();
        }
        ADD_FAILURE() << "no journal database under " << state_.path();
        return {};
    }

    testing::TempDir dir_;
    testing::TempDir state_;
    std::string storage_;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<testing::FakeAppLibraryLookup> libraries_ =
        std::make_shared<testing::FakeAppLibraryLookup>();
    std::optional<testing::ScopedSlots> slots_;
};

TEST_F(PrepareIdentifiersTest, APageOfNewFilesGetsTheIdsItemIdentifierAnswersAlsoAfterARestart) {
    std::vector<std::string> paths = writeFiles("Documents/page", 40);
    bool tagged = ::setxattr(paths[7].c_str(), ("user." + kTags).c_str(), "red", 3, 0) == 0;
    std::vector<Url> urls;
    for (const auto& path : paths) urls.push_back(Url::fileURLWithPath(path));

    TBFileObjectIdentifier::prepareItemIdentifiers(urls);

    std::set<uint32_t> distinct;
    std::vector<std::string> identifiers;
    for (size_t i = 0; i < urls.size(); ++i) {
        // Stored in the URL, without a look-up: the file's entry in the index says the same.
        std::optional<uint32_t> cached = cachedDocumentId(urls[i]);
        ASSERT_TRUE(cached) << paths[i];
        EXPECT_EQ(store().documentIdForInode(inodeOf(paths[i])).value(), cached) << paths[i];
        distinct.insert(*cached);
        auto answered = TBFileObjectIdentifier::itemIdentifier(urls[i]);
        EXPECT_EQ(answered, "did=" + std::to_string(*cached));
        EXPECT_EQ(freshIdentifier(paths[i]), answered);
        identifiers.push_back(answered.value_or(""));
    }
    EXPECT_EQ(distinct.size(), paths.size());
    // Metadata the file had before it became a document is kept with its new ID.
    if (tagged) {
        EXPECT_EQ(store().documentAttributes(*cachedDocumentId(urls[7])).value(),
                  (TremorStore::Attributes{{kTags, Bytes{'r', 'e', 'd'}}}));
    }

    stop();
    ASSERT_NO_FATAL_FAILURE(start());
    for (size_t i = 0; i < paths.size(); ++i) EXPECT_EQ(freshIdentifier(paths[i]), identifiers[i]);
    // The counter went on past the batch: a file made now gets an ID of its own.
    std::string later = writeFiles("Documents/later", 1).front();
    auto laterId = freshIdentifier(later);
    ASSERT_TRUE(laterId);
    for (const auto& identifier : identifiers) EXPECT_NE(*laterId, identifier);
}

TEST_F(PrepareIdentifiersTest, KnownFilesFoldersVanishedFilesAndFilesOutsideAreEachLeftRight) {
    testing::ScopedLogCapture log;
    std::string known = dir_.writeFile("Documents/known.txt", "k");
    std::string folder = dir_.makeDir("Documents/folder");
    std::string vanished = dir_.writeFile("Documents/vanished.txt", "v");
    std::string fresh = dir_.writeFile("Documents/fresh.txt", "f");
    std::string outside = dir_.writeFile("elsewhere/outside.txt", "o");
    std::string link = storage_ + "/link";
    ASSERT_EQ(::symlink(outside.c_str(), link.c_str()), 0);
    service_->sync();
    auto knownId = freshIdentifier(known);
    ASSERT_TRUE(knownId);
    Url vanishedUrl = Url::fileURLWithPath(vanished);
    ASSERT_EQ(::unlink(vanished.c_str()), 0);

    std::vector<Url> urls{
        Url::fileURLWithPath(known),   Url::fileURLWithPath(folder),  vanishedUrl,
        Url::fileURLWithPath(fresh),   Url::fileURLWithPath(outside), Url::fileURLWithPath(link),
        Url::fileURLWithPath(storage_)};
    TBFileObjectIdentifier::prepareItemIdentifiers(urls);

    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[0]), knownId);
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[1]),
              "fid=" + std::to_string(inodeOf(folder)));
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[2]), std::nullopt);
    auto freshId = TBFileObjectIdentifier::itemIdentifier(urls[3]);
    ASSERT_TRUE(freshId);
    EXPECT_NE(freshId, knownId);
    EXPECT_EQ(freshIdentifier(fresh), freshId);
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[4]), std::nullopt);
    EXPECT_EQ(store().documentIdForInode(inodeOf(outside)).value(), std::nullopt);
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[5]),
              "fid=" + std::to_string(inodeOf(link)));
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(urls[6]),
              HostPorterRootContainerItemIdentifier);
    // Only the fresh file took an ID: the next one follows it.
    std::string next = writeFiles("Documents/next", 1).front();
    uint32_t freshNumber = std::stoul(freshId->substr(4));
    EXPECT_EQ(freshIdentifier(next), "did=" + std::to_string(freshNumber + 1));
}

// A listed folder's files are found by name in the open folder, as the listing read them (even
// after the folder was renamed meanwhile), and a link among them is never followed.
TEST_F(PrepareIdentifiersTest, AListedFoldersFilesAreFoundInTheOpenFolderAndLinksAreNotFollowed) {
    std::vector<std::string> paths = writeFiles("Documents/listed", 3);
    std::string inner = dir_.writeFile("Documents/inner.txt", "i");
    ASSERT_EQ(::symlink(inner.c_str(), (storage_ + "/listed/link").c_str()), 0);
    ASSERT_EQ(::mkfifo((storage_ + "/listed/pipe").c_str(), 0600), 0);
    std::vector<uint64_t> inodes;
    for (const auto& path : paths) inodes.push_back(inodeOf(path));
    OpenFolderRef folder = PublishedTrees::openListedFolder(storage_ + "/listed");
    ASSERT_TRUE(folder && folder->linkFree());
    std::vector<Url> urls;
    for (const char* name : {"file-0.txt", "file-1.txt", "file-2.txt", "link", "pipe"})
        urls.push_back(Url::fileURLInFolder(folder, name));
    // As a listing does: the entries' status read relative to the folder, before the rename.
    for (const Url& url : urls)
        ASSERT_TRUE(url.prefetchResourceValues(LocalItem::listingKeys()).ok());
    ASSERT_EQ(::rename((storage_ + "/listed").c_str(), (storage_ + "/moved").c_str()), 0);

    TBFileObjectIdentifier::prepareItemIdentifiers(urls);

    for (size_t i = 0; i < paths.size(); ++i) {
        std::optional<uint32_t> cached = cachedDocumentId(urls[i]);
        ASSERT_TRUE(cached) << paths[i];
        EXPECT_EQ(store().documentIdForInode(inodes[i]).value(), cached) << paths[i];
    }
    EXPECT_EQ(cachedDocumentId(urls[3]), std::nullopt);
    EXPECT_EQ(cachedDocumentId(urls[4]), std::nullopt) << "a pipe is no document";
    EXPECT_EQ(store().documentIdForInode(inodeOf(storage_ + "/moved/pipe")).value(), std::nullopt);
    EXPECT_EQ(store().documentIdForInode(inodeOf(inner)).value(), std::nullopt)
        << "the link's target took no ID through it";
}

TEST_F(PrepareIdentifiersTest, ABatchThatCannotBeWrittenGivesNothingAndItemIdentifierStillAnswers) {
    std::vector<std::string> paths = writeFiles("Documents/page", 5);
    uint64_t failing = inodeOf(paths[2]);
    stop();
    {
        auto db = SqliteDatabase::open(journalDatabase(), SQLITE_OPEN_READWRITE);
        ASSERT_TRUE(db.ok());
        ASSERT_TRUE(db.value()
                        ->exec("CREATE TRIGGER injected_failure BEFORE INSERT ON documents WHEN "
                               "NEW.inode = " +
                               std::to_string(failing) +
                               " BEGIN SELECT RAISE(ABORT, 'injected'); END")
                        .ok());
    }
    ASSERT_NO_FATAL_FAILURE(start());
    testing::ScopedLogCapture log;
    std::vector<Url> urls;
    for (const auto& path : paths) urls.push_back(Url::fileURLWithPath(path));

    TBFileObjectIdentifier::prepareItemIdentifiers(urls);

    for (size_t i = 0; i < paths.size(); ++i) {
        EXPECT_EQ(store().documentIdForInode(inodeOf(paths[i])).value(), std::nullopt) << i;
        EXPECT_EQ(cachedDocumentId(urls[i]), std::nullopt) << i;
    }
    // Each file is then given its ID alone, from the first one on: the batch used none.
    uint32_t expected = 1;
    for (size_t i = 0; i < paths.size(); ++i) {
        auto identifier = TBFileObjectIdentifier::itemIdentifier(urls[i]);
        if (i == 2) {
            EXPECT_EQ(identifier, std::nullopt);
            continue;
        }
        EXPECT_EQ(identifier, "did=" + std::to_string(expected++)) << i;
        EXPECT_EQ(freshIdentifier(paths[i]), identifier) << i;
    }
}

// A service with no batch of its own (a test's fake) is asked for each document in turn, and
// only for documents.
TEST(PrepareIdentifiersFakeTest, AServiceWithoutABatchIsAskedForEachDocument) {
    testing::TempDir dir;
    std::string storage = dir.makeDir("Documents");
    std::string a = dir.writeFile("Documents/a.txt", "a");
    std::string b = dir.writeFile("Documents/b.txt", "b");
    std::string folder = dir.makeDir("Documents/folder");
    std::string outside = dir.writeFile("outside.txt", "o");
    auto strata = std::make_shared<testing::FakeStrataService>();
    testing::ScopedSlots slots(
        std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storage)), strata,
        std::make_shared<testing::FakeAppLibraryLookup>());
    std::vector<Url> urls{Url::fileURLWithPath(a), Url::fileURLWithPath(folder),
                          Url::fileURLWithPath(b), Url::fileURLWithPath(outside)};

    TBFileObjectIdentifier::prepareItemIdentifiers(urls);

    EXPECT_EQ(strata->allocations(), 2);
    auto first = TBFileObjectIdentifier::itemIdentifier(urls[0]);
    auto second = TBFileObjectIdentifier::itemIdentifier(urls[2]);
    ASSERT_TRUE(first && second);
    EXPECT_NE(first, second);
    EXPECT_EQ(TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(a)), first);
    EXPECT_EQ(strata->allocations(), 2);  // answered from the URLs and the fake's index
}

}  // namespace
}  // namespace tamber
