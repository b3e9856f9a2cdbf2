#include "platform/FaultInjectingFileSystem.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <thread>
#include <vector>

#include "platform/LinuxFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using Op = FaultInjectingFileSystem::Operation;

class FaultInjectingFileSystemTest : public ::testing::Test {
protected:
    // Whether statx succeeded; errno holds the error when it did not.
    bool exists(const std::string& path) {
        struct statx st {};
        errno = 0;
        return fs_.statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &st) == 0;
    }

    testing::TempDir dir_;
    FaultInjectingFileSystem fs_{std::make_shared<LinuxFileSystem>()};
};

TEST_F(FaultInjectingFileSystemTest, FailsTheGivenNumberOfCallsThenForwards) {
    std::string path = dir_.writeFile("file");
    fs_.inject(Op::Statx, EIO, 2);
    fs_.inject(Op::Mkdir, ENOSPC, -1);
    for (int i = 0; i < 2; ++i) {
        EXPECT_FALSE(exists(path)) << "call " << i;
        EXPECT_EQ(errno, EIO);
    }
    EXPECT_TRUE(exists(path));
    EXPECT_EQ(fs_.calls(Op::Statx), 3u);
    EXPECT_EQ(fs_.pendingInjections(), 1u);

    // An injection that fails forever stays until cleared, and never reaches the disk.
    for (int i = 0; i < 5; ++i) {
        EXPECT_EQ(fs_.mkdir(dir_ / "never", 0755), -1);
        EXPECT_EQ(errno, ENOSPC);
    }
    EXPECT_FALSE(exists(dir_ / "never"));
    fs_.clearInjections();
    EXPECT_EQ(fs_.mkdir(dir_ / "never", 0755), 0);
    EXPECT_EQ(fs_.calls(Op::Mkdir), 6u);
    EXPECT_EQ(fs_.calls(Op::Open), 0u);

    fs_.resetCalls();
    EXPECT_EQ(fs_.calls(Op::Mkdir), 0u);
    fs_.inject(Op::Statx, EIO, 0);
    EXPECT_TRUE(exists(path)) << "zero times injects nothing";
}

// A failure meant for an operation in the middle of its calls: the first calls pass, and calls
// of other threads neither fail nor use it up.
TEST_F(FaultInjectingFileSystemTest, AnInjectionCanWaitItsTurnAndKeepToOneThread) {
    std::string path = dir_.writeFile("file");
    fs_.onlyOnThread(std::this_thread::get_id());
    fs_.injectAfter(Op::Statx, EIO, 2);
    bool otherFailed = false;
    std::thread other([&] {
        for (int i = 0; i < 5; ++i) otherFailed |= !exists(path);
    });
    other.join();
    EXPECT_FALSE(otherFailed);
    EXPECT_TRUE(exists(path));
    EXPECT_TRUE(exists(path));
    EXPECT_FALSE(exists(path));
    EXPECT_EQ(errno, EIO);
    EXPECT_TRUE(exists(path));
    EXPECT_EQ(fs_.pendingInjections(), 0u);
    fs_.onlyOnThread(std::nullopt);
}

TEST_F(FaultInjectingFileSystemTest, PathSubstringsSelectTheFailingCalls) {
    std::string a = dir_.writeFile("alpha/file");
    std::string b = dir_.writeFile("beta/file");
    fs_.inject(Op::Statx, EACCES, 1, "beta/");
    EXPECT_TRUE(exists(a));
    EXPECT_FALSE(exists(b));
    EXPECT_EQ(errno, EACCES);
    EXPECT_TRUE(exists(b)) << "used up";

    // Injections for the same operation are tried in order; the first match is used up first.
    fs_.inject(Op::Statx, ENOENT, 1, "alpha");
    fs_.inject(Op::Statx, ELOOP, 1);
    EXPECT_FALSE(exists(b));
    EXPECT_EQ(errno, ELOOP);
    EXPECT_FALSE(exists(a));
    EXPECT_EQ(errno, ENOENT);

    // Descriptor calls and names relative to a directory descriptor match by the full path.
    int betaDir = fs_.open(dir_ / "beta", O_RDONLY | O_DIRECTORY, 0);
    int alphaDir = fs_.open(dir_ / "alpha", O_RDONLY | O_DIRECTORY, 0);
    ASSERT_GE(betaDir, 0);
    ASSERT_GE(alphaDir, 0);
    fs_.inject(Op::Openat, EMFILE, -1, "beta/file");
    fs_.inject(Op::ReadDirectory, EIO, -1, "/beta");
    EXPECT_EQ(fs_.openat(betaDir, "file", O_RDONLY, 0), -1);
    EXPECT_EQ(errno, EMFILE);
    std::vector<FileSystem::DirectoryEntry> entries;
    EXPECT_FALSE(fs_.readDirectory(betaDir, entries));
    EXPECT_EQ(errno, EIO);
    int file = fs_.openat(alphaDir, "file", O_RDONLY, 0);
    EXPECT_GE(file, 0);
    EXPECT_TRUE(fs_.readDirectory(alphaDir, entries));
    EXPECT_EQ(entries.size(), 1u);
    for (int fd : {file, alphaDir, betaDir}) EXPECT_EQ(fs_.close(fd), 0);
}

TEST_F(FaultInjectingFileSystemTest, CountsAndInjectionsHoldUnderConcurrency) {
    std::string path = dir_.writeFile("shared");
    fs_.inject(Op::Statx, EIO, 300);
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 500; ++i) failures += !exists(path);
        });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(failures, 300);
    EXPECT_EQ(fs_.calls(Op::Statx), 2000u);
}

}  // namespace
}  // namespace tamber
