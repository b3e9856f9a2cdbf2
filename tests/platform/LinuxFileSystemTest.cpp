#include "platform/LinuxFileSystem.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <set>
#include <string>
#include <vector>

#include "tests/common/TempDir.h"

namespace tamber {
namespace {

// Closes a descriptor at the end of a scope.
struct Fd {
    int fd;
    explicit Fd(int f) : fd(f) {}
    ~Fd() {
        if (fd >= 0)
            ::close(fd);
    }
};

std::vector<std::string> splitNames(const std::vector<char>& list, ssize_t size) {
    std::vector<std::string> names;
    for (ssize_t pos = 0; pos < size;) {
        std::string name(list.data() + pos);
        pos += static_cast<ssize_t>(name.size()) + 1;
        names.push_back(name);
    }
    return names;
}

TEST(LinuxFileSystemTest, DescriptorsAreOpenedCloseOnExec) {
    testing::TempDir dir;
    LinuxFileSystem linuxFs;
    FileSystem& fs = linuxFs;  // as callers see it, with the interface's default arguments
    Fd file(fs.open(dir.writeFile("f", "x"), O_RDONLY));
    ASSERT_GE(file.fd, 0);
    EXPECT_TRUE(::fcntl(file.fd, F_GETFD) & FD_CLOEXEC);
    Fd parent(fs.open(dir.path(), O_RDONLY | O_DIRECTORY));
    Fd child(fs.openat(parent.fd, "f", O_RDONLY));
    ASSERT_GE(child.fd, 0);
    EXPECT_TRUE(::fcntl(child.fd, F_GETFD) & FD_CLOEXEC);
}

TEST(LinuxFileSystemTest, UserAttributesKeepTheirPrefixHidden) {
    testing::TempDir dir;
    LinuxFileSystem linuxFs;
    FileSystem& fs = linuxFs;
    std::string path = dir.writeFile("attributed", "x");
    Fd fd(fs.open(path, O_RDWR));
    ASSERT_GE(fd.fd, 0);
    if (fs.fsetxattr(fd.fd, "tamber.id", "1234", 4, 0) != 0) {
        if (errno == ENOTSUP)
            GTEST_SKIP() << "the temporary file system has no user attributes";
        FAIL() << "fsetxattr: " << std::strerror(errno);
    }
    ASSERT_EQ(fs.fsetxattr(fd.fd, "second", "", 0, 0), 0);
    // The kernel sees the prefixed name.
    char raw[16] = {};
    ASSERT_EQ(::getxattr(path.c_str(), "user.tamber.id", raw, sizeof raw), 4);
    EXPECT_STREQ(raw, "1234");

    char value[16] = {};
    EXPECT_EQ(fs.lgetxattr(path, "tamber.id", nullptr, 0), 4);
    EXPECT_EQ(fs.lgetxattr(path, "tamber.id", value, sizeof value), 4);
    EXPECT_EQ(std::string(value, 4), "1234");
    EXPECT_EQ(fs.lgetxattr(path, "tamber.id", value, 2), -1);
    EXPECT_EQ(errno, ERANGE);
    EXPECT_EQ(fs.lgetxattr(path, "absent", value, sizeof value), -1);
    EXPECT_EQ(errno, ENODATA);

    // Listing: size 0 asks for the size, a short buffer is ERANGE, names lose the prefix.
    ssize_t needed = fs.llistxattr(path, nullptr, 0);
    ASSERT_EQ(needed, ssize_t(std::strlen("tamber.id") + 1 + std::strlen("second") + 1));
    std::vector<char> list(static_cast<size_t>(needed));
    EXPECT_EQ(fs.llistxattr(path, list.data(), list.size() - 1), -1);
    EXPECT_EQ(errno, ERANGE);
    ASSERT_EQ(fs.llistxattr(path, list.data(), list.size()), needed);
    std::vector<std::string> names = splitNames(list, needed);
    EXPECT_EQ(std::set<std::string>(names.begin(), names.end()),
              (std::set<std::string>{"tamber.id", "second"}));

    ASSERT_EQ(fs.fremovexattr(fd.fd, "second"), 0);
    EXPECT_EQ(fs.llistxattr(path, nullptr, 0), ssize_t(std::strlen("tamber.id") + 1));
    EXPECT_EQ(fs.fremovexattr(fd.fd, "second"), -1);
    EXPECT_EQ(errno, ENODATA);

    // A link is not followed: the attribute of its target is not its own.
    std::string link = dir / "link";
    ASSERT_EQ(::symlink(path.c_str(), link.c_str()), 0);
    EXPECT_EQ(fs.lgetxattr(link, "tamber.id", value, sizeof value), -1);
    EXPECT_EQ(fs.llistxattr(link, nullptr, 0), 0);
}

TEST(LinuxFileSystemTest, ReadDirectorySortsAndTypesEntries) {
    testing::TempDir dir;
    LinuxFileSystem linuxFs;
    FileSystem& fs = linuxFs;
    dir.writeFile("b.txt");
    dir.writeFile("B.txt");
    dir.writeFile("a");
    dir.writeFile("\xC3\xA9t\xC3\xA9");
    dir.makeDir("sub/inner");
    ASSERT_EQ(::symlink("nowhere", (dir / "link").c_str()), 0);

    Fd fd(fs.open(dir.path(), O_RDONLY | O_DIRECTORY));
    ASSERT_GE(fd.fd, 0);
    std::vector<FileSystem::DirectoryEntry> entries = {{"stale", DT_REG, 1}};
    ASSERT_TRUE(fs.readDirectory(fd.fd, entries));
    std::vector<std::string> names;
    for (const auto& e : entries) names.push_back(e.name);
    EXPECT_EQ(names, (std::vector<std::string>{"B.txt", "a", "b.txt", "link", "sub",
                                               "\xC3\xA9t\xC3\xA9"}));
    for (const auto& e : entries) {
        struct stat st {};
        ASSERT_EQ(::lstat((dir / e.name).c_str(), &st), 0);
        EXPECT_EQ(e.inode, st.st_ino) << e.name;
        if (e.type == DT_UNKNOWN)
            continue;  // allowed, though ext4 and tmpfs do say
        unsigned char expected = S_ISDIR(st.st_mode)   ? DT_DIR
                                 : S_ISLNK(st.st_mode) ? DT_LNK
                                                       : DT_REG;
        EXPECT_EQ(e.type, expected) << e.name;
    }

    // Reading again gives the same entries.
    std::vector<FileSystem::DirectoryEntry> again;
    ASSERT_TRUE(fs.readDirectory(fd.fd, again));
    EXPECT_EQ(again.size(), entries.size());

    // A removed directory is an error the caller sees as such, not an empty listing.
    std::string gone = dir.makeDir("gone");
    Fd goneFd(fs.open(gone, O_RDONLY | O_DIRECTORY));
    ASSERT_EQ(::rmdir(gone.c_str()), 0);
    again = entries;
    EXPECT_FALSE(fs.readDirectory(goneFd.fd, again));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_TRUE(again.empty());

    // Not a directory: an error, with the output left empty.
    again = entries;
    Fd file(fs.open(dir / "a", O_RDONLY));
    EXPECT_FALSE(fs.readDirectory(file.fd, again));
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_TRUE(again.empty());
}

TEST(LinuxFileSystemTest, ReadDirectoryWithoutSearchPermissionUsesTheCallersDescriptor) {
    if (::geteuid() == 0)
        GTEST_SKIP() << "root searches any directory";
    testing::TempDir dir;
    LinuxFileSystem linuxFs;
    FileSystem& fs = linuxFs;
    dir.writeFile("listable/one");
    dir.writeFile("listable/two");
    std::string listable = dir / "listable";
    ASSERT_EQ(::chmod(listable.c_str(), 0400), 0);
    Fd fd(fs.open(listable, O_RDONLY | O_DIRECTORY));
    ASSERT_GE(fd.fd, 0);
    std::vector<FileSystem::DirectoryEntry> entries;
    EXPECT_TRUE(fs.readDirectory(fd.fd, entries));
    EXPECT_TRUE(fs.readDirectory(fd.fd, entries)) << "the offset is rewound";
    EXPECT_EQ(entries.size(), 2u);
    ::chmod(listable.c_str(), 0700);
}

}  // namespace
}  // namespace tamber
