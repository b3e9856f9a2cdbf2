#include "host/PublishedTrees.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <memory>
#include <thread>

#include "host/RecordingHostPorterManager.h"
#include "host/StagingCopies.h"
#include "host/UrlOperations.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;
using testing::TempDir;

Url urlAt(const std::string& path) {
    return Url::fileURLWithPath(path);
}

struct BoundaryOutcome {
    std::optional<Url> url;
    std::optional<Error> error;
};

template <class Operation>
BoundaryOutcome runOperation(Operation operation) {
    BoundaryOutcome outcome;
    operation([&](Result<Url> result) {
        if (result.ok())
            outcome.url = std::move(result).value();
        else
            outcome.error = result.error();
    });
    return outcome;
}

std::string descriptionOf(const std::optional<Error>& error) {
    if (!error)
        return "<no error>";
    auto it = error->userInfo().find("description");
    return it == error->userInfo().end() ? error->description() : it->second;
}

std::string descriptionOf(const Status& status) {
    return descriptionOf(status.ok() ? std::nullopt : std::optional<Error>(status.error()));
}

// A storage folder "storage", an app library "apps/lib/Documents", and "outside" beside them;
// "storage/away" is a link to the outside.
class PublishedTreesTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage = dir.makeDir("storage");
        library = dir.makeDir("apps/lib/Documents");
        outside = dir.makeDir("outside");
        dir.makeDir("storage/Work");
        fs::create_directory_symlink(outside, storage + "/away");
        previous_ = HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(urlAt(storage)));
        previousRoots_ = PublishedTrees::setAppLibraryRootsSource(
            [this] { return std::vector<Url>{urlAt(library)}; });
        previousLedger_ = StagingCopies::setLedgerDirectoryForTesting(dir / "ledger");
    }
    void TearDown() override {
        StagingCopies::setLedgerDirectoryForTesting(previousLedger_);
        PublishedTrees::setAppLibraryRootsSource(previousRoots_);
        HostPorterManager::installDefaultManager(previous_);
    }
    static bool refused(const Status& status) {
        return !status.ok() && PublishedTrees::isOutsideError(status.error());
    }
    static bool refused(const std::optional<Error>& error) {
        return error && PublishedTrees::isOutsideError(*error);
    }
    static bool refused(const BoundaryOutcome& outcome) { return refused(outcome.error); }

    TempDir dir;
    std::string storage, library, outside;

private:
    std::shared_ptr<HostPorterManager> previous_;
    PublishedTrees::RootsSource previousRoots_;
    std::string previousLedger_;
};

// A refusal is known by its mark, never by its words: another "no such item" that happens to
// say the same, or one that wraps a refusal under a description of its own, is not one.
TEST_F(PublishedTreesTest, ARefusalIsKnownByItsMarkNotItsText) {
    Error refusal = PublishedTrees::outsideError(urlAt(outside + "/f"));
    EXPECT_TRUE(PublishedTrees::isOutsideError(refusal));
    Error sameWords(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                    {{"description", PublishedTrees::kOutsideMessage}});
    EXPECT_FALSE(PublishedTrees::isOutsideError(sameWords));

    std::map<std::string, std::string> info = refusal.userInfo();
    info["description"] = "can't list " + outside + ": " + refusal.reason();
    Error wrapped = PublishedTrees::unmarked(Error(refusal.domain(), refusal.code(), info));
    EXPECT_FALSE(PublishedTrees::isOutsideError(wrapped));
    EXPECT_EQ(wrapped.userInfo().at("path"), outside + "/f") << "the rest of the info stays";
}

TEST_F(PublishedTreesTest, InsideMeansAtOrBelowARootWithoutALinkOnTheWay) {
    EXPECT_TRUE(PublishedTrees::check(urlAt(storage)).ok());
    EXPECT_TRUE(PublishedTrees::check(urlAt(storage + "/Work/new.txt")).ok());
    EXPECT_TRUE(PublishedTrees::check(urlAt(library + "/a/b")).ok());
    EXPECT_TRUE(PublishedTrees::check(urlAt(storage + "/away")).ok()) << "a link is an item";
    EXPECT_EQ(PublishedTrees::rootOf(urlAt(library + "/x"))->path(), library);

    for (const std::string& path :
         {outside + "/f", storage + "2", dir / "apps/lib", storage + "/away/f",
          storage + "/away/sub/f", std::string("/")}) {
        Status status = PublishedTrees::check(urlAt(path));
        ASSERT_TRUE(refused(status)) << path;
        EXPECT_EQ(status.error().domain(), kHostPorterErrorDomain);
        EXPECT_EQ(status.error().code(), kHostPorterNoSuchItem);
        EXPECT_EQ(descriptionOf(status), "not inside the document storage or an app library");
    }
    // Without the library hook only the storage is published.
    PublishedTrees::setAppLibraryRootsSource(nullptr);
    EXPECT_TRUE(refused(PublishedTrees::check(urlAt(library + "/a"))));
}

// A scope of checked folders answers for a folder it found inside, on its own thread and only
// while it lives: a folder made a link later is refused again once the scope ends, and a refusal
// is never remembered as inside.
TEST_F(PublishedTreesTest, CheckedFoldersAnswerOnlyOnTheirThreadAndWhileTheyLive) {
    dir.makeDir("storage/Work/Sub");
    const std::string sub = storage + "/Work/Sub";
    {
        PublishedTrees::CheckedFolders checked;
        EXPECT_FALSE(PublishedTrees::knownInside(urlAt(sub + "/a")));
        EXPECT_TRUE(PublishedTrees::check(urlAt(sub + "/a")).ok());
        EXPECT_TRUE(PublishedTrees::knownInside(urlAt(sub + "/sibling")));
        EXPECT_FALSE(PublishedTrees::knownInside(urlAt(sub + "/a/below"))) << "only its folder";
        EXPECT_TRUE(refused(PublishedTrees::check(urlAt(storage + "/away/f"))));
        EXPECT_FALSE(PublishedTrees::knownInside(urlAt(storage + "/away/f")));
        EXPECT_TRUE(refused(PublishedTrees::check(urlAt(storage + "/away/g"))))
            << "a refused folder is asked again";
        fs::rename(sub, storage + "/Work/Old");
        fs::create_directory_symlink(outside, sub);
        Status elsewhere;
        std::thread([&] { elsewhere = PublishedTrees::check(urlAt(sub + "/b")); }).join();
        EXPECT_TRUE(refused(elsewhere)) << "another thread has its own scope";
        {
            PublishedTrees::CheckedFolders inner;
            EXPECT_TRUE(refused(PublishedTrees::check(urlAt(sub + "/c"))))
                << "an inner scope starts empty";
        }
    }
    EXPECT_TRUE(refused(PublishedTrees::check(urlAt(sub + "/b"))));
    EXPECT_FALSE(PublishedTrees::knownInside(urlAt(sub + "/b")));
}

TEST_F(PublishedTreesTest, OperationsRefuseOutsideBeforeTouchingAnything) {
    std::string file = dir.writeFile("storage/Work/a.txt", "a");
    std::string source = dir.writeFile("elsewhere/b.txt", "b");

    EXPECT_TRUE(refused(runOperation(
        [&](auto done) { pt_createSubFolder(urlAt(storage + "/away"), "N", false, done); })));
    EXPECT_TRUE(refused(runOperation([&](auto done) {
        pt_reparentUnderFolder(urlAt(file), urlAt(storage + "/away"), false, done);
    })));
    EXPECT_TRUE(refused(runOperation(
        [&](auto done) { pt_reparentUnderFolder(urlAt(file), urlAt(outside), false, done); })));
    EXPECT_TRUE(refused(runOperation(
        [&](auto done) { pt_importUnderFolder(urlAt(source), urlAt(storage + "/away"), done); })));
    EXPECT_TRUE(refused(
        runOperation([&](auto done) { pt_renameWithNewName(urlAt(source), "c.txt", done); })));
    EXPECT_TRUE(refused(runOperation([&](auto done) {
        pt_trashUnderFolder(urlAt(file), urlAt(storage + "/away/.Trash"), done);
    })));
    Status deleted;
    pt_deleteWithCompletionHandler(urlAt(outside + "/x"), [&](Status status) { deleted = status; });
    EXPECT_TRUE(refused(deleted));

    bool ran = false;
    EXPECT_FALSE(pt_withReadWriteAccess(urlAt(source), [&](int) { return ran = true; }));
    EXPECT_EQ(errno, EACCES);
    EXPECT_FALSE(
        pt_withReadWriteAccess(urlAt(storage + "/away/x"), [&](int) { return ran = true; }));
    EXPECT_FALSE(ran);
    EXPECT_TRUE(pt_withReadWriteAccess(urlAt(file), [&](int fd) { return fd >= 0; }));
    EXPECT_TRUE(refused(pt_directorySizeWithError(urlAt(outside)).status()));

    EXPECT_TRUE(fs::exists(file));
    EXPECT_TRUE(fs::exists(source));
    EXPECT_TRUE(fs::is_empty(outside));
}

TEST_F(PublishedTreesTest, ALinkInsideIsMovedRenamedAndDeletedAsALink) {
    dir.writeFile("outside/keep.txt", "k");
    BoundaryOutcome renamed = runOperation(
        [&](auto done) { pt_renameWithNewName(urlAt(storage + "/away"), "gone", done); });
    ASSERT_TRUE(renamed.url) << descriptionOf(renamed.error);
    BoundaryOutcome moved = runOperation([&](auto done) {
        pt_reparentUnderFolder(urlAt(storage + "/gone"), urlAt(library), false, done);
    });
    ASSERT_TRUE(moved.url) << descriptionOf(moved.error);
    EXPECT_TRUE(fs::is_symlink(library + "/gone"));
    BoundaryOutcome imported = runOperation([&](auto done) {
        pt_importUnderFolder(urlAt(library + "/gone"), urlAt(storage + "/Work"), done);
    });
    ASSERT_TRUE(imported.url) << descriptionOf(imported.error);
    EXPECT_TRUE(fs::is_symlink(storage + "/Work/gone"));
    Status deleted = Error::posix(EIO);
    pt_deleteWithCompletionHandler(urlAt(library + "/gone"),
                                   [&](Status status) { deleted = status; });
    EXPECT_TRUE(deleted.ok());
    EXPECT_FALSE(fs::exists(fs::symlink_status(library + "/gone")));
    EXPECT_TRUE(fs::exists(outside + "/keep.txt"));
}

// Swaps a folder for a link to the outside just before the operation opens it: after every
// check a caller could have made.
class SwappingFileSystem : public FaultInjectingFileSystem {
public:
    SwappingFileSystem(std::string folder, std::string target)
        : FaultInjectingFileSystem(std::make_shared<LinuxFileSystem>()),
          folder_(std::move(folder)),
          target_(std::move(target)) {}
    int openBeneath(int dirfd, const std::string& path, int flags, mode_t mode) override {
        if (!swapped_) {
            swapped_ = true;
            fs::rename(folder_, folder_ + ".real");
            fs::create_directory_symlink(target_, folder_);
        }
        return FaultInjectingFileSystem::openBeneath(dirfd, path, flags, mode);
    }

private:
    std::string folder_, target_;
    bool swapped_ = false;
};

TEST_F(PublishedTreesTest, AFolderSwappedForALinkAfterTheLookupIsRefused) {
    std::string file = dir.writeFile("storage/a.txt", "a");
    dir.makeDir("storage/Work/Sub");
    ASSERT_TRUE(PublishedTrees::check(urlAt(storage + "/Work/Sub")).ok());
    auto swapping = std::make_shared<SwappingFileSystem>(storage + "/Work", outside);
    {
        testing::ScopedFileSystem scoped(swapping);
        BoundaryOutcome moved = runOperation([&](auto done) {
            pt_reparentUnderFolder(urlAt(file), urlAt(storage + "/Work/Sub"), false, done);
        });
        EXPECT_TRUE(refused(moved)) << descriptionOf(moved.error);
    }
    EXPECT_TRUE(fs::exists(file));
    EXPECT_TRUE(fs::is_empty(outside));
}

TEST_F(PublishedTreesTest, ALinkedTrashIsRefusedAndAMissingOneMade) {
    EXPECT_TRUE(pt_ensureTrashFolder(urlAt(library + "/.Trash")).ok());
    EXPECT_TRUE(fs::is_directory(library + "/.Trash"));
    EXPECT_TRUE(pt_ensureTrashFolder(urlAt(library + "/.Trash")).ok()) << "an existing one is fine";
    fs::create_directory_symlink(outside, storage + "/.Trash");
    EXPECT_TRUE(refused(pt_ensureTrashFolder(urlAt(storage + "/.Trash"))));
    dir.writeFile("storage/Work/.Trash", "not a folder");
    Status file = pt_ensureTrashFolder(urlAt(storage + "/Work/.Trash"));
    ASSERT_FALSE(file.ok());
    EXPECT_TRUE(file.error().is(kPosixErrorDomain, ENOTDIR));
}

TEST_F(PublishedTreesTest, CreateFailsOnATakenNameUnlessItBounces) {
    std::string work = storage + "/Work";
    ASSERT_TRUE(runOperation([&](auto done) {
                    pt_createSubFolder(urlAt(work), "Drafts", false, done);
                }).url);
    BoundaryOutcome taken =
        runOperation([&](auto done) { pt_createSubFolder(urlAt(work), "Drafts", false, done); });
    ASSERT_TRUE(taken.error);
    EXPECT_TRUE(taken.error->is(kPosixErrorDomain, EEXIST));
    BoundaryOutcome bounced =
        runOperation([&](auto done) { pt_createSubFolder(urlAt(work), "Drafts", true, done); });
    ASSERT_TRUE(bounced.url);
    EXPECT_EQ(bounced.url->path(), work + "/Drafts 2");

    for (const auto& [name, message] : std::vector<std::pair<std::string, std::string>>{
             {"", "name must not be empty"},
             {".", "name '.' is reserved"},
             {"..", "name '..' is reserved"},
             {"a/b", "name must not contain '/'"},
             {".Trash", "name '.Trash' is reserved"}}) {
        // By an init-capture: clang before 16 cannot capture a structured binding.
        BoundaryOutcome o = runOperation(
            [&, &name = name](auto done) { pt_createSubFolder(urlAt(work), name, true, done); });
        ASSERT_TRUE(o.error) << name;
        EXPECT_TRUE(o.error->is(kHostPorterErrorDomain, kHostPorterInvalidParameter)) << name;
        EXPECT_EQ(descriptionOf(o.error), message);
    }
    EXPECT_FALSE(fs::exists(work + "/.Trash"));
}

TEST_F(PublishedTreesTest, ImportRefusesAFolderIntoItselfAndSpecialFiles) {
    std::string work = storage + "/Work";
    dir.makeDir("storage/Work/Sub");
    for (const std::string& into : {work, work + "/Sub", storage + "/Work/./Sub"}) {
        BoundaryOutcome o =
            runOperation([&](auto done) { pt_importUnderFolder(urlAt(work), urlAt(into), done); });
        EXPECT_EQ(descriptionOf(o.error), "can't import a folder into itself") << into;
    }
    // The same folder under another path is still itself.
    fs::create_directory_symlink(work, dir / "alias");
    BoundaryOutcome aliased = runOperation([&](auto done) {
        pt_importUnderFolder(urlAt(dir / "alias/Sub"), urlAt(work + "/Sub"), done);
    });
    EXPECT_EQ(descriptionOf(aliased.error), "can't import a folder into itself");

    std::string fifo = dir / "pipe";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    BoundaryOutcome piped =
        runOperation([&](auto done) { pt_importUnderFolder(urlAt(fifo), urlAt(work), done); });
    EXPECT_EQ(descriptionOf(piped.error), "can only import a file, a folder or a symbolic link");
    EXPECT_EQ(fs::directory_iterator(work + "/Sub"), fs::directory_iterator());
}

TEST_F(PublishedTreesTest, StaleStagingCopiesOfDeadProcessesAreSwept) {
    std::string name = StagingCopies::makeName();
    EXPECT_EQ(StagingCopies::pidOfName(name), ::getpid());
    EXPECT_EQ(StagingCopies::pidOfName(".tamber-import-x"), 0);
    EXPECT_EQ(StagingCopies::pidOfName("notes.txt"), 0);

    // A process that is certainly gone: a child that has exited and been reaped.
    pid_t child = ::fork();
    if (child == 0)
        ::_exit(0);
    ASSERT_GT(child, 0);
    ::waitpid(child, nullptr, 0);
    std::string dead = ".tamber-import-" + std::to_string(child) + "-00000000000000aa";
    std::string deadCopy = dir.makeDir("storage/Work/" + dead);
    dir.writeFile("storage/Work/" + dead + "/part", "half");
    StagingCopies::record(deadCopy);
    std::string liveCopy = dir.writeFile("storage/Work/" + name, "mine");
    StagingCopies::record(liveCopy);
    // A forged record that names something outside is dropped, the thing left alone.
    std::string forged = ".tamber-import-" + std::to_string(child) + "-00000000000000bb";
    std::string outsideCopy = dir.writeFile("outside/" + forged, "x");
    StagingCopies::record(outsideCopy);

    EXPECT_EQ(StagingCopies::sweepStale(), 1u);
    EXPECT_FALSE(fs::exists(deadCopy));
    EXPECT_TRUE(fs::exists(liveCopy)) << "its process still runs";
    EXPECT_TRUE(fs::exists(outsideCopy));
    // The dead records are gone; the live one stays until its import forgets it.
    EXPECT_EQ(std::distance(fs::directory_iterator(dir / "ledger"), fs::directory_iterator()), 1);
    StagingCopies::forget(liveCopy);
    fs::remove(liveCopy);
    EXPECT_TRUE(fs::is_empty(dir / "ledger"));

    // A finished import leaves neither a staging copy nor a record.
    std::string source = dir.writeFile("elsewhere/c.txt", "c");
    ASSERT_TRUE(runOperation([&](auto done) {
                    pt_importUnderFolder(urlAt(source), urlAt(storage + "/Work"), done);
                }).url);
    EXPECT_TRUE(fs::is_empty(dir / "ledger"));
    for (const auto& entry : fs::directory_iterator(storage + "/Work"))
        EXPECT_FALSE(entry.path().filename().string().starts_with(".tamber-import-"))
            << entry.path();
}

}  // namespace
}  // namespace tamber
