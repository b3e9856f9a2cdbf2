#include "platform/ScopedFd.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <memory>
#include <utility>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"

namespace tamber {
namespace {

using Op = FaultInjectingFileSystem::Operation;

bool isOpen(int fd) {
    return ::fcntl(fd, F_GETFD) != -1;
}

class ScopedFdTest : public ::testing::Test {
protected:
    int openNull() {
        int fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
        EXPECT_GE(fd, 0);
        return fd;
    }
    std::shared_ptr<FaultInjectingFileSystem> fs =
        std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped{fs};
};

// Whatever way a descriptor changes hands, it is closed once, through the file system, and
// the one given away is not closed at all.
TEST_F(ScopedFdTest, EachDescriptorIsClosedExactlyOnce) {
    int a = openNull(), b = openNull(), c = openNull();
    {
        ScopedFd first(a);
        ScopedFd moved(std::move(first));
        EXPECT_FALSE(first.ok());
        EXPECT_EQ(moved.get(), a);
        ScopedFd other(b);
        other = std::move(moved);  // b goes now, a stays held
        EXPECT_FALSE(isOpen(b));
        EXPECT_TRUE(isOpen(a));
        ScopedFd& alias = other;
        other = std::move(alias);  // not closed by moving onto itself
        EXPECT_TRUE(isOpen(a));

        ScopedFd given(c);
        EXPECT_EQ(given.release(), c);
        EXPECT_FALSE(given.ok());
    }
    EXPECT_FALSE(isOpen(a));
    EXPECT_TRUE(isOpen(c));
    EXPECT_EQ(fs->calls(Op::Close), 2u);
    ::close(c);
}

// The error a caller reports is that of the call that failed, not of the cleanup after it;
// a writer that must see a failing close asks for it.
TEST_F(ScopedFdTest, CleanupKeepsErrnoAndCloseReportsItsFailure) {
    int fd = openNull();
    {
        ScopedFd held(fd);
        fs->inject(Op::Close, EIO);
        errno = ENOSPC;
        held.reset();
        EXPECT_EQ(errno, ENOSPC);
        EXPECT_FALSE(held.ok());
    }
    EXPECT_EQ(fs->calls(Op::Close), 1u);  // reset closed it; the scope's end did not again
    if (isOpen(fd))
        ::close(fd);  // the injected failure left the real descriptor open

    ScopedFd writer(openNull());
    int raw = writer.get();
    fs->inject(Op::Close, EIO);
    errno = 0;
    EXPECT_EQ(writer.close(), -1);
    EXPECT_EQ(errno, EIO);
    EXPECT_FALSE(writer.ok());
    if (isOpen(raw))
        ::close(raw);
    ScopedFd empty;
    EXPECT_EQ(empty.close(), 0);
    EXPECT_EQ(fs->calls(Op::Close), 2u);
}

}  // namespace
}  // namespace tamber
