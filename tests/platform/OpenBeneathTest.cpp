#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;
using Resolution = LinuxFileSystem::BeneathResolution;

// Every case runs through openat2 and through the walk that kernels without it get, which must
// agree on every answer.
class OpenBeneathTest : public ::testing::TestWithParam<Resolution> {
protected:
    void SetUp() override {
        dir.makeDir("root/a/b");
        dir.writeFile("root/a/b/file.txt", "x");
        dir.makeDir("outside");
        dir.writeFile("outside/secret.txt", "s");
        fs::create_directory_symlink(dir / "outside", dir / "root/a/out");
        fs::create_directory_symlink(dir / "root/a/b", dir / "root/a/in");
        root = ::open((dir / "root").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
        ASSERT_GE(root, 0);
    }
    void TearDown() override {
        if (root >= 0)
            ::close(root);
    }
    // The errno of a refused open, or 0 when it opened (the descriptor is closed again).
    int errorOf(const std::string& path, int flags) {
        int fd = real.openBeneath(root, path, flags, 0);
        if (fd >= 0) {
            ::close(fd);
            return 0;
        }
        return errno;
    }
    static struct stat statOf(int fd) {
        struct stat st {};
        EXPECT_EQ(::fstatat(fd, "", &st, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW), 0);
        return st;
    }

    testing::TempDir dir;
    LinuxFileSystem real{GetParam()};
    int root = -1;
};

TEST_P(OpenBeneathTest, OpensWhatLiesBelowWithoutLinks) {
    int fd = real.openBeneath(root, "a/b/file.txt", O_RDONLY, 0);
    ASSERT_GE(fd, 0) << std::strerror(errno);
    char c = 0;
    EXPECT_EQ(::read(fd, &c, 1), 1);
    EXPECT_EQ(c, 'x');
    EXPECT_TRUE(::fcntl(fd, F_GETFD) & FD_CLOEXEC);
    ::close(fd);
    EXPECT_EQ(errorOf("a//./b/", O_PATH | O_DIRECTORY), 0);

    // Empty and "." are the directory itself.
    for (const char* self : {"", "."}) {
        int again = real.openBeneath(root, self, O_PATH | O_DIRECTORY, 0);
        ASSERT_GE(again, 0) << self;
        EXPECT_EQ(statOf(again).st_ino, statOf(root).st_ino) << self;
        ::close(again);
    }

    int made = real.openBeneath(root, "a/b/new.txt", O_WRONLY | O_CREAT | O_EXCL, 0600);
    ASSERT_GE(made, 0) << std::strerror(errno);
    ::close(made);
    EXPECT_TRUE(fs::is_regular_file(dir / "root/a/b/new.txt"));
    EXPECT_EQ(errorOf("a/missing/x", O_RDONLY), ENOENT);
}

TEST_P(OpenBeneathTest, NoLinkIsFollowedAnywhere) {
    // Leading out of the tree, or staying inside it: a link is never a way through.
    EXPECT_EQ(errorOf("a/out/secret.txt", O_RDONLY), ELOOP);
    EXPECT_EQ(errorOf("a/in/file.txt", O_RDONLY), ELOOP);
    EXPECT_EQ(errorOf("a/out", O_PATH | O_DIRECTORY), ELOOP);
    EXPECT_EQ(errorOf("a/out", O_RDONLY), ELOOP);
    EXPECT_EQ(errorOf("a/out/new.txt", O_WRONLY | O_CREAT), ELOOP);
    EXPECT_FALSE(fs::exists(dir / "outside/new.txt"));

    // Asked for exactly that, a final link opens as the link itself.
    int link = real.openBeneath(root, "a/out", O_PATH | O_NOFOLLOW, 0);
    ASSERT_GE(link, 0) << std::strerror(errno);
    EXPECT_TRUE(S_ISLNK(statOf(link).st_mode));
    ::close(link);
}

TEST_P(OpenBeneathTest, NothingEscapesTheDirectory) {
    EXPECT_EQ(errorOf((dir / "outside/secret.txt"), O_RDONLY), EXDEV);
    EXPECT_EQ(errorOf("../outside/secret.txt", O_RDONLY), EXDEV);
    EXPECT_EQ(errorOf("a/../../outside", O_PATH), EXDEV);
    EXPECT_EQ(errorOf("a/b/../../..", O_PATH), EXDEV);
}

INSTANTIATE_TEST_SUITE_P(Resolutions, OpenBeneathTest,
                         ::testing::Values(Resolution::Openat2, Resolution::Walk),
                         [](const auto& info) {
                             return info.param == Resolution::Openat2 ? "Openat2" : "Walk";
                         });

// A kernel without openat2: the first call finds out and walks, later calls walk at once.
TEST(OpenBeneathFallbackTest, AKernelWithoutOpenat2GetsTheWalk) {
    struct OldKernel : LinuxFileSystem {
        int asked = 0;
        long openat2(int, const char*, void*, size_t) override {
            ++asked;
            errno = ENOSYS;
            return -1;
        }
    } old;
    testing::TempDir dir;
    dir.writeFile("root/a/file.txt", "x");
    fs::create_directory_symlink(dir / "root/a", dir / "root/link");
    int root = ::open((dir / "root").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(root, 0);
    int fd = old.openBeneath(root, "a/file.txt", O_RDONLY, 0);
    EXPECT_GE(fd, 0) << std::strerror(errno);
    ::close(fd);
    EXPECT_EQ(old.openBeneath(root, "link/file.txt", O_RDONLY, 0), -1);
    EXPECT_EQ(errno, ELOOP);
    EXPECT_EQ(old.openBeneath(root, "../root", O_PATH, 0), -1);
    EXPECT_EQ(errno, EXDEV);
    EXPECT_EQ(old.asked, 1);
    ::close(root);
}

TEST(OpenBeneathFaultTest, InjectedFailuresAreCountedAndMatchedByPath) {
    testing::TempDir dir;
    dir.makeDir("root/kept");
    dir.makeDir("root/refused");
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    int root = ::open((dir / "root").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(root, 0);
    faults->inject(FaultInjectingFileSystem::Operation::OpenBeneath, ENOSYS, 1, "refused");
    EXPECT_EQ(faults->openBeneath(root, "refused", O_PATH, 0), -1);
    EXPECT_EQ(errno, ENOSYS);
    int kept = faults->openBeneath(root, "kept", O_PATH, 0);
    EXPECT_GE(kept, 0);
    int again = faults->openBeneath(root, "refused", O_PATH, 0);
    EXPECT_GE(again, 0) << "only the next matching call fails";
    EXPECT_EQ(faults->calls(FaultInjectingFileSystem::Operation::OpenBeneath), 3u);
    EXPECT_EQ(
        FaultInjectingFileSystem::operationName(FaultInjectingFileSystem::Operation::OpenBeneath),
        "openBeneath");
    ::close(kept);
    ::close(again);
    ::close(root);
}

}  // namespace
}  // namespace tamber
