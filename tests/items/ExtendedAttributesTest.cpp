#include "items/ExtendedAttributes.h"

#include <gtest/gtest.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>

#include "host/UrlOperations.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::ScopedFileSystem;
using testing::ScopedLogCapture;
using testing::TempDir;
using Op = FaultInjectingFileSystem::Operation;

const std::string kName = "com.velk.test#PS";

// Lets the size query through and fails the copy, as when the attribute vanishes in between.
class FailingCopyFileSystem : public FaultInjectingFileSystem {
public:
    explicit FailingCopyFileSystem(int error)
        : FaultInjectingFileSystem(std::make_shared<LinuxFileSystem>()), error_(error) {}
    ssize_t lgetxattr(const std::string& path, const std::string& name, void* value,
                      size_t size) override {
        if (value) {
            errno = error_;
            return -1;
        }
        return FaultInjectingFileSystem::lgetxattr(path, name, value, size);
    }

private:
    int error_;
};

class ExtendedAttributesTest : public ::testing::Test {
protected:
    void SetUp() override {
        file = Url::fileURLWithPath(dir.writeFile("doc.txt", "hello"));
        if (::setxattr(file.path().c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
    }
    Status write(const std::optional<Bytes>& data, const std::string& name = kName) {
        return WriteXattrAtURL(file, data, name);
    }

    TempDir dir;
    Url file;
};

TEST_F(ExtendedAttributesTest, MissingAttributeReadsAsNothingAndLogsNothing) {
    ScopedLogCapture log;
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    EXPECT_TRUE(log->lines().empty());
}

TEST_F(ExtendedAttributesTest, SetReadRemoveRoundTrip) {
    ScopedLogCapture log;
    Bytes value{0, 1, 2, 0xff, 0};
    ASSERT_FALSE(write(value).has_value());
    EXPECT_EQ(ReadXattrData(kName, file), value);
    // Stored in the user namespace under the same name.
    char raw[16];
    EXPECT_EQ(::getxattr(file.path().c_str(), ("user." + kName).c_str(), raw, sizeof raw), 5);

    ASSERT_FALSE(write(std::nullopt).has_value());
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    // Removing what is not there is not an error, and says nothing.
    EXPECT_FALSE(write(std::nullopt).has_value());
    EXPECT_TRUE(log->lines().empty());
}

TEST_F(ExtendedAttributesTest, ZeroLengthAttributeReadsAsEmptyData) {
    ASSERT_FALSE(write(Bytes{}).has_value());
    auto data = ReadXattrData(kName, file);
    ASSERT_TRUE(data.has_value());
    EXPECT_TRUE(data->empty());
}

TEST_F(ExtendedAttributesTest, FoldersTakeAttributesToo) {
    Url folder = Url::fileURLWithPath(dir.makeDir("folder"));
    ASSERT_FALSE(WriteXattrAtURL(folder, Bytes{7}, kName).has_value());
    EXPECT_EQ(ReadXattrData(kName, folder), Bytes{7});
}

TEST_F(ExtendedAttributesTest, SymbolicLinkIsReadItselfNotItsTarget) {
    ASSERT_FALSE(write(Bytes{1}).has_value());
    std::string link = dir / "link";
    ASSERT_EQ(::symlink(file.path().c_str(), link.c_str()), 0);
    ScopedLogCapture log;
    EXPECT_FALSE(ReadXattrData(kName, Url::fileURLWithPath(link)).has_value());
    EXPECT_TRUE(log->lines().empty());
    // And writes never go through it either.
    EXPECT_TRUE(WriteXattrAtURL(Url::fileURLWithPath(link), Bytes{2}, kName).has_value());
    EXPECT_EQ(ReadXattrData(kName, file), Bytes{1});
}

TEST_F(ExtendedAttributesTest, VanishedFileLogsAtDebugLevelOnly) {
    Url gone = Url::fileURLWithPath(dir / "gone.txt");
    ScopedLogCapture log;
    EXPECT_FALSE(ReadXattrData(kName, gone).has_value());
    ASSERT_EQ(log->lines().size(), 1u);
    EXPECT_EQ(log->lines()[0].level, LogLevel::Debug);
    EXPECT_EQ(log->lines()[0].text,
              "[DEBUG] can't get xattr " + kName + "; " + Error::posix(ENOENT).description());
}

TEST_F(ExtendedAttributesTest, OtherReadFailuresLogAtErrorLevel) {
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(fs);
    fs->inject(Op::Lgetxattr, EIO);
    ScopedLogCapture log;
    EXPECT_FALSE(ReadXattrData(kName, file).has_value());
    EXPECT_EQ(
        log->count("[ERROR] can't get xattr " + kName + "; " + Error::posix(EIO).description(),
                   LogLevel::Error),
        1u);
}

TEST_F(ExtendedAttributesTest, FailedCopyLogsWithItsOwnTextAndLevelRule) {
    ASSERT_FALSE(write(Bytes{1, 2}).has_value());
    for (auto [error, level] : {std::pair{ENOENT, LogLevel::Debug}, {ERANGE, LogLevel::Error}}) {
        ScopedFileSystem scoped(std::make_shared<FailingCopyFileSystem>(error));
        ScopedLogCapture log;
        EXPECT_FALSE(ReadXattrData(kName, file).has_value());
        ASSERT_EQ(log->lines().size(), 1u);
        EXPECT_EQ(log->lines()[0].level, level);
        std::string prefix = level == LogLevel::Debug ? "[DEBUG] " : "[ERROR] ";
        EXPECT_EQ(log->lines()[0].text, prefix + "can't copy data for xattr " + kName + "; " +
                                            Error::posix(error).description());
    }
}

TEST_F(ExtendedAttributesTest, RefusedSetIsDebugOtherFailuresAreErrors) {
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(fs);
    int fd = ::open(file.path().c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    struct Case {
        Op op;
        int error;
        std::optional<Bytes> data;
        std::string line;
    };
    std::vector<Case> cases = {
        {Op::Fsetxattr, EACCES, Bytes{1},
         "[DEBUG] can't set xattr \"" + kName + "\"; " + Error::posix(EACCES).description()},
        {Op::Fsetxattr, ENOSPC, Bytes{1},
         "[ERROR] can't set xattr \"" + kName + "\"; " + Error::posix(ENOSPC).description()},
        {Op::Fremovexattr, EACCES, std::nullopt,
         "[DEBUG] can't remove xattr \"" + kName + "\"; " + Error::posix(EACCES).description()},
        {Op::Fremovexattr, EIO, std::nullopt,
         "[ERROR] can't remove xattr \"" + kName + "\"; " + Error::posix(EIO).description()},
    };
    for (const auto& c : cases) {
        ScopedLogCapture log;
        fs->inject(c.op, c.error);
        Status status = SetOrRemoveXattr(fd, c.data, kName);
        ASSERT_TRUE(status.has_value()) << c.line;
        EXPECT_EQ(*status, Error::posix(c.error));
        EXPECT_EQ(log->texts(), std::vector<std::string>{c.line});
    }
    ::close(fd);
}

TEST_F(ExtendedAttributesTest, FileSystemWithoutUserAttributesGivesAnErrorValue) {
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    ScopedFileSystem scoped(fs);
    fs->inject(Op::Fsetxattr, ENOTSUP);
    ScopedLogCapture log;
    Status status = write(Bytes{1});
    ASSERT_TRUE(status.has_value());
    EXPECT_EQ(*status, Error::posix(ENOTSUP));
    EXPECT_EQ(log->count("[ERROR] can't set xattr " + kName + " on " + file.absoluteString() +
                             "; " + Error::posix(ENOTSUP).description(),
                         LogLevel::Error),
              1u);
}

TEST_F(ExtendedAttributesTest, WriteToMissingFileReportsTheOpenFailure) {
    Url gone = Url::fileURLWithPath(dir / "missing.txt");
    ScopedLogCapture log;
    Status status = WriteXattrAtURL(gone, Bytes{1}, kName);
    ASSERT_TRUE(status.has_value());
    EXPECT_EQ(*status, Error::posix(ENOENT));
    EXPECT_EQ(log->countStartingWith("[ERROR] can't set xattr " + kName + " on "), 1u);
}

TEST(PosixErrorTest, TakesErrnoAndIgnoresItsArgument) {
    errno = ENOENT;
    Error error = Error::errorWithPOSIXCode(99);
    EXPECT_EQ(error.domain(), kPosixErrorDomain);
    EXPECT_EQ(error.code(), ENOENT);
    EXPECT_TRUE(Error::errorFileWriteNoPermission().is(kHostPlatformErrorDomain, 513));
}

}  // namespace
}  // namespace tamber
