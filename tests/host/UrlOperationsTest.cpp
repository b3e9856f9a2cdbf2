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

Url at(const std::string& path) {
    return Url::fileURLWithPath(path);
}

TEST(UrlRelationshipTest, SameContainsAndOther) {
    TempDir dir;
    std::string docs = dir.makeDir("Documents");
    std::string sub = dir.makeDir("Documents/sub");
    std::string file = dir.writeFile("Documents/sub/a.txt", "x");
    std::string sibling = dir.makeDir("Documents2");

    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs), at(docs)), UrlRelationship::Same);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs), at(sub)), UrlRelationship::Contains);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs), at(file)), UrlRelationship::Contains);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(sub), at(docs)), UrlRelationship::Other);
    // A shared name prefix is not containment.
    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs), at(sibling)), UrlRelationship::Other);
    // A file contains nothing, even lexically.
    EXPECT_EQ(pt_relationshipToItemAtURL(at(file), at(file + "/x")), UrlRelationship::Other);
    // Lexical standardisation happens before the comparison.
    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs + "/sub/.."), at(docs)), UrlRelationship::Same);
    // Something not yet created can still be inside an existing folder.
    EXPECT_EQ(pt_relationshipToItemAtURL(at(docs), at(docs + "/new.txt")),
              UrlRelationship::Contains);
}

TEST(UrlRelationshipTest, SameFileUnderTwoNamesIsSame) {
    TempDir dir;
    std::string a = dir.writeFile("a.txt", "x");
    std::string b = dir / "b.txt";
    ASSERT_EQ(::link(a.c_str(), b.c_str()), 0);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(a), at(b)), UrlRelationship::Same);
    // Two missing paths are the same only when the paths are.
    EXPECT_EQ(pt_relationshipToItemAtURL(at(dir / "x"), at(dir / "y")), UrlRelationship::Other);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(dir / "x"), at(dir / "x")), UrlRelationship::Same);
}

TEST(UrlRelationshipTest, SymbolicLinkToAFolderDoesNotContain) {
    TempDir dir;
    std::string real = dir.makeDir("real");
    std::string link = dir / "link";
    ASSERT_EQ(::symlink(real.c_str(), link.c_str()), 0);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(link), at(link + "/f")), UrlRelationship::Other);
    EXPECT_EQ(pt_relationshipToItemAtURL(at(link), at(real)), UrlRelationship::Other);
}

TEST(FolderTest, FoldersArePackagesAndFilesAreNot) {
    TempDir dir;
    EXPECT_TRUE(pt_isFolder(at(dir.makeDir("plain"))));
    EXPECT_FALSE(pt_isFolder(at(dir.makeDir("Talk.lumen"))));
    EXPECT_FALSE(pt_isFolder(at(dir.writeFile("f.txt"))));
    EXPECT_FALSE(pt_isFolder(at(dir / "missing")));
}

TEST(DirectorySizeTest, SumsRegularFilesAtEveryDepthWithoutFollowingLinks) {
    TempDir dir;
    std::string root = dir.makeDir("Deck.lumen");
    dir.writeFile("Deck.lumen/a", std::string(100, 'a'));
    dir.writeFile("Deck.lumen/x/y/z/b", std::string(23, 'b'));
    dir.makeDir("Deck.lumen/empty");
    std::string outside = dir.writeFile("big", std::string(5000, 'c'));
    ASSERT_EQ(::symlink(outside.c_str(), (root + "/link").c_str()), 0);
    ASSERT_EQ(::symlink(dir.path().c_str(), (root + "/loop").c_str()), 0);

    auto size = pt_directorySizeWithError(at(root));
    ASSERT_TRUE(size.ok()) << size.error().description();
    EXPECT_EQ(size.value(), 123u);
}

TEST(DirectorySizeTest, FailuresAreErrorsAndDescriptorsAreClosed) {
    TempDir dir;
    EXPECT_EQ(pt_directorySizeWithError(at(dir / "missing")).error(), Error::posix(ENOENT));

    std::string root = dir.makeDir("p");
    dir.writeFile("p/a/b/c/file", "1");
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    using Op = FaultInjectingFileSystem::Operation;
    fs->inject(Op::Statx, EIO, 1, "/b/c");
    auto size = pt_directorySizeWithError(at(root));
    ASSERT_FALSE(size.ok());
    EXPECT_EQ(size.error(), Error::posix(EIO));
    EXPECT_EQ(fs->calls(Op::Open) + fs->calls(Op::Openat), fs->calls(Op::Close));
}

TEST(ReadWriteAccessTest, RunsOnTheItemAndReportsFailures) {
    TempDir dir;
    std::string file = dir.writeFile("f", "x");
    int seen = -1;
    EXPECT_TRUE(pt_withReadWriteAccess(at(file), [&](int fd) {
        seen = fd;
        return true;
    }));
    EXPECT_GE(seen, 0);
    EXPECT_TRUE(pt_withReadWriteAccess(at(dir.makeDir("d")), [](int) { return true; }));

    // The body's errno survives the close.
    EXPECT_FALSE(pt_withReadWriteAccess(at(file), [](int) {
        errno = ENOSPC;
        return false;
    }));
    EXPECT_EQ(errno, ENOSPC);

    bool ran = false;
    EXPECT_FALSE(pt_withReadWriteAccess(at(dir / "missing"), [&](int) { return ran = true; }));
    EXPECT_EQ(errno, ENOENT);
    std::string link = dir / "link";
    ASSERT_EQ(::symlink(file.c_str(), link.c_str()), 0);
    EXPECT_FALSE(pt_withReadWriteAccess(at(link), [&](int) { return ran = true; }));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(ran);
}

}  // namespace
}  // namespace tamber
