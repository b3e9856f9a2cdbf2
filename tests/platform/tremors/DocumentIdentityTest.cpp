#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/FileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/strata/DocumentAttributes.h"
#include "platform/strata/StrataService.h"
#include "platform/strata/TremorStrataService.h"
#include "platform/tremors/JournalWriter.h"
#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/TremorStore.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

// Document IDs and their metadata follow documents through safe saves, with the service
// running and while nothing runs, also when inode numbers are given again at once.

namespace tamber {
namespace {

namespace fs = std::filesystem;

const std::string kTagsAttribute = "com.velk.metadata:_kHostItemUserTags";
const std::string kRankAttribute = "com.velk.favorite-rank.number#PS";
// The desktop's tag list and Tamber's note of the list it last wrote or took in.
const std::string kDesktopTags = "xdg.tags";
const std::string kDesktopTagsNote = "com.velk.xdg-tags.synced#PS";

uint64_t documentInodeOf(const std::string& path) {
    struct statx st {};
    EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_INO, &st), 0)
        << path;
    return st.stx_ino;
}

void writeText(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
}
// A new file next to `path`, renamed over it, as editors and `sed -i` save.
void safeSave(const std::string& path, const std::string& text) {
    writeText(path + ".saving", text);
    fs::rename(path + ".saving", path);
}

std::optional<std::string> attribute(const std::string& path, const std::string& name) {
    char buffer[256];
    ssize_t n = FileSystem::current().lgetxattr(path, name, buffer, sizeof buffer);
    if (n < 0)
        return std::nullopt;
    return std::string(buffer, static_cast<size_t>(n));
}

// Reports chosen inode numbers for chosen files: what the index sees when the kernel gives a
// freed number to a new file, without depending on the kernel doing so.
class RenumberingFileSystem : public FaultInjectingFileSystem {
public:
    RenumberingFileSystem() : FaultInjectingFileSystem(std::make_shared<LinuxFileSystem>()) {}
    void renumber(uint64_t real, uint64_t reported) {
        std::lock_guard lock(mutex_);
        numbers_[real] = reported;
    }
    int statx(int dirfd, const std::string& path, int flags, unsigned int mask,
              struct statx* out) override {
        int rc = FaultInjectingFileSystem::statx(dirfd, path, flags, mask, out);
        std::lock_guard lock(mutex_);
        if (rc == 0) {
            if (auto it = numbers_.find(out->stx_ino); it != numbers_.end())
                out->stx_ino = it->second;
        }
        return rc;
    }

private:
    std::mutex mutex_;
    std::map<uint64_t, uint64_t> numbers_;
};

class DocumentIdentityTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree_ = root_.makeDir("tree");
        struct statx st {};
        ASSERT_EQ(FileSystem::current().statx(AT_FDCWD, tree_, 0, STATX_INO, &st), 0);
        device_ = encodeDevice(st.stx_dev_major, st.stx_dev_minor);
        if (::setxattr(tree_.c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
    }
    void TearDown() override {
        stop();
        scoped_.reset();  // only once the service's threads are gone
    }
    void useFileSystem(std::shared_ptr<FileSystem> fs) { scoped_.emplace(std::move(fs)); }

    // A service on state_, which resumes the trees it remembers and crawls them.
    void start() {
        auto service = TremorService::create(state_.path());
        ASSERT_TRUE(service.ok()) << service.error().description();
        service_ = service.value();
        strata_ = std::make_shared<TremorStrataService>(service_);
        if (!service_->isWatched(tree_)) {
            ASSERT_TRUE(service_->watchTree(tree_).ok());
        }
    }
    void stop() {
        if (service_)
            service_->shutdown();
        strata_.reset();
        service_.reset();
    }
    uint32_t documentIdOf(const std::string& path) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0) << path;
        uint32_t docID = strata_->getOrAllocateDocumentId(fd);
        FileSystem::current().close(fd);
        return docID;
    }
    // Sets an attribute as the item layer does: on a descriptor, then tells the service.
    void setAttribute(const std::string& path, const std::string& name, const std::string& value) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(FileSystem::current().fsetxattr(fd, name, value.data(), value.size(), 0), 0);
        strata_->metadataAttributeWritten(fd, name, Bytes(value.begin(), value.end()));
        FileSystem::current().close(fd);
    }
    // Another program's change: only the attribute event tells the service.
    static void setAttributeBehindTheBack(const std::string& path, const std::string& name,
                                          const std::optional<std::string>& value) {
        int fd = FileSystem::current().open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
        ASSERT_GE(fd, 0);
        if (value)
            EXPECT_EQ(FileSystem::current().fsetxattr(fd, name, value->data(), value->size(), 0),
                      0);
        else
            EXPECT_EQ(FileSystem::current().fremovexattr(fd, name), 0);
        FileSystem::current().close(fd);
    }
    std::vector<std::string> documentIdEvents(uint64_t since) {
        std::vector<std::string> paths;
        service_->sync();
        TremorStore* store = service_->storeForDevice(device_);
        EXPECT_NE(store, nullptr);
        if (store) {
            EXPECT_TRUE(store
                            ->replay(since, {TremorStore::kDocumentIdRoot}, 0,
                                     [&](const JournalEvent& event) {
                                         paths.push_back(event.path);
                                         return true;
                                     })
                            .ok());
        }
        return paths;
    }
    std::string eventPath(uint32_t docID, uint64_t src, uint64_t dst) const {
        return JournalWriter::documentIdPath(device_, docID, src, dst);
    }
    static bool contains(const std::vector<std::string>& events, const std::string& path) {
        return std::find(events.begin(), events.end(), path) != events.end();
    }
    static std::string joined(const std::vector<std::string>& events) {
        std::string text;
        for (const auto& event : events) text += event + "\n";
        return text;
    }

    // Files with IDs and their own tags, indexed by a running service.
    struct Document {
        std::string path;
        uint32_t id = 0;
        uint64_t inode = 0;
        std::string tags;
    };
    std::vector<Document> makeDocuments(int count) {
        std::vector<Document> docs;
        for (int i = 0; i < count; ++i) {
            Document doc;
            doc.path = root_.writeFile("tree/doc" + std::to_string(i) + ".txt", "v0");
            doc.tags = "tags of " + std::to_string(i);
            docs.push_back(doc);
        }
        service_->sync();
        for (auto& doc : docs) {
            doc.id = documentIdOf(doc.path);
            doc.inode = documentInodeOf(doc.path);
            EXPECT_NE(doc.id, 0u);
            setAttribute(doc.path, kTagsAttribute, doc.tags);
        }
        return docs;
    }
    // Returns once a new file is born later than `path` was.
    void waitForTheNextBirthTime(const std::string& path) {
        auto birth = [](const std::string& p) {
            struct statx st {};
            EXPECT_EQ(FileSystem::current().statx(AT_FDCWD, p, 0, STATX_BTIME, &st), 0);
            return std::pair(st.stx_btime.tv_sec, st.stx_btime.tv_nsec);
        };
        auto last = birth(path);
        std::string probe = root_ / "probe";  // outside the watched tree
        for (int attempt = 0; attempt < 100000; ++attempt) {
            writeText(probe, "");
            bool later = birth(probe) != last;
            fs::remove(probe);
            if (later)
                return;
        }
        FAIL() << "the file-system clock does not move";
    }

    // Each file of `docs` still has its ID and its tags, and every move of an ID is journaled.
    void expectKept(const std::vector<Document>& docs, uint64_t since) {
        auto events = documentIdEvents(since);
        for (const auto& doc : docs) {
            uint64_t now = documentInodeOf(doc.path);
            EXPECT_EQ(strata_->documentIdForInode(device_, now), doc.id) << doc.path;
            EXPECT_EQ(strata_->resolveDocumentId(device_, doc.id), now) << doc.path;
            EXPECT_EQ(attribute(doc.path, kTagsAttribute), doc.tags) << doc.path;
            // The moves of this ID chain from the inode it had to the one it has.
            std::string prefix = JournalWriter::documentIdPath(device_, doc.id, 0, 0);
            prefix.resize(prefix.find("src="));
            uint64_t at = doc.inode;
            for (const auto& event : events) {
                if (!event.starts_with(prefix))
                    continue;
                uint64_t src = 0, dst = 0;
                ASSERT_EQ(std::sscanf(event.c_str() + prefix.size(), "src=%lu,dst=%lu", &src, &dst),
                          2)
                    << event;
                EXPECT_EQ(src, at) << joined(events);
                at = dst;
            }
            EXPECT_EQ(at, now) << doc.path << "\n" << joined(events);
        }
        for (const auto& event : events)
            EXPECT_EQ(event.find(",dst=0"), std::string::npos) << joined(events);
    }

    testing::TempDir state_;
    testing::TempDir root_;
    std::string tree_;
    uint32_t device_ = 0;
    std::optional<testing::ScopedFileSystem> scoped_;
    std::shared_ptr<TremorService> service_;
    std::shared_ptr<TremorStrataService> strata_;
};

// Every file saved, then every file saved again: the temporary files of the second round are
// usually given the inode numbers that the first round freed, of other files.
TEST_F(DocumentIdentityTest, RoundsOfSafeSavesWhileStoppedKeepEveryIdAndItsTags) {
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(20);
    uint64_t since = service_->currentEventId();
    stop();
    for (const char* text : {"v1", "v2"}) {
        for (const auto& doc : docs) safeSave(doc.path, text);
    }
    ASSERT_NO_FATAL_FAILURE(start());
    expectKept(docs, since);
}

TEST_F(DocumentIdentityTest, RoundsOfSafeSavesWhileWatchedKeepEveryIdAndItsTags) {
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(20);
    uint64_t since = service_->currentEventId();
    for (const char* text : {"v1", "v2", "v3"}) {
        for (const auto& doc : docs) safeSave(doc.path, text);
        // A file born and deleted within one tick of the file-system clock, its number given
        // again in that tick, cannot be told from its successor by birth time; and a batch
        // applied long after its events sees files of later saves. Rounds are kept a tick apart
        // and journaled before the next, as saves by a person are.
        service_->sync();
        ASSERT_NO_FATAL_FAILURE(waitForTheNextBirthTime(docs.back().path));
    }
    expectKept(docs, since);
    // And across a restart that has nothing new to see.
    for (auto& doc : docs) doc.inode = documentInodeOf(doc.path);
    stop();
    ASSERT_NO_FATAL_FAILURE(start());
    expectKept(docs, service_->currentEventId());
}

// Two documents saved while stopped, each new file reported with the other's old inode number.
TEST_F(DocumentIdentityTest, AnInodeNumberGivenToAnotherDocumentsNewFileIsThatFile) {
    auto renumbering = std::make_shared<RenumberingFileSystem>();
    useFileSystem(renumbering);
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(2);
    uint64_t since = service_->currentEventId();
    stop();
    safeSave(docs[0].path, "new a");
    safeSave(docs[1].path, "new b");
    renumbering->renumber(documentInodeOf(docs[0].path), docs[1].inode);
    renumbering->renumber(documentInodeOf(docs[1].path), docs[0].inode);
    ASSERT_EQ(documentInodeOf(docs[0].path), docs[1].inode);

    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_EQ(strata_->documentIdForInode(device_, docs[1].inode), docs[0].id);
    EXPECT_EQ(strata_->documentIdForInode(device_, docs[0].inode), docs[1].id);
    auto events = documentIdEvents(since);
    EXPECT_TRUE(contains(events, eventPath(docs[0].id, docs[0].inode, docs[1].inode)))
        << joined(events);
    EXPECT_TRUE(contains(events, eventPath(docs[1].id, docs[1].inode, docs[0].inode)))
        << joined(events);
    EXPECT_EQ(attribute(docs[0].path, kTagsAttribute), docs[0].tags);
    EXPECT_EQ(attribute(docs[1].path, kTagsAttribute), docs[1].tags);
}

// A batch is applied after the fact: when a file was saved twice, the second new file may have
// been given the number the first save freed, so the path shows its old inode number, born anew.
TEST(DocumentIdentityWriterTest, ABatchThatFindsTheOldInodeNumberBornAgainIsASafeSave) {
    testing::TempDir state, root;
    std::string tree = root.makeDir("tree");
    std::string path = root.writeFile("tree/doc.txt", "v0");
    if (::setxattr(path.c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
        GTEST_SKIP() << "no user attributes on this file system";
    auto renumbering = std::make_shared<RenumberingFileSystem>();
    testing::ScopedFileSystem scoped(renumbering);
    auto opened = TremorStore::open(state.path(), 1);
    ASSERT_TRUE(opened.ok());
    TremorStore& store = *opened.value();
    JournalWriter writer(store, 7);
    ASSERT_TRUE(store.addRoot(tree, 0).ok());
    ASSERT_TRUE(writer.reconcile(tree, false).ok());
    uint64_t inode = documentInodeOf(path);
    uint32_t docID = store.allocateDocumentId(inode).value();
    Bytes tags{'t', 'a', 'g', 's', 0, 1};
    ASSERT_TRUE(store.setDocumentAttribute(docID, kTagsAttribute, tags).ok());

    safeSave(path, "v1");
    renumbering->renumber(documentInodeOf(path), inode);
    ASSERT_EQ(documentInodeOf(path), inode);
    auto events = writer.apply({{FileChange::Kind::Created, path + ".saving", {}, false, 0},
                                {FileChange::Kind::Renamed, path, path + ".saving", false, 0}});
    ASSERT_TRUE(events.ok());
    EXPECT_EQ(store.documentIdForInode(inode).value(), docID);
    EXPECT_EQ(attribute(path, kTagsAttribute), std::string(tags.begin(), tags.end()));
    bool journaled = false;
    for (const auto& event : events.value())
        journaled |= event.path == JournalWriter::documentIdPath(7, docID, inode, inode);
    EXPECT_TRUE(journaled);
    // The index now knows the new file: an event on it changes nothing more.
    EXPECT_TRUE(writer.apply({{FileChange::Kind::Modified, path, {}, false, 0}}).ok());
    EXPECT_EQ(store.documentIdForInode(inode).value(), docID);
    EXPECT_EQ(store.documentAttributes(docID).value(),
              (TremorStore::Attributes{{kTagsAttribute, tags}}));
}

TEST_F(DocumentIdentityTest, AKnownFileMovedOntoADocumentIsAMoveNotASave) {
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(4);  // 0 and 2 are replaced by moves, 1 and 3 move
    std::string known = root_.writeFile("tree/known.txt", "k");
    service_->sync();
    uint64_t knownInode = documentInodeOf(known);
    uint64_t since = service_->currentEventId();

    // Live: a document moved onto another one keeps its own ID, and the other's tags stay away.
    fs::rename(docs[1].path, docs[0].path);
    service_->sync();
    EXPECT_EQ(strata_->documentIdForInode(device_, docs[1].inode), docs[1].id);
    EXPECT_EQ(strata_->resolveDocumentId(device_, docs[0].id), 0u);
    EXPECT_EQ(attribute(docs[0].path, kTagsAttribute), docs[1].tags);

    // While stopped: the same, and a known file without an ID does not take one either.
    stop();
    fs::rename(docs[3].path, docs[2].path);
    fs::rename(known, docs[1].path);
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_EQ(strata_->documentIdForInode(device_, docs[3].inode), docs[3].id);
    EXPECT_EQ(strata_->resolveDocumentId(device_, docs[2].id), 0u);
    EXPECT_EQ(attribute(docs[2].path, kTagsAttribute), docs[3].tags);
    EXPECT_EQ(strata_->documentIdForInode(device_, knownInode), 0u);
    EXPECT_EQ(attribute(docs[1].path, kTagsAttribute), std::nullopt);
    auto events = documentIdEvents(since);
    for (const auto& doc : {docs[0], docs[2]})
        EXPECT_TRUE(contains(events, eventPath(doc.id, doc.inode, 0))) << joined(events);
    EXPECT_EQ(events.size(), 2u) << joined(events);
}

TEST_F(DocumentIdentityTest, AttributeEventsOfDocumentsUpdateTheCopyAndOthersCostNothing) {
    auto counting = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    useFileSystem(counting);
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(1);
    const std::string& path = docs[0].path;

    // Files without an ID: neither their creation nor their attribute events read attributes.
    service_->sync();
    counting->resetCalls();
    std::vector<std::string> plain;
    for (int i = 0; i < 30; ++i)
        plain.push_back(root_.writeFile("tree/plain" + std::to_string(i), "p"));
    service_->sync();
    for (const auto& file : plain) setAttributeBehindTheBack(file, kRankAttribute, "9");
    service_->sync();
    EXPECT_EQ(counting->calls(FaultInjectingFileSystem::Operation::Llistxattr), 0u);
    EXPECT_EQ(counting->calls(FaultInjectingFileSystem::Operation::Lgetxattr), 0u);

    // Set by another program on the document: the copy learns it from the event.
    setAttributeBehindTheBack(path, kRankAttribute, "rank 3");
    service_->sync();
    safeSave(path, "v1");
    service_->sync();
    EXPECT_EQ(attribute(path, kRankAttribute), "rank 3");
    EXPECT_EQ(attribute(path, kTagsAttribute), docs[0].tags);

    // Removed on the same file: the user's removal stands after the next save.
    setAttributeBehindTheBack(path, kRankAttribute, std::nullopt);
    service_->sync();
    safeSave(path, "v2");
    service_->sync();
    EXPECT_EQ(attribute(path, kRankAttribute), std::nullopt);
    EXPECT_EQ(attribute(path, kTagsAttribute), docs[0].tags);

    // A new file that comes with a value of its own keeps it, and the copy takes it.
    writeText(path + ".saving", "v3");
    setAttributeBehindTheBack(path + ".saving", kTagsAttribute, "the editor's tags");
    fs::rename(path + ".saving", path);
    service_->sync();
    EXPECT_EQ(attribute(path, kTagsAttribute), "the editor's tags");
    safeSave(path, "v4");
    service_->sync();
    EXPECT_EQ(attribute(path, kTagsAttribute), "the editor's tags");
    EXPECT_EQ(strata_->documentIdForInode(device_, documentInodeOf(path)), docs[0].id);
}

// Tamber's tags and the desktop's list must not part at a save, or the list left behind would
// later be taken for a removal of every tag by another program.
TEST_F(DocumentIdentityTest, TheDesktopTagListAndItsNoteFollowSafeSaves) {
    ASSERT_NO_FATAL_FAILURE(start());
    auto docs = makeDocuments(1);
    const std::string& path = docs[0].path;
    setAttribute(path, kDesktopTags, "Work,Home");
    setAttribute(path, kDesktopTagsNote, "note of Work,Home");
    safeSave(path, "v1");
    service_->sync();
    EXPECT_EQ(attribute(path, kTagsAttribute), docs[0].tags);
    EXPECT_EQ(attribute(path, kDesktopTags), "Work,Home");
    EXPECT_EQ(attribute(path, kDesktopTagsNote), "note of Work,Home");

    // Changed by another program: the copy learns the new list from the event.
    setAttributeBehindTheBack(path, kDesktopTags, "Desk");
    service_->sync();
    safeSave(path, "v2");
    service_->sync();
    EXPECT_EQ(attribute(path, kDesktopTags), "Desk");
    EXPECT_EQ(attribute(path, kDesktopTagsNote), "note of Work,Home");

    // And saved while nothing watches.
    stop();
    safeSave(path, "v3");
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_EQ(attribute(path, kTagsAttribute), docs[0].tags);
    EXPECT_EQ(attribute(path, kDesktopTags), "Desk");
    EXPECT_EQ(attribute(path, kDesktopTagsNote), "note of Work,Home");
    EXPECT_EQ(strata_->documentIdForInode(device_, documentInodeOf(path)), docs[0].id);
}

// Metadata the file had before it became a document follows it too; a write through Tamber to
// a file without an ID keeps nothing and fails nothing.
TEST_F(DocumentIdentityTest, AnIdGivenToATaggedFileKeepsItsTags) {
    ASSERT_NO_FATAL_FAILURE(start());
    std::string path = root_.writeFile("tree/tagged.txt", "t");
    service_->sync();
    setAttribute(path, kTagsAttribute, "before");  // no ID yet: nothing kept
    setAttributeBehindTheBack(path, "com.example.other", "not ours");
    uint32_t docID = documentIdOf(path);
    ASSERT_NE(docID, 0u);
    stop();
    safeSave(path, "v1");
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_EQ(documentIdOf(path), docID);
    EXPECT_EQ(attribute(path, kTagsAttribute), "before");
    EXPECT_EQ(attribute(path, "com.example.other"), std::nullopt);
}

}  // namespace
}  // namespace tamber
