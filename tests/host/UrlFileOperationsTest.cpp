#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>

#include "host/UrlOperations.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;
using testing::TempDir;
using Op = FaultInjectingFileSystem::Operation;

Url at(const std::string& path) {
    return Url::fileURLWithPath(path);
}

// What one operation reported; every run checks that the completion was called exactly once,
// with a URL or an error but never both.
struct Outcome {
    std::optional<Url> url;
    std::optional<Error> error;
    std::string path() const { return url ? url->path() : "<none>"; }
};

template <class Operation>
Outcome run(Operation operation) {
    Outcome outcome;
    int calls = 0;
    operation([&](Result<Url> result) {
        ++calls;
        if (result.ok())
            outcome.url = std::move(result).value();
        else
            outcome.error = result.error();
    });
    EXPECT_EQ(calls, 1);
    EXPECT_NE(outcome.url.has_value(), outcome.error.has_value());
    return outcome;
}

std::optional<Error> runDelete(const std::string& path) {
    int calls = 0;
    std::optional<Error> result;
    pt_deleteWithCompletionHandler(at(path), [&](Status status) {
        ++calls;
        if (!status.ok())
            result = status.error();
    });
    EXPECT_EQ(calls, 1);
    return result;
}

// Everything below `root`, one line per item, sorted: "dir/", "file=contents", "link->target".
std::set<std::string> tree(const std::string& root) {
    std::set<std::string> out;
    for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator();
         ++it) {
        std::string relative = it->path().lexically_relative(root).string();
        if (it->is_symlink()) {
            out.insert(relative + "->" + fs::read_symlink(it->path()).string());
        } else if (it->is_directory()) {
            out.insert(relative + "/");
        } else {
            std::ifstream in(it->path());
            std::stringstream contents;
            contents << in.rdbuf();
            out.insert(relative + "=" + contents.str());
        }
    }
    return out;
}

TEST(ImportTest, CopiesFilesUnderFreeNamesAndLeavesTheSourceAlone) {
    TempDir dir;
    std::string source = dir.writeFile("outside/a.txt", "alpha");
    std::string docs = dir.makeDir("Documents");
    for (std::string expected : {"a.txt", "a 2.txt", "a 3.txt"}) {
        Outcome o = run([&](auto done) { pt_importUnderFolder(at(source), at(docs), done); });
        EXPECT_EQ(o.path(), docs + "/" + expected);
    }
    EXPECT_EQ(tree(docs), (std::set<std::string>{"a.txt=alpha", "a 2.txt=alpha", "a 3.txt=alpha"}));
    EXPECT_EQ(tree(dir / "outside"), std::set<std::string>{"a.txt=alpha"});

    // Extension-less and hidden names take the number at the end; a number already in the
    // name is kept; packages keep their extension, plain folders do not.
    const struct {
        std::string name;
        bool folder;
        std::string bounced;
    } cases[] = {
        {"README", false, "README 2"},
        {".profile", false, ".profile 2"},
        {"Chapter 10.txt", false, "Chapter 10 2.txt"},
        {"archive.tar.gz", false, "archive.tar 2.gz"},
        {"Photos.2024", true, "Photos.2024 2"},
        {"Deck.lumen", true, "Deck 2.lumen"},
    };
    for (const auto& c : cases) {
        std::string item = c.folder ? dir.makeDir("src/" + c.name) : dir.writeFile("src/" + c.name);
        run([&](auto done) { pt_importUnderFolder(at(item), at(docs), done); });
        Outcome o = run([&](auto done) { pt_importUnderFolder(at(item), at(docs), done); });
        EXPECT_EQ(o.path(), docs + "/" + c.bounced) << c.name;
    }
}

TEST(ImportTest, CopiesAFolderTreeWithLinksAsLinks) {
    TempDir dir;
    dir.writeFile("private/secret", "keep out");
    std::string album = dir.makeDir("in/Album");
    dir.writeFile("in/Album/one.jpg", "1");
    dir.writeFile("in/Album/deep/er/two.jpg", "22");
    dir.makeDir("in/Album/empty");
    ASSERT_EQ(::symlink(dir.path().c_str() /* out of the tree */, (album + "/up").c_str()), 0);
    ASSERT_EQ(::symlink("one.jpg", (album + "/alias").c_str()), 0);
    ASSERT_EQ(::mkfifo((album + "/pipe").c_str(), 0600), 0);
    ::chmod((album + "/one.jpg").c_str(), 0444);
    std::string docs = dir.makeDir("Documents");

    Outcome o = run([&](auto done) { pt_importUnderFolder(at(album), at(docs), done); });
    ASSERT_FALSE(o.error) << o.error->description();
    EXPECT_EQ(o.path(), docs + "/Album");
    // The pipe is left out; links are copied, never followed.
    std::set<std::string> expected{"one.jpg=1",          "deep/",  "deep/er/",
                                   "deep/er/two.jpg=22", "empty/", "alias->one.jpg",
                                   "up->" + dir.path()};
    EXPECT_EQ(tree(docs + "/Album"), expected);
    EXPECT_EQ(tree(docs).size(), expected.size() + 1) << "no temporary copy left behind";
    // A read-only source gives a copy its owner can edit.
    struct stat st {};
    ASSERT_EQ(::stat((docs + "/Album/one.jpg").c_str(), &st), 0);
    EXPECT_TRUE(st.st_mode & S_IWUSR);
    EXPECT_EQ(tree(dir / "private"), std::set<std::string>{"secret=keep out"});

    // A link itself is imported as a link.
    Outcome link = run([&](auto done) { pt_importUnderFolder(at(album + "/up"), at(docs), done); });
    EXPECT_EQ(link.path(), docs + "/up");
    EXPECT_TRUE(fs::is_symlink(docs + "/up"));
}

TEST(ImportTest, AFolderIsNeverImportedIntoItself) {
    TempDir dir;
    std::string folder = dir.makeDir("Notes");
    dir.writeFile("Notes/n.txt", "n");
    Outcome o = run([&](auto done) { pt_importUnderFolder(at(folder), at(folder), done); });
    ASSERT_TRUE(o.error);
    EXPECT_TRUE(o.error->is(kHostPorterErrorDomain, kHostPorterInvalidParameter));
    EXPECT_EQ(tree(folder), (std::set<std::string>{"n.txt=n"}));
}

TEST(ImportTest, FailuresLeaveNoCopyUnderAnyNameAndCloseEverything) {
    TempDir dir;
    std::string file = dir.writeFile("in/report.pdf", std::string(300000, 'r'));
    std::string folder = dir.makeDir("in/Folder");
    dir.writeFile("in/Folder/a", "a");
    dir.writeFile("in/Folder/b/c", "c");
    ASSERT_EQ(::symlink("a", (folder + "/link").c_str()), 0);
    std::string docs = dir.makeDir("Documents");
    dir.writeFile("Documents/report.pdf", "older");
    auto before = tree(dir / "in");
    auto failing = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(failing);

    const struct {
        Op op;
        int error;
        std::string where;
        std::string source;
    } cases[] = {
        {Op::CopyFileRange, ENOSPC, "", file},  // the disk fills while copying
        {Op::Fsync, EIO, "", file},
        {Op::Renameat2, ENOSPC, "", file},           // the copy is made, placing it fails
        {Op::Openat, EACCES, "/in/Folder", folder},  // the source cannot be read
        {Op::Openat, EMFILE, "/Folder/b", folder},   // part-way through a folder
        {Op::Mkdirat, EDQUOT, "/b", folder},
        {Op::Symlinkat, ENOSPC, "/Documents/.tamber-import-", folder},  // not the ledger's
        {Op::CopyFileRange, EIO, "", folder},
        {Op::Renameat2, EIO, "", folder},
    };
    for (const auto& c : cases) {
        failing->resetCalls();
        failing->inject(c.op, c.error, 1, c.where);
        Outcome o = run([&](auto done) { pt_importUnderFolder(at(c.source), at(docs), done); });
        std::string name(FaultInjectingFileSystem::operationName(c.op));
        EXPECT_EQ(failing->pendingInjections(), 0u) << name;
        failing->clearInjections();
        EXPECT_EQ(o.error, Error::posix(c.error)) << name;
        EXPECT_EQ(tree(docs), std::set<std::string>{"report.pdf=older"}) << name;
        // Every descriptor opened was closed (an open that was made to fail opened nothing).
        size_t opened =
            failing->calls(Op::Open) + failing->calls(Op::Openat) + failing->calls(Op::OpenBeneath);
        EXPECT_EQ(opened - (c.op == Op::Openat ? 1 : 0), failing->calls(Op::Close)) << name;
    }
    EXPECT_EQ(tree(dir / "in"), before);
}

TEST(ImportTest, FallsBackToReadingAndWritingWhenTheKernelCannotCopy) {
    TempDir dir;
    std::string contents(200000, 'x');
    contents[123456] = 'y';
    std::string file = dir.writeFile("in/big.bin", contents);
    std::string docs = dir.makeDir("Documents");
    auto failing = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(failing);
    failing->inject(Op::CopyFileRange, EXDEV);
    Outcome o = run([&](auto done) { pt_importUnderFolder(at(file), at(docs), done); });
    ASSERT_FALSE(o.error) << o.error->description();
    EXPECT_EQ(tree(docs), std::set<std::string>{"big.bin=" + contents});
    EXPECT_GT(failing->calls(Op::Write), 0u);
}

// The disk fills part-way through the copy the kernel could not make itself: nothing of the
// import stays in the folder, the staging copy included.
TEST(ImportTest, AFallbackCopyThatFillsTheDiskLeavesNothingBehind) {
    TempDir dir;
    std::string file = dir.writeFile("in/big.bin", std::string(300000, 'x'));
    std::string docs = dir.makeDir("Documents");
    dir.writeFile("Documents/keep.txt", "k");
    class FillingDisk : public FaultInjectingFileSystem {
    public:
        using FaultInjectingFileSystem::FaultInjectingFileSystem;
        ssize_t write(int fd, const void* buffer, size_t size) override {
            if (++writes_ > 1) {  // the first block fits, the next does not
                errno = ENOSPC;
                return -1;
            }
            return FaultInjectingFileSystem::write(fd, buffer, size);
        }

    private:
        int writes_ = 0;
    };
    auto failing = std::make_shared<FillingDisk>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(failing);
    failing->inject(Op::CopyFileRange, EXDEV, -1);
    Outcome o = run([&](auto done) { pt_importUnderFolder(at(file), at(docs), done); });
    failing->clearInjections();
    EXPECT_EQ(o.error, Error::posix(ENOSPC));
    EXPECT_EQ(tree(docs), std::set<std::string>{"keep.txt=k"});
}

TEST(CreateFolderTest, BouncesTakenNames) {
    TempDir dir;
    std::string docs = dir.makeDir("Documents");
    dir.writeFile("Documents/Drafts.txt");
    for (std::string expected : {"Drafts", "Drafts 2", "Drafts 3"}) {
        Outcome o = run([&](auto done) { pt_createSubFolder(at(docs), "Drafts", true, done); });
        EXPECT_EQ(o.path(), docs + "/" + expected);
        EXPECT_TRUE(fs::is_directory(docs + "/" + expected));
    }
    Outcome o = run([&](auto done) { pt_createSubFolder(at(docs), "Drafts.txt", true, done); });
    EXPECT_EQ(o.path(), docs + "/Drafts.txt 2") << "a folder takes no extension";
    Outcome missing =
        run([&](auto done) { pt_createSubFolder(at(dir / "nope"), "x", true, done); });
    EXPECT_EQ(missing.error, Error::posix(ENOENT));
}

TEST(NameTest, RefusesNamesThatAreNotASingleComponent) {
    TempDir dir;
    std::string docs = dir.makeDir("Documents");
    std::string file = dir.writeFile("Documents/a.txt", "a");
    std::string other = dir.makeDir("Other");
    auto before = tree(dir.path());
    for (std::string name : {std::string(), std::string("."), std::string(".."), std::string("x/y"),
                             std::string("/"), std::string("a\0b", 3)}) {
        for (Outcome o : {run([&](auto done) { pt_createSubFolder(at(docs), name, true, done); }),
                          run([&](auto done) { pt_renameWithNewName(at(file), name, done); }),
                          run([&](auto done) {
                              pt_reparentUnderFolder(at(file), at(other),
                                                     std::optional<std::string>(name), done);
                          })}) {
            ASSERT_TRUE(o.error) << "[" << name << "]";
            EXPECT_TRUE(o.error->is(kHostPorterErrorDomain, kHostPorterInvalidParameter));
        }
    }
    EXPECT_EQ(tree(dir.path()), before);
}

TEST(MoveTest, RenamesAndMovesWithoutEverReplacing) {
    TempDir dir;
    std::string a = dir.writeFile("Documents/a.txt", "A");
    dir.writeFile("Documents/b.txt", "B");
    std::string docs = dir / "Documents";
    std::string dest = dir.makeDir("Documents/dest");
    dir.writeFile("Documents/dest/a.txt", "other A");

    // Onto a taken name: refused, both items untouched.
    Outcome rename = run([&](auto done) { pt_renameWithNewName(at(a), "b.txt", done); });
    EXPECT_EQ(rename.error, Error::posix(EEXIST));
    Outcome move = run([&](auto done) { pt_reparentUnderFolder(at(a), at(dest), nullptr, done); });
    EXPECT_EQ(move.error, Error::posix(EEXIST));
    Outcome noBounce =
        run([&](auto done) { pt_reparentUnderFolder(at(a), at(dest), false, done); });
    EXPECT_EQ(noBounce.error, Error::posix(EEXIST));
    EXPECT_EQ(tree(docs),
              (std::set<std::string>{"a.txt=A", "b.txt=B", "dest/", "dest/a.txt=other A"}));

    // The same name is no change; a new name is used as given.
    EXPECT_EQ(run([&](auto done) { pt_renameWithNewName(at(a), "a.txt", done); }).path(), a);
    EXPECT_EQ(
        run([&](auto done) { pt_reparentUnderFolder(at(a), at(dest), "c.txt", done); }).path(),
        dest + "/c.txt");
    EXPECT_EQ(run([&](auto done) { pt_renameWithNewName(at(dest + "/c.txt"), "d", done); }).path(),
              dest + "/d");
    EXPECT_EQ(tree(docs),
              (std::set<std::string>{"b.txt=B", "dest/", "dest/a.txt=other A", "dest/d=A"}));

    // A folder cannot go inside itself; a missing item is ENOENT.
    EXPECT_EQ(
        run([&](auto done) { pt_reparentUnderFolder(at(docs), at(dest), nullptr, done); }).error,
        Error::posix(EINVAL));
    EXPECT_EQ(run([&](auto done) { pt_renameWithNewName(at(docs + "/gone"), "x", done); }).error,
              Error::posix(ENOENT));
}

TEST(MoveTest, MovesALinkAsTheLink) {
    TempDir dir;
    std::string target = dir.writeFile("outside/real.txt", "real");
    std::string link = dir / "Documents/link";
    dir.makeDir("Documents");
    std::string dest = dir.makeDir("Documents/dest");
    ASSERT_EQ(::symlink(target.c_str(), link.c_str()), 0);
    Outcome o = run([&](auto done) { pt_reparentUnderFolder(at(link), at(dest), nullptr, done); });
    EXPECT_EQ(o.path(), dest + "/link");
    EXPECT_EQ(tree(dest), std::set<std::string>{"link->" + target});
    EXPECT_EQ(tree(dir / "outside"), std::set<std::string>{"real.txt=real"});
}

TEST(MoveTest, TrashAndBouncingMovesTakeTheNextFreeName) {
    TempDir dir;
    std::string trash = dir.makeDir("Documents/.Trash");
    for (std::string expected : {"a.txt", "a 2.txt", "a 3.txt"}) {
        std::string item = dir.writeFile("Documents/a.txt", expected);
        Outcome o = run([&](auto done) { pt_trashUnderFolder(at(item), at(trash), done); });
        EXPECT_EQ(o.path(), trash + "/" + expected);
    }
    std::string folder = dir.makeDir("Documents/Folder.d");
    dir.makeDir("Documents/.Trash/Folder.d");
    EXPECT_EQ(run([&](auto done) { pt_trashUnderFolder(at(folder), at(trash), done); }).path(),
              trash + "/Folder.d 2");
    EXPECT_EQ(tree(trash), (std::set<std::string>{"a.txt=a.txt", "a 2.txt=a 2.txt",
                                                  "a 3.txt=a 3.txt", "Folder.d/", "Folder.d 2/"}));

    std::string back = dir.makeDir("Documents/back");
    dir.writeFile("Documents/back/a.txt", "in the way");
    Outcome restored = run(
        [&](auto done) { pt_reparentUnderFolder(at(trash + "/a 2.txt"), at(back), true, done); });
    EXPECT_EQ(restored.path(), back + "/a 2.txt");
    restored =
        run([&](auto done) { pt_reparentUnderFolder(at(trash + "/a.txt"), at(back), true, done); });
    EXPECT_EQ(restored.path(), back + "/a 3.txt");
}

TEST(MoveTest, AFailedRenameLeavesTheItemWhereItWas) {
    TempDir dir;
    std::string item = dir.writeFile("Documents/a.txt", "A");
    std::string dest = dir.makeDir("Elsewhere");
    auto failing = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(failing);
    for (int error : {EXDEV, ENOSPC, EACCES}) {
        failing->inject(Op::Renameat2, error);
        Outcome o = run([&](auto done) { pt_reparentUnderFolder(at(item), at(dest), true, done); });
        EXPECT_EQ(o.error, Error::posix(error));
        failing->inject(Op::Renameat2, error);
        o = run([&](auto done) { pt_trashUnderFolder(at(item), at(dest), done); });
        EXPECT_EQ(o.error, Error::posix(error));
        EXPECT_EQ(tree(dir.path()),
                  (std::set<std::string>{"Documents/", "Documents/a.txt=A", "Elsewhere/"}));
    }
    EXPECT_EQ(
        failing->calls(Op::Open) + failing->calls(Op::Openat) + failing->calls(Op::OpenBeneath),
        failing->calls(Op::Close));
}

TEST(MoveTest, WithoutKernelSupportForNoReplaceStillNeverReplaces) {
    TempDir dir;
    std::string a = dir.writeFile("Documents/a.txt", "A");
    std::string b = dir.writeFile("Documents/b.txt", "B");
    std::string dest = dir.makeDir("Documents/dest");
    dir.writeFile("Documents/dest/b.txt", "other B");
    // Every attempt with the flag fails as on a file system that does not know it.
    struct NoFlagFileSystem : FaultInjectingFileSystem {
        using FaultInjectingFileSystem::FaultInjectingFileSystem;
        int renameat2(int od, const std::string& o, int nd, const std::string& n,
                      unsigned int flags) override {
            if (flags != 0) {
                errno = EINVAL;
                return -1;
            }
            return FaultInjectingFileSystem::renameat2(od, o, nd, n, flags);
        }
    };
    auto noFlag = std::make_shared<NoFlagFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scopedNoFlag(noFlag);
    EXPECT_EQ(run([&](auto done) { pt_reparentUnderFolder(at(b), at(dest), nullptr, done); }).error,
              Error::posix(EEXIST));
    EXPECT_EQ(run([&](auto done) { pt_trashUnderFolder(at(b), at(dest), done); }).path(),
              dest + "/b 2.txt");
    EXPECT_EQ(
        run([&](auto done) { pt_reparentUnderFolder(at(a), at(dest), nullptr, done); }).path(),
        dest + "/a.txt");
    EXPECT_EQ(tree(dest), (std::set<std::string>{"a.txt=A", "b.txt=other B", "b 2.txt=B"}));
}

TEST(DeleteTest, RemovesFoldersAndLinksWithoutFollowingLinks) {
    TempDir dir;
    std::string kept = dir.makeDir("kept");
    dir.writeFile("kept/precious", "p");
    std::string doomed = dir.makeDir("Documents/doomed");
    dir.writeFile("Documents/doomed/a/b/c", "c");
    dir.writeFile("Documents/doomed/top", "t");
    ASSERT_EQ(::symlink(kept.c_str(), (doomed + "/a/link").c_str()), 0);
    ASSERT_EQ(::symlink("/nonexistent", (doomed + "/dangling").c_str()), 0);
    std::string topLink = dir / "Documents/toplink";
    ASSERT_EQ(::symlink(kept.c_str(), topLink.c_str()), 0);

    EXPECT_FALSE(runDelete(doomed));
    EXPECT_FALSE(runDelete(topLink));
    EXPECT_FALSE(runDelete(dir.writeFile("Documents/file", "f")));
    EXPECT_EQ(tree(dir / "Documents"), std::set<std::string>{});
    EXPECT_EQ(tree(kept), std::set<std::string>{"precious=p"});
    EXPECT_EQ(runDelete(doomed), Error::posix(ENOENT));
    // Outside every published tree.
    EXPECT_TRUE(runDelete("/")->is(kHostPorterErrorDomain, kHostPorterNoSuchItem));
}

TEST(DeleteTest, AFailurePartWayReportsItOnceClosesEverythingAndNeverPassesForDone) {
    TempDir dir;
    std::string doomed = dir.makeDir("doomed");
    dir.writeFile("doomed/a/one", "1");
    dir.writeFile("doomed/b/two", "2");
    auto failing = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(failing);
    failing->inject(Op::Unlinkat, EACCES, 1, "/b/two");
    EXPECT_EQ(runDelete(doomed), Error::posix(EACCES));
    EXPECT_TRUE(tree(doomed).contains("b/two=2"));
    EXPECT_EQ(
        failing->calls(Op::Open) + failing->calls(Op::Openat) + failing->calls(Op::OpenBeneath),
        failing->calls(Op::Close));
    EXPECT_FALSE(runDelete(doomed));
    EXPECT_FALSE(fs::exists(doomed));

    // ENOENT while removing is someone else's delete winning the race, so it passes for what
    // is inside; but a folder still there after its own removal said so was not deleted.
    doomed = dir.makeDir("doomed");
    dir.writeFile("doomed/one", "1");
    dir.writeFile("doomed/two", "2");
    failing->injectAfter(Op::Unlinkat, ENOENT, 2);  // the files go, the folder's own call fails
    EXPECT_EQ(runDelete(doomed), Error::posix(ENOENT));
    ASSERT_TRUE(fs::exists(doomed));
    EXPECT_EQ(tree(doomed), std::set<std::string>{});
    EXPECT_FALSE(runDelete(doomed));
    EXPECT_FALSE(fs::exists(doomed));
}

}  // namespace
}  // namespace tamber
