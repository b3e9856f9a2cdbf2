#include "items/FolderEntryCounts.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <memory>
#include <string>
#include <thread>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

// Entry counts of large folders, kept while the folder is unchanged.

namespace tamber {
namespace {

using Op = FaultInjectingFileSystem::Operation;

class FolderEntryCountsTest : public ::testing::Test {
protected:
    void fill(const std::string& folder, int count) {
        for (int i = 0; i < count; ++i) dir_.writeFile(folder + "/f" + std::to_string(i));
    }
    // Past the margin within which a change could hide behind an unchanged stamp.
    static void settle() {
        std::this_thread::sleep_for(
            std::chrono::nanoseconds(DirectoryStamp::kFineMarginNanoseconds + 20'000'000));
    }
    size_t reads() const { return fs_->calls(Op::ReadDirectory); }

    testing::TempDir dir_;
    std::shared_ptr<FaultInjectingFileSystem> fs_ =
        std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped_{fs_};
};

// A large, settled folder is read once; a change to it, a small folder, and a folder that has
// just changed are each read again, and every count is the folder's own.
TEST_F(FolderEntryCountsTest, AnUnchangedLargeFolderIsCountedOnce) {
    fill("big", 12);
    dir_.writeFile("big/.hidden");
    fill("small", 2);
    settle();
    FolderEntryCounts counts(8, 10);

    EXPECT_EQ(counts.count(dir_ / "big"), 13u) << "hidden entries count";
    EXPECT_EQ(counts.count(dir_ / "big"), 13u);
    EXPECT_EQ(reads(), 1u);
    EXPECT_EQ(counts.count(dir_ / "small"), 2u);
    EXPECT_EQ(counts.count(dir_ / "small"), 2u);
    EXPECT_EQ(reads(), 3u) << "a small folder is counted each time";

    dir_.writeFile("big/new");
    EXPECT_EQ(counts.count(dir_ / "big"), 14u) << "a changed folder is read again";
    EXPECT_EQ(counts.count(dir_ / "big"), 14u);
    EXPECT_EQ(reads(), 5u) << "a folder changed a moment ago is not kept";
    settle();
    ASSERT_EQ(::unlink((dir_ / "big/new").c_str()), 0);
    settle();
    EXPECT_EQ(counts.count(dir_ / "big"), 13u);
    EXPECT_EQ(counts.count(dir_ / "big"), 13u);
    EXPECT_EQ(reads(), 6u);
}

TEST_F(FolderEntryCountsTest, FailuresGiveNothingAndAreNotKept) {
    fill("big", 12);
    dir_.writeFile("file", "x");
    ASSERT_EQ(::symlink((dir_ / "big").c_str(), (dir_ / "link").c_str()), 0);
    settle();
    FolderEntryCounts counts(8, 10);
    EXPECT_EQ(counts.count(dir_ / "missing"), std::nullopt);
    EXPECT_EQ(counts.count(dir_ / "file"), std::nullopt);
    EXPECT_EQ(counts.count(dir_ / "link"), std::nullopt) << "never through a final link";

    fs_->inject(Op::ReadDirectory, EIO);
    EXPECT_EQ(counts.count(dir_ / "big"), std::nullopt);
    EXPECT_EQ(counts.keptCount(), 0u);
    EXPECT_EQ(counts.count(dir_ / "big"), 12u);
    EXPECT_EQ(counts.keptCount(), 1u);
}

TEST_F(FolderEntryCountsTest, AtMostTheCapacityIsKeptTheLeastRecentlyUsedGoingFirst) {
    for (const char* name : {"a", "b", "c"}) fill(name, 10);
    settle();
    FolderEntryCounts counts(2, 10);
    for (const char* name : {"a", "b", "a", "c"}) EXPECT_EQ(counts.count(dir_ / name), 10u);
    EXPECT_EQ(counts.keptCount(), 2u);
    size_t before = reads();
    EXPECT_EQ(counts.count(dir_ / "a"), 10u);
    EXPECT_EQ(reads(), before) << "used most recently but one: still kept";
    EXPECT_EQ(counts.count(dir_ / "b"), 10u);
    EXPECT_EQ(reads(), before + 1) << "the least recently used went";
}

}  // namespace
}  // namespace tamber
