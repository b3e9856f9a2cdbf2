#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdio>
#include <filesystem>
#include <future>
#include <thread>

#include "fs/DocIDPath.h"
#include "fs/TremorReader.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorFlags.h"
#include "tests/common/Sanitizers.h"
#include "tests/fs/FsTest.h"

#if defined(TAMBER_TESTS_ASAN)
#include <sanitizer/lsan_interface.h>
#endif

namespace tamber {
namespace {

using testing::TremorTest;
using Reports = std::vector<std::string>;
using Kind = TremorReaderGatherPhaseResumeStatus::Kind;

std::string docIDPath(uint32_t device, uint64_t doc, uint64_t src, uint64_t dst) {
    return "/.docid/" + std::to_string(device) + "/changed/" + std::to_string(doc) +
           "/src=" + std::to_string(src) + ",dst=" + std::to_string(dst);
}

TEST(DocIDPathTest, AcceptsTheGrammarAndNothingAroundIt) {
    auto full = DocIDPath::parse("/.docid/5/changed/42/src=7,dst=0");
    ASSERT_TRUE(full);
    EXPECT_EQ(full->documentID, 42u);
    EXPECT_EQ(full->source, 7u);
    EXPECT_EQ(full->destination, 0u);
    auto bare = DocIDPath::parse(".docid/changed/43/src=1,dst=9");
    ASSERT_TRUE(bare);
    EXPECT_EQ(bare->documentID, 43u);
    EXPECT_EQ(bare->destination, 9u);
    // Leading slashes are skipped; a number without digits reads 0.
    auto empty = DocIDPath::parse("///.docid/changed/1/src=,dst=2");
    ASSERT_TRUE(empty);
    EXPECT_EQ(empty->source, 0u);

    for (std::string bad : {
             "/.docid/5/changed/42/src=7,dst=0x",                   // trailing text
             "/.docid/5/changed/42/src=7,dst=0/",                   // trailing slash
             "/.docid/5changed/42/src=7,dst=0",                     // device without "/"
             "/.docid/99999999999999999999/changed/1/src=1,dst=1",  // out of range
             "/.docid/5/changed/42/src=7;dst=0",                    // wrong separator
             "/.docid/5/changed/42,src=7,dst=0",                    // wrong separator
             "/.docid/5/change/42/src=7,dst=0",                     // wrong word
             "/tmp/.docid/5/changed/42/src=7,dst=0",                // not at the start
             "/.docid",
             "",
         }) {
        EXPECT_FALSE(DocIDPath::parse(bad)) << bad;
    }
    EXPECT_FALSE(DocIDPath::parse(std::string("/.docid/changed/1/src=1,dst=2\0x", 32)));
}

// Inode numbers use all 64 bits on some file systems (overlay's high bits, 64-bit tmpfs): a
// path the journal wrote for one must read back, or the document's change is lost.
TEST(DocIDPathTest, ReadsBackEveryPathTheJournalWrites) {
    struct Numbers {
        uint32_t device;
        uint32_t document;
        uint64_t source;
        uint64_t destination;
    };
    for (const Numbers& n :
         {Numbers{2049, 42, 7, 9}, Numbers{1, 3, (1ull << 63) + 5, 12},
          Numbers{0, UINT32_MAX, UINT64_MAX, UINT64_MAX}, Numbers{64769, 8, 11, (1ull << 63)}}) {
        std::string path =
            JournalWriter::documentIdPath(n.device, n.document, n.source, n.destination);
        auto parsed = DocIDPath::parse(path);
        ASSERT_TRUE(parsed) << path;
        EXPECT_EQ(parsed->documentID, n.document) << path;
        EXPECT_EQ(parsed->source, n.source) << path;
        EXPECT_EQ(parsed->destination, n.destination) << path;
    }
    // The journal never writes a sign; one would wrap round to another inode.
    EXPECT_FALSE(DocIDPath::parse("/.docid/5/changed/42/src=-7,dst=0"));
    EXPECT_FALSE(DocIDPath::parse("/.docid/5/changed/42/src=7,dst=-1"));
}

// Events journaled by the test replay through a real stream, in ID order.
TEST_F(TremorTest, ClassifiesEventsInOrderAndRecordsOnlyWhatItReported) {
    std::string a = write("a.txt");
    auto aID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(a));
    ASSERT_TRUE(aID);
    std::filesystem::create_directory(storagePath() + "/.hidden");
    write(".hidden/b.txt");
    std::string gone = storagePath() + "/gone.txt";
    std::string gone2 = storagePath() + "/gone2.txt";
    std::string unparsable = storagePath() + "/.docid/5/changed/42/src=7,dst=0";
    uint64_t since = currentID();
    journal({{0, a, 0, kTremorMustScanSubdirs},            // an ordinary item event
             {0, gone, 0, kTremorItemRemoved},             // nothing there, no file ID
             {0, gone2, 987654321, kTremorItemRemoved}});  // gone, with its file ID
    uint64_t lastReported = journal({{0, storagePath() + "/.hidden/b.txt", 0, 0},
                                     {0, unparsable, 0, 0},
                                     {0, a, 0, kTremorEventIdsWrapped | kTremorHistoryDone}}) -
                            3;
    // The wrapped-IDs event is the last: after it, history done does not come again.
    Reports expected{"change " + *aID + " " + a, "delete fid=987654321 " + gone2, "rescan"};

    // Quiet: only error lines.
    auto quiet = TremorReader::make({storageURL()}, since, TremorReaderMode::pathBased, false);
    quiet->setDelegate(delegate);
    readers.push_back(quiet);
    log->clear();
    quiet->start();
    ASSERT_TRUE(delegate->waitForBatchWith("rescan"));
    quiet->stop();
    EXPECT_EQ(delegate->itemReports(), expected);
    EXPECT_EQ(delegate->reports().back(), "batch");
    EXPECT_EQ(delegate->offQueue(), 0);
    EXPECT_EQ(quiet->lastProcessedTremorID(), lastReported);
    std::string parseError = "[ERROR] can't parse docID path \"" + unparsable +
                             "\"; format expected is "
                             "\"/.docid/$dev/changed/$docid/src=$src,dst=$dst\"";
    EXPECT_EQ(log->count(parseError, LogLevel::Error), 1u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] did change"), 0u);
    EXPECT_EQ(log->countStartingWith("[INFO] tremors id wrapped"), 0u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] dropping"), 0u);
    // Every event still gets its section, numbered, with the reader and the event.
    EXPECT_EQ(log->countStartingWith("[DEBUG] ┏"), 6u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] ┗"), 6u);

    log->clear();
    auto verbose = std::make_shared<testing::RecordingReaderDelegate>();
    auto reader = TremorReader::make({storageURL()}, since, TremorReaderMode::pathBased, true);
    reader->setDelegate(verbose);
    readers.push_back(reader);
    reader->start();
    ASSERT_TRUE(verbose->waitForBatchWith("rescan"));
    EXPECT_EQ(verbose->itemReports(), expected);
    EXPECT_EQ(log->count("[INFO] tremors id wrapped", LogLevel::Info), 1u);
    EXPECT_EQ(log->count("[DEBUG] dropping tremor at \"" + gone + "\"; No object at path",
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(
        log->count("[DEBUG] dropping tremor at " + storagePath() + "/.hidden/b.txt; URL is hidden",
                   LogLevel::Debug),
        1u);
    EXPECT_EQ(log->count("[DEBUG] did delete fid=987654321", LogLevel::Debug), 1u);
    EXPECT_EQ(log->count(parseError, LogLevel::Error), 1u);
    EXPECT_EQ(log->countStartingWith("[DEBUG] ┏"), 6u);
    EXPECT_GE(log->countStartingWith("[DEBUG] starting <TremorReader:0x"), 1u);
    EXPECT_NE(reader->description().find(" urls:[" + storagePath() + "] mode:pathBased>"),
              std::string::npos);
}

TEST_F(TremorTest, DroppedEventsAskForARescanAndHistoryDoneIsReported) {
    std::string a = write("a.txt");
    uint64_t since = currentID();
    uint64_t dropped = journal({{0, a, 0, kTremorKernelDropped}});
    startReader(since);
    ASSERT_TRUE(delegate->waitForReport("history"));
    EXPECT_EQ(delegate->itemReports(), (Reports{"rescan", "history"}));
    // Neither a rescan nor the end of history is an item event to resume after.
    EXPECT_LT(readers[0]->lastProcessedTremorID(), dropped);
}

// Linux gives a freed inode number to the next file made: a removal whose file ID now names
// an item elsewhere is that item's predecessor going away, while a rename finds the item itself.
TEST_F(TremorTest, ARemovalWhoseFileIDWasReusedIsADeletion) {
    std::string now = write("now.txt");
    struct stat st {};
    ASSERT_EQ(::lstat(now.c_str(), &st), 0);
    uint64_t inode = st.st_ino;
    auto nowID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(now));
    ASSERT_TRUE(nowID);
    std::string removed = storagePath() + "/removed-folder";
    std::string renamed = storagePath() + "/renamed-from.txt";
    uint64_t since = currentID();
    journal({{0, removed, inode, kTremorItemRemoved | kTremorItemIsDir},
             {0, renamed, inode, kTremorItemRemoved | kTremorItemRenamed},
             {0, now, inode, kTremorItemRemoved}});
    startReader(since);
    ASSERT_TRUE(delegate->waitForReport("history"));
    EXPECT_EQ(
        delegate->itemReports(),
        (Reports{"delete fid=" + std::to_string(inode) + " " + removed,
                 "change " + *nowID + " " + renamed, "change " + *nowID + " " + now, "history"}));
}

// The next file made is often a safe save's hidden temporary file: an old event whose file ID
// now names it must neither report it nor give it a document ID, which would make the save
// replace the document rather than carry its ID on.
TEST_F(TremorTest, AnOldEventWhoseFileIDNowNamesAHiddenFileReportsNothingOfIt) {
    std::string temporary = write(".saving-report.pdf");
    uint64_t inode = inodeOf(temporary);
    std::string gone = storagePath() + "/deleted/x";
    uint64_t since = currentID();
    journal({{0, gone, inode, kTremorItemCreated}, {0, gone, inode, kTremorItemModified}});
    startReader(since);
    ASSERT_TRUE(delegate->waitForReport("history"));
    for (const std::string& report : delegate->itemReports())
        EXPECT_NE(report.rfind("change ", 0), 0u) << report;
    EXPECT_EQ(store().documentIdForInode(inode).value(), std::nullopt);
}

TEST_F(TremorTest, DocumentIDEventsAreJudgedByTheirShapeAndTheDocumentTheyName) {
    std::string a = write("a.txt");
    std::string b = write("b.txt");
    auto aID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(a));
    auto bID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(b));
    ASSERT_TRUE(aID && bID);
    uint64_t aDoc = std::stoull(aID->substr(4));
    uint32_t dev = device();
    uint64_t since = currentID();
    uint64_t last = journal({
        {0, docIDPath(dev, 42, 7, 0), 0, 0},                         // deleted
        {0, docIDPath(dev, aDoc, 1, inodeOf(a)), 0, 0},              // changed
        {0, docIDPath(dev, aDoc, 1, inodeOf(b)), 0, 0},              // names another file now
        {0, docIDPath(dev, aDoc, 1, inodeOf(storagePath())), 0, 0},  // the root itself
        {0, docIDPath(dev, aDoc, 1, 999999999), 0, 0},               // resolves to nothing
    });
    auto reader = startReader(since, TremorReaderMode::docIDBased);
    ASSERT_TRUE(delegate->waitForReport("history"));
    EXPECT_EQ(delegate->itemReports(),
              (Reports{"delete did=42 -", "change " + *aID + " -", "history"}));
    EXPECT_EQ(reader->lastProcessedTremorID(), last - 3);
    EXPECT_EQ(log->count("[DEBUG] dropping tremor at " + b + "; fileObjectIDs don't match (" +
                             *bID + " vs " + *aID + ")",
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(log->count("[DEBUG] dropping tremor at " + storagePath() + "; URL is not monitored",
                         LogLevel::Debug),
              1u);
    EXPECT_EQ(log->count("[DEBUG] can't compute url for " + *aID, LogLevel::Debug), 1u);
}

TEST_F(TremorTest, ReportsLiveCreationChangeAndDeletionOfRealFiles) {
    auto paths = startReader(currentID());
    auto docs = std::make_shared<testing::RecordingReaderDelegate>();
    auto docReader =
        TremorReader::make({storageURL()}, currentID(), TremorReaderMode::docIDBased, true);
    docReader->setDelegate(docs);
    readers.push_back(docReader);
    docReader->start();
    ASSERT_TRUE(delegate->waitForReport("history"));
    ASSERT_TRUE(docs->waitForReport("history"));

    std::string c = write("c.txt", "one");
    auto id = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(c));
    ASSERT_TRUE(id);
    uint64_t inode = inodeOf(c);
    ASSERT_TRUE(delegate->waitForReport("change " + *id + " " + c));
    std::filesystem::remove(c);
    ASSERT_TRUE(delegate->waitForReport("delete fid=" + std::to_string(inode) + " " + c));
    ASSERT_TRUE(docs->waitForReport("delete " + *id + " -"));
    EXPECT_EQ(delegate->offQueue() + docs->offQueue(), 0);
    EXPECT_GT(paths->lastProcessedTremorID(), 0u);
}

// Where each reported item says its file is.
class ItemPathDelegate : public testing::RecordingReaderDelegate {
public:
    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override {
        waiter_.update([&] { paths_.push_back(item->fileURL().path()); });
        RecordingReaderDelegate::readerDidChange(reader, item, url);
    }
    bool waitForItemAt(const std::string& path) {
        return waiter_.waitFor(
            [&] { return std::find(paths_.begin(), paths_.end(), path) != paths_.end(); });
    }

private:
    testing::Waiter waiter_;
    std::vector<std::string> paths_;
};

TEST_F(TremorTest, AFileMovedAfterABatchIsReportedWhereItIsNow) {
    auto paths = std::make_shared<ItemPathDelegate>();
    delegate = paths;
    startReader(currentID());
    ASSERT_TRUE(paths->waitForReport("history"));
    std::string a = write("a");
    ASSERT_TRUE(paths->waitForItemAt(a));
    // A batch reads each file once; what it read must not stand for the file in later ones.
    std::string b = storagePath() + "/b";
    std::filesystem::rename(a, b);
    write("b", "more");
    EXPECT_TRUE(paths->waitForItemAt(b));
}

TEST_F(TremorTest, AnAppLibraryRootIsReportedAsTheLibrary) {
    install({"com.example.notes"});
    auto manager = LocalAppLibraryManager::shared();
    manager->refresh();
    manager->upgradeFromMainCache(nullptr, false);
    Url library = documents("com.example.notes");
    ASSERT_EQ(manager->rootURLs(), std::vector<Url>{library});
    std::string plain = storagePath() + "/Documents";
    std::filesystem::create_directory(plain);
    auto plainID = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(plain));
    // Watched before the history starts, or the replay would rightly be incomplete.
    ASSERT_TRUE(service()->watchTree(library.path()).ok());
    uint64_t since = currentID();
    journal({{0, library.path(), 0, 0}, {0, plain, 0, 0}});
    startReader(since, TremorReaderMode::pathBased, {storageURL(), library});
    ASSERT_TRUE(delegate->waitForReport("history"));
    EXPECT_EQ(delegate->itemReports(),
              (Reports{"change #com.example.notes " + library.path(),
                       "change " + plainID.value_or("?") + " " + plain, "history"}));
}

TEST_F(TremorTest, CanResumeGatherPhaseUnlessSomethingWasDeletedOrLost) {
    std::string c = write("c.txt");
    uint64_t inode = inodeOf(c);
    uint64_t before = currentID();
    write("d.txt");  // a change is no reason to start over
    uint64_t now = currentID();
    auto [status, eventID] = TremorReader::canResumeGatherPhase({storageURL()}, before);
    EXPECT_EQ(status.kind, Kind::canResume);
    EXPECT_EQ(eventID, now);

    std::filesystem::remove(c);
    auto deleted = TremorReader::canResumeGatherPhase({storageURL()}, now);
    EXPECT_EQ(deleted.first.kind, Kind::deletionOccurred);
    EXPECT_EQ(deleted.first.deletion, "[fid=" + std::to_string(inode) + ", path:'" + c + "']");
    EXPECT_GT(deleted.second, now);

    uint64_t later = currentID();
    journal({{0, storagePath() + "/d.txt", 0, kTremorUserDropped}});
    EXPECT_EQ(TremorReader::canResumeGatherPhase({storageURL()}, later).first.kind,
              Kind::cantReplayHistoricalTremors);
    // A replay from now on has nothing to judge but its end.
    EXPECT_EQ(TremorReader::canResumeGatherPhase({storageURL()}, currentID()).first.kind,
              Kind::canResume);
    // The checkers' readers were stopped, not abandoned.
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(log->countStartingWith("[ERROR] stream deleted without being stopped"), 0u);
}

// Event IDs the journal never handed out, from a damaged or foreign anchor: all bits set is
// also what streams take for "from now on", which has no history to end.
TEST_F(TremorTest, AReaderFromAnIDNeverHandedOutAsksForARescanAtOnce) {
    write("a.txt");
    const uint64_t last = currentID();
    ASSERT_GT(last, 0u);
    for (uint64_t since : {last + 1, uint64_t{INT64_MAX} + 1, UINT64_MAX - 1, UINT64_MAX}) {
        for (auto mode : {TremorReaderMode::pathBased, TremorReaderMode::docIDBased}) {
            SCOPED_TRACE(std::to_string(since) + " " + tremorReaderModeName(mode));
            delegate = std::make_shared<testing::RecordingReaderDelegate>();
            startReader(since, mode);
            ASSERT_TRUE(delegate->waitForReport("rescan"));
            for (const std::string& report : delegate->itemReports())
                EXPECT_TRUE(report == "rescan" || report == "history") << report;
            readers.back()->stop();
        }
        // The gather phase's check gives up on such a page token instead of waiting.
        auto verdict = std::async(std::launch::async, [&] {
            return TremorReader::canResumeGatherPhase({storageURL()}, since).first.kind;
        });
        if (verdict.wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
            std::fprintf(stderr, "FAILED: canResumeGatherPhase from %s never ended\n",
                         std::to_string(since).c_str());
            std::_Exit(1);  // the blocked check holds the fixture
        }
        EXPECT_EQ(verdict.get(), Kind::cantReplayHistoricalTremors);
    }
}

TEST_F(TremorTest, AReaderWhoseTreeCannotBeWatchedAsksForARescan) {
    const Url gone = Url::fileURLWithPath("/nonexistent-tamber-tree/inside");
    startReader(0, TremorReaderMode::pathBased, {gone});
    ASSERT_TRUE(delegate->waitForReport("rescan"));
    EXPECT_EQ(delegate->itemReports(), (Reports{"rescan"}));
    auto verdict = std::async(std::launch::async, [&] {
        return TremorReader::canResumeGatherPhase({gone}, 0).first.kind;
    });
    if (verdict.wait_for(std::chrono::seconds(30)) != std::future_status::ready) {
        std::fprintf(stderr, "FAILED: canResumeGatherPhase over a gone tree never ended\n");
        std::_Exit(1);
    }
    EXPECT_EQ(verdict.get(), Kind::cantReplayHistoricalTremors);
}

TEST_F(TremorTest, AReaderDestroyedWhileRunningSaysSoAndLaterBatchesFindNothing) {
    auto reader =
        TremorReader::make({storageURL()}, currentID(), TremorReaderMode::pathBased, true);
    reader->setDelegate(delegate);
    {
#if defined(TAMBER_TESTS_ASAN)
        // The abandoned stream is never released, by design.
        __lsan::ScopedDisabler leaksOfTheAbandonedStream;
#endif
        reader->start();
    }
    ASSERT_TRUE(delegate->waitForBatchWith("history"));
    reader->streamQueue()->sync([] {});  // the callback has let go of the reader
    std::string description = reader->description();
    reader.reset();
    EXPECT_EQ(
        log->count("[ERROR] stream deleted without being stopped; " + description, LogLevel::Error),
        1u);
    // Events the abandoned stream still delivers must not reach freed memory.
    size_t before = delegate->reports().size();
    write("late.txt");
    std::this_thread::sleep_for(std::chrono::milliseconds(800));
    EXPECT_EQ(delegate->reports().size(), before);
}

}  // namespace
}  // namespace tamber
