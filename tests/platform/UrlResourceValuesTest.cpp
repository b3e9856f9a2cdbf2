#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
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
    std::optional<uint64_t> unsignedValue(const Url& url, ResourceKey key) {
        auto n = objectCast<Number>(value(url, key));
        if (!n)
            return std::nullopt;
        EXPECT_EQ(n->kind(), Number::Kind::Unsigned) << key;
        return n->uint64Value();
    }
    std::optional<bool> boolValue(const Url& url, ResourceKey key) {
        auto n = objectCast<Number>(value(url, key));
        if (!n)
            return std::nullopt;
        EXPECT_EQ(n->kind(), Number::Kind::Boolean) << key;
        return n->boolValue();
    }

    static struct stat lstatOf(const std::string& path) {
        struct stat st {};
        EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
        return st;
    }

    testing::TempDir dir_;
    std::shared_ptr<FaultInjectingFileSystem> fs_;
    testing::ScopedFileSystem scoped_;
};

TEST_F(UrlResourceValuesTest, RegularFile) {
    std::string path = dir_.writeFile("notes/Report.PDF", "12345");
    struct timespec times[2] = {{0, UTIME_OMIT}, {1700000000, 250000000}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    ASSERT_EQ(::link(path.c_str(), (dir_ / "notes/hardlink").c_str()), 0);
    Url url = Url::fileURLWithPath(path);

    EXPECT_EQ(stringValue(url, K::kName), "Report.PDF");
    EXPECT_EQ(stringValue(url, K::kLocalizedName), "Report.PDF");
    EXPECT_EQ(stringValue(url, K::kTypeIdentifier), "public.pdf");
    EXPECT_EQ(unsignedValue(url, K::kFileSize), 5u);
    EXPECT_EQ(unsignedValue(url, K::kLinkCount), 2u);
    EXPECT_EQ(unsignedValue(url, K::kFileID), lstatOf(path).st_ino);
    EXPECT_EQ(boolValue(url, K::kIsDirectory), false);
    EXPECT_EQ(boolValue(url, K::kIsSymbolicLink), false);
    EXPECT_EQ(boolValue(url, K::kIsPackage), false);
    EXPECT_EQ(boolValue(url, K::kIsReadable), true);
    EXPECT_EQ(boolValue(url, K::kIsWritable), true);

    auto modified = objectCast<Date>(value(url, K::kContentModificationDate));
    ASSERT_TRUE(modified);
    EXPECT_NEAR(modified->timeIntervalSince1970(), 1700000000.25, 1e-6);

    auto parent = objectCast<UrlObject>(value(url, K::kParentDirectoryURL));
    ASSERT_TRUE(parent);
    EXPECT_EQ(parent->url(), Url::fileURLWithPath(dir_ / "notes"));

    // The creation date is there exactly when the file system reports birth times.
    struct statx st {};
    ASSERT_EQ(::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BTIME, &st), 0);
    ObjectRef created = value(url, K::kCreationDate);
    if (st.stx_mask & STATX_BTIME) {
        ASSERT_TRUE(objectCast<Date>(created));
        EXPECT_NEAR(objectCast<Date>(created)->timeIntervalSince1970(),
                    double(st.stx_btime.tv_sec) + st.stx_btime.tv_nsec / 1e9, 1e-6);
    } else {
        EXPECT_EQ(created, nullptr);
    }

    // Nothing is cached for the document ID until something provides one.
    EXPECT_EQ(value(url, K::kDocumentID), nullptr);
}

TEST_F(UrlResourceValuesTest, FoldersAndPackages) {
    Url folder = Url::fileURLWithPath(dir_.makeDir("Plain.folder"));
    EXPECT_EQ(stringValue(folder, K::kTypeIdentifier), "public.folder");
    EXPECT_EQ(boolValue(folder, K::kIsDirectory), true);
    EXPECT_EQ(boolValue(folder, K::kIsPackage), false);
    EXPECT_EQ(value(folder, K::kFileSize), nullptr);

    dir_.writeFile("Talk.Lumen/slides.json", "{}");
    Url package = Url::fileURLWithPath(dir_ / "Talk.Lumen");
    EXPECT_EQ(stringValue(package, K::kTypeIdentifier), "com.velk.lumen.presentation");
    EXPECT_EQ(boolValue(package, K::kIsDirectory), true);
    EXPECT_EQ(boolValue(package, K::kIsPackage), true);
    EXPECT_EQ(value(package, K::kFileSize), nullptr);

    // A plain file with a package name is not a package.
    Url fake = Url::fileURLWithPath(dir_.writeFile("file.lumen", "x"));
    EXPECT_EQ(boolValue(fake, K::kIsPackage), false);
    EXPECT_EQ(stringValue(fake, K::kTypeIdentifier), "public.data");

    Url root = Url::fileURLWithPath("/");
    EXPECT_EQ(value(root, K::kParentDirectoryURL), nullptr);
    EXPECT_EQ(stringValue(root, K::kName), "/");
}

TEST_F(UrlResourceValuesTest, SymbolicLinksDescribeThemselves) {
    dir_.writeFile("Target.lumen/content", "0123456789");
    std::string link = dir_ / "link.lumen";
    ASSERT_EQ(::symlink((dir_ / "Target.lumen").c_str(), link.c_str()), 0);
    Url url = Url::fileURLWithPath(link);
    EXPECT_EQ(stringValue(url, K::kTypeIdentifier), "public.symlink");
    EXPECT_EQ(boolValue(url, K::kIsSymbolicLink), true);
    EXPECT_EQ(boolValue(url, K::kIsDirectory), false);
    EXPECT_EQ(boolValue(url, K::kIsPackage), false);
    EXPECT_EQ(unsignedValue(url, K::kFileID), lstatOf(link).st_ino);
    // A link's size is the length of what it points to.
    EXPECT_EQ(unsignedValue(url, K::kFileSize), (dir_ / "Target.lumen").size());

    std::string dangling = dir_ / "dangling";
    ASSERT_EQ(::symlink("does/not/exist", dangling.c_str()), 0);
    Url danglingUrl = Url::fileURLWithPath(dangling);
    EXPECT_EQ(boolValue(danglingUrl, K::kIsSymbolicLink), true);
    EXPECT_EQ(unsignedValue(danglingUrl, K::kFileSize), std::string("does/not/exist").size());
    EXPECT_EQ(boolValue(danglingUrl, K::kIsReadable), true);
    EXPECT_EQ(stringValue(danglingUrl, K::kTypeIdentifier), "public.symlink");
}

TEST_F(UrlResourceValuesTest, MissingFilesAndFailures) {
    for (std::string path : {dir_ / "absent", dir_.writeFile("file") + "/below"}) {
        Url url = Url::fileURLWithPath(path);
        for (ResourceKey key : {K::kName, K::kFileSize, K::kIsDirectory}) {
            Result<ObjectRef> result = url.resourceValue(key);
            ASSERT_FALSE(result.ok()) << path << " " << key;
            EXPECT_TRUE(result.error().is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile));
            EXPECT_EQ(result.error().userInfo().at("path"), path);
        }
        std::optional<Error> prefetch = url.prefetchResourceValues({K::kFileSize});
        ASSERT_TRUE(prefetch);
        EXPECT_EQ(prefetch->code(), kHostPlatformFileNoSuchFile);
    }

    Url file = Url::fileURLWithPath(dir_.writeFile("present", "abc"));
    fs_->inject(Op::Statx, EIO);
    Result<ObjectRef> failed = file.resourceValue(K::kFileSize);
    ASSERT_FALSE(failed.ok());
    EXPECT_TRUE(failed.error().is(kPosixErrorDomain, EIO));
    // The failure was not cached: the next read reaches the disk and succeeds.
    EXPECT_EQ(unsignedValue(file, K::kFileSize), 3u);

    // Access checks: a denial is "no", any other failure an error.
    fs_->inject(Op::Faccessat, EACCES);
    EXPECT_EQ(boolValue(file, K::kIsWritable), false);
    fs_->inject(Op::Faccessat, EIO);
    Result<ObjectRef> access = file.resourceValue(K::kIsReadable);
    ASSERT_FALSE(access.ok());
    EXPECT_TRUE(access.error().is(kPosixErrorDomain, EIO));

    Result<ObjectRef> unknown = file.resourceValue("NoSuchKey");
    ASSERT_FALSE(unknown.ok());
    EXPECT_TRUE(unknown.error().is(kPosixErrorDomain, EINVAL));
    ASSERT_FALSE(Url::parse("https://example.invalid/")->resourceValue(K::kName).ok());
}

TEST_F(UrlResourceValuesTest, CachedValuesStayUntilRemoved) {
    std::string path = dir_.writeFile("grows.txt", "ab");
    Url url = Url::fileURLWithPath(path);
    Url copy = url;
    EXPECT_EQ(unsignedValue(url, K::kFileSize), 2u);
    EXPECT_EQ(boolValue(url, K::kIsDirectory), false);

    std::ofstream(path, std::ios::app) << "cdef";
    EXPECT_EQ(unsignedValue(url, K::kFileSize), 2u);
    EXPECT_EQ(unsignedValue(copy, K::kFileSize), 2u) << "copies share the cache";
    // A URL made anew, even for the same path, and a derived one start empty.
    EXPECT_EQ(unsignedValue(Url::fileURLWithPath(path), K::kFileSize), 6u);
    EXPECT_EQ(unsignedValue(url.deletingLastPathComponent().appendingPathComponent("grows.txt"),
                            K::kFileSize),
              6u);

    copy.removeCachedResourceValue(K::kFileSize);
    EXPECT_EQ(unsignedValue(url, K::kFileSize), 6u);

    // Removing everything drops the other keys too.
    ASSERT_EQ(::unlink(path.c_str()), 0);
    ASSERT_EQ(::mkdir(path.c_str(), 0755), 0);
    EXPECT_EQ(boolValue(url, K::kIsDirectory), false);
    url.removeAllCachedResourceValues();
    EXPECT_EQ(boolValue(url, K::kIsDirectory), true);
    EXPECT_EQ(value(url, K::kFileSize), nullptr);
}

TEST_F(UrlResourceValuesTest, OnlyIdentifiersCanBeSetAndTheyStayInMemory) {
    Url url = Url::fileURLWithPath(dir_.writeFile("ids"));
    fs_->resetCalls();
    EXPECT_FALSE(url.setResourceValue(Number::fromUInt64(4242), K::kFileID));
    EXPECT_FALSE(url.setResourceValue(Number::fromUInt64(17), K::kDocumentID));
    EXPECT_EQ(unsignedValue(url, K::kFileID), 4242u);
    EXPECT_EQ(unsignedValue(url, K::kDocumentID), 17u);
    EXPECT_EQ(fs_->calls(Op::Statx), 0u);
    EXPECT_EQ(fs_->calls(Op::Fsetxattr), 0u);

    std::optional<Error> refused = url.setResourceValue(String::make("x"), K::kName);
    ASSERT_TRUE(refused);
    EXPECT_TRUE(refused->is(kPosixErrorDomain, EINVAL));
    EXPECT_EQ(stringValue(url, K::kName), "ids");
    EXPECT_TRUE(url.setResourceValue(Number::fromUInt64(1), K::kFileSize));

    // Once dropped, the file ID comes from the disk again.
    url.removeCachedResourceValue(K::kFileID);
    EXPECT_EQ(unsignedValue(url, K::kFileID), lstatOf(url.path()).st_ino);
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
    EXPECT_EQ(unsignedValue(known, K::kDocumentID), 99u);
    EXPECT_EQ(value(unknown, K::kDocumentID), nullptr);
    setDocumentIdLookup(nullptr);
    EXPECT_EQ(unsignedValue(known, K::kDocumentID), 99u) << "a found ID is cached";
    // Only the answers "no ID" looked at the disk, to tell a vanished file from a new one.
    EXPECT_EQ(fs_->calls(Op::Statx), 2u);
    auto gone = Url::fileURLWithPath(dir_ / "gone").resourceValue(K::kDocumentID);
    ASSERT_FALSE(gone.ok());
    EXPECT_TRUE(gone.error().is(kHostPlatformErrorDomain, 260));
}

TEST_F(UrlResourceValuesTest, OneStatxServesAPrefetch) {
    dir_.writeFile("Song.resona/track", "x");
    Url url = Url::fileURLWithPath(dir_ / "Song.resona");
    const std::vector<ResourceKey> keys = {
        K::kName,        K::kTypeIdentifier, K::kFileSize,  K::kContentModificationDate,
        K::kIsDirectory, K::kIsPackage,      K::kLinkCount, K::kFileID,
        K::kIsReadable,  K::kIsSymbolicLink, K::kFileSize,
    };
    fs_->resetCalls();
    ASSERT_FALSE(url.prefetchResourceValues(keys));
    EXPECT_EQ(fs_->calls(Op::Statx), 1u);
    EXPECT_EQ(fs_->calls(Op::Faccessat), 1u);

    EXPECT_EQ(stringValue(url, K::kTypeIdentifier), "com.velk.resona.song");
    EXPECT_EQ(boolValue(url, K::kIsPackage), true);
    EXPECT_EQ(unsignedValue(url, K::kLinkCount), 2u);
    EXPECT_TRUE(objectCast<Date>(value(url, K::kContentModificationDate)));
    EXPECT_EQ(fs_->calls(Op::Statx), 1u) << "prefetched values are served from the cache";

    // A second prefetch only reads what is missing; none is.
    ASSERT_FALSE(url.prefetchResourceValues(keys));
    EXPECT_EQ(fs_->calls(Op::Statx), 1u);
    // An uncached key costs one more statx, whatever else is asked for with it.
    ASSERT_FALSE(url.prefetchResourceValues({K::kName, K::kCreationDate, K::kParentDirectoryURL}));
    EXPECT_EQ(fs_->calls(Op::Statx), 2u);

    // A failed prefetch caches nothing.
    Url other = Url::fileURLWithPath(dir_.writeFile("other", "abcd"));
    fs_->inject(Op::Statx, EIO);
    std::optional<Error> failed = other.prefetchResourceValues({K::kFileSize});
    ASSERT_TRUE(failed);
    EXPECT_TRUE(failed->is(kPosixErrorDomain, EIO));
    EXPECT_EQ(unsignedValue(other, K::kFileSize), 4u);
}

}  // namespace
}  // namespace tamber
