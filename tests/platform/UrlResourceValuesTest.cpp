#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <memory>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/Url.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace K = ResourceKeys;
using Op = FaultInjectingFileSystem::Operation;

class UrlResourceValuesTest : public ::testing::Test {
protected:
    UrlResourceValuesTest()
        : fs_(std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>())),
          scoped_(fs_) {}

    // The value of `key`, which must be read without an error.
    ObjectRef value(const Url& url, ResourceKey key) {
        Result<ObjectRef> result = url.resourceValue(key);
        EXPECT_TRUE(result.ok()) << key << ": " << result.error().description();
        return result.ok() ? *result : nullptr;
    }
    std::string stringValue(const Url& url, ResourceKey key) {
        auto s = objectCast<String>(value(url, key));
        return s ? s->value() : "<not a string>";
    }
    // Numbers must be of `kind`: booleans and counts are told apart.
    std::optional<uint64_t> number(const Url& url, ResourceKey key,
                                   Number::Kind kind = Number::Kind::Unsigned) {
        auto n = objectCast<Number>(value(url, key));
        if (!n)
            return std::nullopt;
        EXPECT_EQ(n->kind(), kind) << key;
        return n->uint64Value();
    }
    std::optional<uint64_t> flag(const Url& url, ResourceKey key) {
        return number(url, key, Number::Kind::Boolean);
    }
    static uint64_t inode(const std::string& path) {
        struct stat st {};
        EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
        return st.st_ino;
    }

    testing::TempDir dir_;
    std::shared_ptr<FaultInjectingFileSystem> fs_;
    testing::ScopedFileSystem scoped_;
};

TEST_F(UrlResourceValuesTest, FilesFoldersPackagesAndLinks) {
    std::string path = dir_.writeFile("notes/Report.PDF", "12345");
    struct timespec times[2] = {{0, UTIME_OMIT}, {1700000000, 250000000}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    ASSERT_EQ(::link(path.c_str(), (dir_ / "notes/hardlink").c_str()), 0);
    Url url = Url::fileURLWithPath(path);
    EXPECT_EQ(stringValue(url, K::kName), "Report.PDF");
    EXPECT_EQ(stringValue(url, K::kTypeIdentifier), "public.pdf");
    EXPECT_EQ(number(url, K::kFileSize), 5u);
    EXPECT_EQ(number(url, K::kLinkCount), 2u);
    EXPECT_EQ(number(url, K::kFileID), inode(path));
    EXPECT_EQ(flag(url, K::kIsDirectory), 0u);
    EXPECT_EQ(flag(url, K::kIsReadable), 1u);
    auto modified = objectCast<Date>(value(url, K::kContentModificationDate));
    ASSERT_TRUE(modified);
    EXPECT_NEAR(modified->timeIntervalSince1970(), 1700000000.25, 1e-6);
    auto parent = objectCast<UrlObject>(value(url, K::kParentDirectoryURL));
    ASSERT_TRUE(parent);
    EXPECT_EQ(parent->url(), Url::fileURLWithPath(dir_ / "notes"));
    EXPECT_EQ(value(url, K::kDocumentID), nullptr) << "no document ID until one is provided";

    // Both package families are packages only as folders; a link is never one.
    dir_.writeFile("Talk.Lumen/slides.json", "{}");
    dir_.writeFile("Song.resona/track", "x");
    dir_.makeDir("Plain.folder");
    dir_.writeFile("file.lumen", "x");
    ASSERT_EQ(::symlink((dir_ / "Talk.Lumen").c_str(), (dir_ / "link.lumen").c_str()), 0);
    const std::tuple<const char*, const char*, uint64_t> kinds[] = {
        {"Talk.Lumen", "com.velk.lumen.presentation", 1},
        {"Song.resona", "com.velk.resona.song", 1},
        {"Plain.folder", "public.folder", 0},
        {"file.lumen", "public.data", 0},
        {"link.lumen", "public.symlink", 0},
    };
    ASSERT_EQ(::mkfifo((dir_ / "pipe").c_str(), 0600), 0);
    for (const auto& [name, type, isPackage] : kinds) {
        Url item = Url::fileURLWithPath(dir_ / name);
        EXPECT_EQ(stringValue(item, K::kTypeIdentifier), type) << name;
        EXPECT_EQ(flag(item, K::kIsPackage), isPackage) << name;
    }
    // Only a file is a regular file; each item's volume is its own device (a link's, not its
    // target's).
    for (const char* name : {"file.lumen", "Talk.Lumen", "link.lumen", "pipe"}) {
        struct stat st {};
        ASSERT_EQ(::lstat((dir_ / name).c_str(), &st), 0) << name;
        Url item = Url::fileURLWithPath(dir_ / name);
        EXPECT_EQ(flag(item, K::kIsRegularFile), S_ISREG(st.st_mode) ? 1u : 0u) << name;
        EXPECT_EQ(number(item, K::kVolumeIdentifier), uint64_t(st.st_dev)) << name;
    }
    EXPECT_EQ(flag(Url::fileURLWithPath(dir_ / "file.lumen"), K::kIsRegularFile), 1u);
    Url link = Url::fileURLWithPath(dir_ / "link.lumen");
    EXPECT_EQ(flag(link, K::kIsSymbolicLink), 1u);
    EXPECT_EQ(flag(link, K::kIsDirectory), 0u);
    EXPECT_EQ(number(link, K::kFileSize), (dir_ / "Talk.Lumen").size()) << "the target's length";
    EXPECT_EQ(value(Url::fileURLWithPath(dir_ / "Talk.Lumen"), K::kFileSize), nullptr);
    EXPECT_EQ(value(Url::fileURLWithPath("/"), K::kParentDirectoryURL), nullptr);
}

TEST_F(UrlResourceValuesTest, MissingFilesAndFailures) {
    for (std::string path : {dir_ / "absent", dir_.writeFile("file") + "/below"}) {
        Result<ObjectRef> result = Url::fileURLWithPath(path).resourceValue(K::kFileSize);
        ASSERT_FALSE(result.ok()) << path;
        EXPECT_TRUE(result.error().is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile));
        EXPECT_EQ(result.error().userInfo().at("path"), path);
        Status prefetch = Url::fileURLWithPath(path).prefetchResourceValues({K::kName});
        ASSERT_FALSE(prefetch.ok());
        EXPECT_EQ(prefetch.error().code(), kHostPlatformFileNoSuchFile);
    }

    Url file = Url::fileURLWithPath(dir_.writeFile("present", "abc"));
    fs_->inject(Op::Statx, EIO);
    Status failed = file.prefetchResourceValues({K::kFileSize});
    ASSERT_FALSE(failed.ok());
    EXPECT_TRUE(failed.error().is(kPosixErrorDomain, EIO));
    EXPECT_EQ(number(file, K::kFileSize), 3u) << "the failure was not cached";

    // Access checks: a denial is "no", any other failure an error.
    fs_->inject(Op::Faccessat, EACCES);
    EXPECT_EQ(flag(file, K::kIsWritable), 0u);
    fs_->inject(Op::Faccessat, EIO);
    Result<ObjectRef> access = file.resourceValue(K::kIsReadable);
    ASSERT_FALSE(access.ok());
    EXPECT_TRUE(access.error().is(kPosixErrorDomain, EIO));

    Result<ObjectRef> unknown = file.resourceValue("NoSuchKey");
    ASSERT_FALSE(unknown.ok());
    EXPECT_TRUE(unknown.error().is(kPosixErrorDomain, EINVAL));
    ASSERT_FALSE(Url::parse("https://example.invalid/")->resourceValue(K::kName).ok());
}

TEST_F(UrlResourceValuesTest, CachedValuesServeLaterReadsUntilRemoved) {
    std::string path = dir_.writeFile("grows.txt", "ab");
    Url url = Url::fileURLWithPath(path);
    Url copy = url;
    fs_->resetCalls();
    ASSERT_TRUE(url.prefetchResourceValues({K::kFileSize, K::kIsDirectory, K::kFileSize}).ok());
    EXPECT_EQ(fs_->calls(Op::Statx), 1u);
    std::ofstream(path, std::ios::app) << "cdef";
    EXPECT_EQ(number(url, K::kFileSize), 2u);
    EXPECT_EQ(number(copy, K::kFileSize), 2u) << "copies share the cache";
    EXPECT_EQ(flag(url, K::kIsDirectory), 0u);
    ASSERT_TRUE(url.prefetchResourceValues({K::kFileSize}).ok());
    EXPECT_EQ(fs_->calls(Op::Statx), 1u) << "cached values need no system call";
    // A URL made anew, even for the same path, and a derived one start empty.
    EXPECT_EQ(number(Url::fileURLWithPath(path), K::kFileSize), 6u);
    EXPECT_EQ(
        number(url.deletingLastPathComponent().appendingPathComponent("grows.txt"), K::kFileSize),
        6u);
    EXPECT_EQ(fs_->calls(Op::Statx), 3u);

    copy.removeCachedResourceValue(K::kFileSize);
    EXPECT_EQ(number(url, K::kFileSize), 6u);
    ASSERT_EQ(::unlink(path.c_str()), 0);
    ASSERT_EQ(::mkdir(path.c_str(), 0755), 0);
    EXPECT_EQ(flag(url, K::kIsDirectory), 0u);
    url.removeAllCachedResourceValues();
    EXPECT_EQ(flag(url, K::kIsDirectory), 1u);

    // Only identifiers can be set, and they stay in memory.
    fs_->resetCalls();
    EXPECT_TRUE(url.setResourceValue(Number::fromUInt64(4242), K::kFileID).ok());
    EXPECT_TRUE(url.setResourceValue(Number::fromUInt64(17), K::kDocumentID).ok());
    EXPECT_EQ(number(url, K::kFileID), 4242u);
    EXPECT_EQ(number(url, K::kDocumentID), 17u);
    EXPECT_EQ(fs_->calls(Op::Statx), 0u);
    EXPECT_EQ(fs_->calls(Op::Fsetxattr), 0u);
    Status refused = url.setResourceValue(String::make("x"), K::kName);
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().is(kPosixErrorDomain, EINVAL));
    url.removeCachedResourceValue(K::kFileID);
    EXPECT_EQ(number(url, K::kFileID), inode(path));
}

std::optional<uint32_t> lookupFor(const std::string& path) {
    if (path.ends_with("/known"))
        return 99;
    return std::nullopt;
}

TEST_F(UrlResourceValuesTest, DocumentIdsComeFromTheInstalledLookup) {
    Url known = Url::fileURLWithPath(dir_.writeFile("known"));
    Url unknown = Url::fileURLWithPath(dir_.writeFile("unknown"));
    fs_->resetCalls();
    EXPECT_EQ(value(known, K::kDocumentID), nullptr);
    struct Uninstall {
        ~Uninstall() { setDocumentIdLookup(nullptr); }
    } uninstall;
    setDocumentIdLookup(&lookupFor);
    EXPECT_EQ(number(known, K::kDocumentID), 99u);
    EXPECT_EQ(value(unknown, K::kDocumentID), nullptr);
    setDocumentIdLookup(nullptr);
    EXPECT_EQ(number(known, K::kDocumentID), 99u) << "a found ID is cached";
    // Only the answers "no ID" looked at the disk, to tell a vanished file from a new one.
    EXPECT_EQ(fs_->calls(Op::Statx), 2u);
    auto gone = Url::fileURLWithPath(dir_ / "gone").resourceValue(K::kDocumentID);
    ASSERT_FALSE(gone.ok());
    EXPECT_TRUE(gone.error().is(kHostPlatformErrorDomain, 260));
}

}  // namespace
}  // namespace tamber
