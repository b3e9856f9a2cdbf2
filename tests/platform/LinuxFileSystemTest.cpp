#include "platform/LinuxFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "tests/common/TempDir.h"

namespace tamber {
namespace {

class LinuxFileSystemTest : public ::testing::Test {
protected:
    int open(const std::string& path, int flags) {
        int fd = fs_.open(path, flags);  // with the interface's default arguments
        if (fd >= 0)
            fds_.push_back(fd);
        return fd;
    }
    ~LinuxFileSystemTest() override {
        for (int fd : fds_) ::close(fd);
    }

    testing::TempDir dir_;
    LinuxFileSystem linuxFs_;
    FileSystem& fs_ = linuxFs_;
    std::vector<int> fds_;
};

TEST_F(LinuxFileSystemTest, DescriptorsAreCloseOnExecAndUserAttributesHideTheirPrefix) {
    std::string path = dir_.writeFile("attributed", "x");
    int fd = open(path, O_RDWR);
    ASSERT_GE(fd, 0);
    EXPECT_TRUE(::fcntl(fd, F_GETFD) & FD_CLOEXEC);

    if (fs_.fsetxattr(fd, "tamber.id", "1234", 4, 0) != 0) {
        if (errno == ENOTSUP)
            GTEST_SKIP() << "the temporary file system has no user attributes";
        FAIL() << "fsetxattr: " << std::strerror(errno);
    }
    char value[16] = {};
    ASSERT_EQ(::getxattr(path.c_str(), "user.tamber.id", value, sizeof value), 4);
    EXPECT_EQ(fs_.lgetxattr(path, "tamber.id", value, sizeof value), 4);
    EXPECT_EQ(std::string(value, 4), "1234");
    EXPECT_EQ(fs_.lgetxattr(path, "tamber.id", value, 2), -1);
    EXPECT_EQ(errno, ERANGE);
    ASSERT_EQ(fs_.llistxattr(path, value, sizeof value), ssize_t(sizeof "tamber.id"));
    EXPECT_STREQ(value, "tamber.id");
    std::string link = dir_ / "link";
    ASSERT_EQ(::symlink(path.c_str(), link.c_str()), 0);
    EXPECT_EQ(fs_.lgetxattr(link, "tamber.id", value, sizeof value), -1)
        << "links are not followed";
    ASSERT_EQ(fs_.fremovexattr(fd, "tamber.id"), 0);
    EXPECT_EQ(fs_.lgetxattr(path, "tamber.id", value, sizeof value), -1);
    EXPECT_EQ(errno, ENODATA);
}

// Attribute lists read relative to a folder say what lists read by path say: user names only,
// without their prefix, however long the list, and never a link's target's.
TEST_F(LinuxFileSystemTest, AttributeListsInAFolderMatchThoseReadByPath) {
    std::string folder = dir_.makeDir("listed");
    std::string few = dir_.writeFile("listed/few", "x");
    std::string many = dir_.writeFile("listed/many", "x");
    std::string none = dir_.writeFile("listed/none", "x");
    if (::setxattr(few.c_str(), "user.a", "1", 1, 0) != 0) {
        if (errno == ENOTSUP)
            GTEST_SKIP() << "the temporary file system has no user attributes";
        FAIL() << "setxattr: " << std::strerror(errno);
    }
    // Longer than any buffer a first read would use.
    for (int i = 0; i < 40; ++i) {
        std::string name = "user.attribute-with-a-long-name-number-" + std::to_string(i);
        ASSERT_EQ(::setxattr(many.c_str(), name.c_str(), "v", 1, 0), 0) << name;
    }
    ASSERT_EQ(::symlink(many.c_str(), (dir_ / "listed/link").c_str()), 0);
    int fd = open(folder, O_PATH | O_DIRECTORY);
    ASSERT_GE(fd, 0);

    for (const char* name : {"few", "many", "none", "link"}) {
        std::string path = folder + "/" + name;
        ssize_t byPath = fs_.llistxattr(path, nullptr, 0);
        ssize_t inFolder = fs_.llistxattrAt(fd, name, path, nullptr, 0);
        ASSERT_EQ(inFolder, byPath) << name;
        std::vector<char> a(static_cast<size_t>(byPath) + 1), b(a.size());
        ASSERT_EQ(fs_.llistxattr(path, a.data(), a.size()), byPath);
        ASSERT_EQ(fs_.llistxattrAt(fd, name, path, b.data(), b.size()), byPath) << name;
        EXPECT_EQ(a, b) << name;
        if (byPath > 0) {
            EXPECT_EQ(fs_.llistxattrAt(fd, name, path, b.data(), 1), -1) << name;
            EXPECT_EQ(errno, ERANGE);
        }
    }
    EXPECT_EQ(fs_.llistxattrAt(fd, "link", folder + "/link", nullptr, 0), 0)
        << "a link's own list, not its target's";
    EXPECT_EQ(fs_.llistxattrAt(fd, "few", folder + "/few", nullptr, 0), ssize_t(sizeof "a"));
    EXPECT_EQ(fs_.llistxattrAt(fd, "gone", folder + "/gone", nullptr, 0), -1);
    EXPECT_EQ(errno, ENOENT);
}

TEST_F(LinuxFileSystemTest, ReadDirectorySortsAndTypesEntriesOrFailsEmpty) {
    for (const char* name : {"b.txt", "B.txt", "a", "\xC3\xA9t\xC3\xA9"}) dir_.writeFile(name);
    dir_.makeDir("sub/inner");
    ASSERT_EQ(::symlink("nowhere", (dir_ / "link").c_str()), 0);
    int fd = open(dir_.path(), O_RDONLY | O_DIRECTORY);
    std::vector<FileSystem::DirectoryEntry> entries = {{"stale", DT_REG, 1}};
    // Listed through the caller's descriptor: no search permission is needed, and the offset is
    // rewound for a second reading.
    ASSERT_TRUE(fs_.readDirectory(fd, entries));
    ASSERT_EQ(::chmod(dir_.path().c_str(), 0400), 0);
    bool again = fs_.readDirectory(fd, entries);
    ::chmod(dir_.path().c_str(), 0700);
    ASSERT_TRUE(again);
    std::vector<std::string> names;
    for (const auto& e : entries) {
        names.push_back(e.name);
        struct stat st {};
        ASSERT_EQ(::lstat((dir_ / e.name).c_str(), &st), 0);
        EXPECT_EQ(e.inode, st.st_ino) << e.name;
        unsigned char type = S_ISDIR(st.st_mode) ? DT_DIR : S_ISLNK(st.st_mode) ? DT_LNK : DT_REG;
        EXPECT_TRUE(e.type == type || e.type == DT_UNKNOWN) << e.name;
    }
    EXPECT_EQ(names, (std::vector<std::string>{"B.txt", "a", "b.txt", "link", "sub",
                                               "\xC3\xA9t\xC3\xA9"}));

    // A removed directory or a file is an error the caller sees, not an empty listing.
    std::string gone = dir_.makeDir("gone");
    int goneFd = open(gone, O_RDONLY | O_DIRECTORY);
    ASSERT_EQ(::rmdir(gone.c_str()), 0);
    const std::pair<int, int> failing[] = {{goneFd, ENOENT}, {open(dir_ / "a", O_RDONLY), ENOTDIR}};
    for (const auto& [descriptor, error] : failing) {
        std::vector<FileSystem::DirectoryEntry> listed = entries;
        EXPECT_FALSE(fs_.readDirectory(descriptor, listed));
        EXPECT_EQ(errno, error);
        EXPECT_TRUE(listed.empty());
    }
}

}  // namespace
}  // namespace tamber
