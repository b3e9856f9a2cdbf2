#include "host/UrlOperations.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::TempDir;

Url fileAt(const std::string& path) {
    return Url::fileURLWithPath(path);
}

TEST(UrlRelationshipTest, SameContainsAndOther) {
    TempDir dir;
    std::string docs = dir.makeDir("Documents");
    std::string sub = dir.makeDir("Documents/sub");
    std::string file = dir.writeFile("Documents/sub/a.txt", "x");
    std::string hardLink = dir / "b.txt";
    ASSERT_EQ(::link(file.c_str(), hardLink.c_str()), 0);
    std::string symLink = dir / "link";
    ASSERT_EQ(::symlink(sub.c_str(), symLink.c_str()), 0);
    using enum UrlRelationship;
    const struct {
        std::string a, b;
        UrlRelationship expected;
    } cases[] = {
        {docs, docs, Same},
        {docs, sub, Contains},
        {docs, file, Contains},
        {sub, docs, Other},
        {docs, dir.makeDir("Documents2"), Other},  // a shared name prefix is not containment
        {file, file + "/x", Other},                // a file contains nothing, even lexically
        {docs + "/sub/..", docs, Same},            // standardised before the comparison
        {docs, docs + "/new.txt", Contains},       // not yet created, yet inside
        {file, hardLink, Same},                    // one file under two names
        {dir / "x", dir / "y", Other},             // missing paths: the same only if equal
        {dir / "x", dir / "x", Same},
        {symLink, symLink + "/f", Other},  // a symbolic link to a folder contains nothing
        {symLink, sub, Other},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(pt_relationshipToItemAtURL(fileAt(c.a), fileAt(c.b)), c.expected)
            << c.a << " " << c.b;
    }
}

TEST(FolderTest, FoldersArePackagesAndFilesAreNot) {
    TempDir dir;
    EXPECT_TRUE(pt_isFolder(fileAt(dir.makeDir("plain"))));
    EXPECT_FALSE(pt_isFolder(fileAt(dir.makeDir("Talk.lumen"))));
    EXPECT_FALSE(pt_isFolder(fileAt(dir.writeFile("f.txt"))));
    EXPECT_FALSE(pt_isFolder(fileAt(dir / "missing")));
}

TEST(DirectorySizeTest, SumsRegularFilesAtEveryDepthWithoutFollowingLinksOrFails) {
    TempDir dir;
    std::string root = dir.makeDir("Deck.lumen");
    dir.writeFile("Deck.lumen/a", std::string(100, 'a'));
    dir.writeFile("Deck.lumen/x/y/z/b", std::string(23, 'b'));
    dir.makeDir("Deck.lumen/empty");
    std::string outside = dir.writeFile("big", std::string(5000, 'c'));
    ASSERT_EQ(::symlink(outside.c_str(), (root + "/link").c_str()), 0);
    ASSERT_EQ(::symlink(dir.path().c_str(), (root + "/loop").c_str()), 0);

    auto size = pt_directorySizeWithError(fileAt(root));
    ASSERT_TRUE(size.ok()) << size.error().description();
    EXPECT_EQ(size.value(), 123u);

    // Failures are errors, and every descriptor opened on the way is closed.
    EXPECT_EQ(pt_directorySizeWithError(fileAt(dir / "missing")).error(), Error::posix(ENOENT));
    dir.writeFile("Deck.lumen/x/y/z/c/file", "1");
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    using Op = FaultInjectingFileSystem::Operation;
    fs->inject(Op::Statx, EIO, 1, "/z/c");
    size = pt_directorySizeWithError(fileAt(root));
    ASSERT_FALSE(size.ok());
    EXPECT_EQ(size.error(), Error::posix(EIO));
    EXPECT_EQ(fs->calls(Op::Open) + fs->calls(Op::Openat) + fs->calls(Op::OpenBeneath),
              fs->calls(Op::Close));
}

TEST(ReadWriteAccessTest, RunsOnTheItemAndReportsFailures) {
    TempDir dir;
    std::string file = dir.writeFile("f", "x");
    std::string link = dir / "link";
    ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
    int seen = -1;
    EXPECT_TRUE(pt_withReadWriteAccess(fileAt(file), [&](int fd) { return (seen = fd) >= 0; }));
    EXPECT_GE(seen, 0);
    EXPECT_TRUE(pt_withReadWriteAccess(fileAt(dir.makeDir("d")), [](int) { return true; }));
    // The body's errno survives the close.
    EXPECT_FALSE(pt_withReadWriteAccess(fileAt(file), [](int) { return (errno = ENOSPC) == 0; }));
    EXPECT_EQ(errno, ENOSPC);
    bool ran = false;
    for (auto [path, error] : {std::pair{dir / "missing", ENOENT}, std::pair{link, ELOOP}}) {
        EXPECT_FALSE(pt_withReadWriteAccess(fileAt(path), [&](int) { return ran = true; }));
        EXPECT_EQ(errno, error) << path;
    }
    EXPECT_FALSE(ran);
}

}  // namespace
}  // namespace tamber
