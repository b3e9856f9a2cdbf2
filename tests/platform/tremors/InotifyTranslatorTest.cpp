#include "platform/tremors/InotifyTranslator.h"

#include <gtest/gtest.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <random>

#include "tests/platform/tremors/InotifyTestSupport.h"

namespace tamber {
namespace {

using namespace tamber::testing;
using Changes = std::vector<FileChange>;

// Watches: 1 = /w, 2 = /w/a, 3 = /w/a/b, 4 = /w/a-1 (sorts between /w/a and /w/a/).
class InotifyTranslatorTest : public ::testing::Test {
protected:
    void SetUp() override {
        translator_.addWatch(1, "/w");
        translator_.addWatch(2, "/w/a");
        translator_.addWatch(3, "/w/a/b");
        translator_.addWatch(4, "/w/a-1");
    }

    Changes translate(const EventBuffer& events) {
        Changes out;
        EXPECT_TRUE(translator_.translate(events.bytes().data(), events.bytes().size(), out));
        return out;
    }

    InotifyTranslator translator_;
};

TEST_F(InotifyTranslatorTest, KeepsRecordOrderAndMergesOnlyRunsOfWrites) {
    EventBuffer events;
    events.add(1, IN_CREATE, "f")
        .add(1, IN_MODIFY, "f")
        .add(1, IN_MODIFY, "f")
        .add(1, IN_CLOSE_WRITE, "f")
        .add(1, IN_ATTRIB, "f")
        .add(1, IN_MODIFY, "f")
        .add(2, IN_MODIFY, "g")
        .add(1, IN_MODIFY, "f")
        .add(2, IN_CREATE | IN_ISDIR, "d")
        .add(99, IN_CREATE, "unknown-watch")
        .add(3, IN_DELETE, "old")
        .add(2, IN_ATTRIB | IN_ISDIR)  // the watched directory itself
        .add(1, IN_DELETE, "f");
    EXPECT_EQ(translate(events), (Changes{
                                     created("/w/f"),
                                     modified("/w/f"),
                                     attributes("/w/f"),
                                     modified("/w/f"),
                                     modified("/w/a/g"),
                                     modified("/w/f"),
                                     created("/w/a/d", true),
                                     removed("/w/a/b/old"),
                                     attributes("/w/a", true),
                                     removed("/w/f"),
                                 }));
}

TEST_F(InotifyTranslatorTest, PairsMovesInOneRead) {
    EventBuffer events;
    events.add(1, IN_MOVED_FROM, "x", 7)
        .add(2, IN_MOVED_TO, "y", 7)
        // Two renames whose halves interleave still pair by cookie.
        .add(1, IN_MOVED_FROM, "p", 8)
        .add(1, IN_MOVED_FROM, "q", 9)
        .add(1, IN_MOVED_TO, "q2", 9)
        .add(1, IN_MOVED_TO, "p2", 8)
        // A second half with no first half: moved in from outside.
        .add(3, IN_MOVED_TO | IN_ISDIR, "in", 10)
        .add(1, IN_CREATE, "after");
    EXPECT_EQ(translate(events), (Changes{
                                     renamed("/w/x", "/w/a/y"),
                                     renamed("/w/p", "/w/p2"),
                                     renamed("/w/q", "/w/q2"),
                                     created("/w/a/b/in", true),
                                     created("/w/after"),
                                 }));
    EXPECT_FALSE(translator_.hasPendingMoves());
}

TEST_F(InotifyTranslatorTest, HoldsAFirstHalfAndWhatFollowsItUntilTheNextRead) {
    EventBuffer first;
    first.add(1, IN_CREATE, "before").add(1, IN_MOVED_FROM, "old", 5).add(2, IN_MODIFY, "z");
    EXPECT_EQ(translate(first), (Changes{created("/w/before")}));
    EXPECT_TRUE(translator_.hasPendingMoves());

    EventBuffer second;
    second.add(2, IN_MOVED_TO, "new", 5).add(1, IN_CREATE, "after");
    EXPECT_EQ(translate(second), (Changes{
                                     renamed("/w/old", "/w/a/new"),
                                     modified("/w/a/z"),
                                     created("/w/after"),
                                 }));
    EXPECT_FALSE(translator_.hasPendingMoves());
}

TEST_F(InotifyTranslatorTest, UnmatchedFirstHalvesAreMovesOutOfTheTrees) {
    // Flushed explicitly.
    EventBuffer events;
    events.add(1, IN_MOVED_FROM, "gone", 1).add(1, IN_CREATE, "next");
    EXPECT_EQ(translate(events), Changes{});
    Changes flushed;
    translator_.flushPendingMoves(flushed);
    EXPECT_EQ(flushed, (Changes{removed("/w/gone"), created("/w/next")}));

    // Resolved by a later read that does not bring the second half.
    EXPECT_EQ(translate(EventBuffer().add(1, IN_MOVED_FROM, "gone2", 2)), Changes{});
    EXPECT_EQ(translate(EventBuffer().add(1, IN_CREATE, "x").add(1, IN_MOVED_TO, "y", 3)),
              (Changes{removed("/w/gone2"), created("/w/x"), created("/w/y")}));
    EXPECT_TRUE(translator_.takeOrphanedWatches().empty()) << "files have no watches";
}

TEST_F(InotifyTranslatorTest, ADirectoryMovedOutLosesItsWatches) {
    EXPECT_EQ(translate(EventBuffer().add(1, IN_MOVED_FROM | IN_ISDIR, "a", 4)), Changes{});
    Changes flushed;
    translator_.flushPendingMoves(flushed);
    EXPECT_EQ(flushed, (Changes{removed("/w/a", true)}));
    auto orphaned = translator_.takeOrphanedWatches();
    std::sort(orphaned.begin(), orphaned.end());
    EXPECT_EQ(orphaned, (std::vector<int>{2, 3}));
    EXPECT_EQ(translator_.pathOf(2), nullptr);
    ASSERT_NE(translator_.pathOf(4), nullptr) << "a sibling whose name starts the same stays";
    EXPECT_EQ(*translator_.pathOf(4), "/w/a-1");
    // Events still queued for the dropped watches are not reported under the old path.
    EXPECT_EQ(translate(EventBuffer().add(3, IN_CREATE, "f").add(4, IN_CREATE, "g")),
              (Changes{created("/w/a-1/g")}));
}

TEST_F(InotifyTranslatorTest, TheMovedDirectorysOwnEventEndsTheWaitForTheSecondHalf) {
    // The kernel sends both halves before the directory's own event, so without a second half
    // by then the directory left; what happens in it afterwards is outside the trees.
    EventBuffer events;
    events.add(1, IN_MOVED_FROM | IN_ISDIR, "a", 6)
        .add(2, IN_MOVE_SELF)
        .add(2, IN_CREATE, "late")
        .add(1, IN_CREATE, "stays");
    EXPECT_EQ(translate(events), (Changes{removed("/w/a", true), created("/w/stays")}));
    EXPECT_FALSE(translator_.hasPendingMoves());
    EXPECT_EQ(translator_.watchCount(), 2u);
}

TEST_F(InotifyTranslatorTest, RenamingAWatchedDirectoryMovesEveryWatchBelowIt) {
    EventBuffer events;
    events.add(1, IN_MOVED_FROM | IN_ISDIR, "a", 11)
        .add(1, IN_MOVED_TO | IN_ISDIR, "z", 11)
        .add(2, IN_MOVE_SELF)  // already renamed: nothing to report
        .add(3, IN_CREATE, "f")
        .add(2, IN_MODIFY, "g");
    EXPECT_EQ(translate(events), (Changes{
                                     renamed("/w/a", "/w/z", true),
                                     created("/w/z/b/f"),
                                     modified("/w/z/g"),
                                 }));
    EXPECT_EQ(translator_.watchAt("/w/z/b"), 3);
    EXPECT_FALSE(translator_.watchAt("/w/a").has_value());
    EXPECT_FALSE(translator_.watchAt("/w/a/b").has_value());
    EXPECT_EQ(translator_.watchAt("/w/a-1"), 4);
    EXPECT_TRUE(translator_.takeOrphanedWatches().empty());

    // Split across reads, into a directory of its own former sibling.
    EXPECT_EQ(translate(EventBuffer().add(2, IN_MOVED_FROM | IN_ISDIR, "b", 12)), Changes{});
    EXPECT_EQ(
        translate(EventBuffer().add(4, IN_MOVED_TO | IN_ISDIR, "b", 12).add(3, IN_ATTRIB, "f")),
        (Changes{renamed("/w/z/b", "/w/a-1/b", true), attributes("/w/a-1/b/f")}));
}

TEST_F(InotifyTranslatorTest, ReportsOverflowWhereItHappened) {
    EventBuffer events;
    events.add(1, IN_CREATE, "one").add(-1, IN_Q_OVERFLOW).add(1, IN_CREATE, "two");
    EXPECT_EQ(translate(events), (Changes{created("/w/one"), overflow(), created("/w/two")}));
}

TEST_F(InotifyTranslatorTest, WatchesEndWithTheirDirectories) {
    // Removed or unmounted below a root: the parent's watch reports the removal.
    EXPECT_EQ(translate(EventBuffer()
                            .add(3, IN_DELETE_SELF)
                            .add(3, IN_IGNORED)
                            .add(3, IN_CREATE, "after")
                            .add(4, IN_IGNORED)
                            .add(4, IN_CREATE, "after")),
              Changes{});
    EXPECT_EQ(translator_.watchCount(), 2u);
    EXPECT_TRUE(translator_.takeOrphanedWatches().empty()) << "the kernel already dropped them";

    // A root has no parent to tell: its loss is reported.
    EXPECT_EQ(translate(EventBuffer().add(1, IN_DELETE_SELF).add(1, IN_IGNORED)),
              (Changes{removed("/w", true), watchFailed("/w", ENOENT)}));

    InotifyTranslator moved;
    moved.addWatch(1, "/r");
    moved.addWatch(2, "/r/s");
    EventBuffer moveSelf;
    moveSelf.add(1, IN_MOVE_SELF);
    Changes out;
    EXPECT_TRUE(moved.translate(moveSelf.bytes().data(), moveSelf.bytes().size(), out));
    EXPECT_EQ(out, (Changes{removed("/r", true), watchFailed("/r", ENOENT)}));
    EXPECT_EQ(moved.watchCount(), 0u);
    auto orphaned = moved.takeOrphanedWatches();
    std::sort(orphaned.begin(), orphaned.end());
    EXPECT_EQ(orphaned, (std::vector<int>{1, 2})) << "the kernel still watches a moved tree";
}

TEST_F(InotifyTranslatorTest, AnUnmountedTreeIsReportedOnce) {
    InotifyTranslator translator;
    translator.addWatch(1, "/m");
    translator.addWatch(2, "/m/c");
    translator.addWatch(3, "/m/c/d");
    translator.addWatch(4, "/other");
    EventBuffer events;
    events.add(1, IN_UNMOUNT)
        .add(3, IN_UNMOUNT)
        .add(2, IN_UNMOUNT)
        .add(1, IN_IGNORED)
        .add(2, IN_IGNORED)
        .add(3, IN_IGNORED);
    Changes out;
    EXPECT_TRUE(translator.translate(events.bytes().data(), events.bytes().size(), out));
    EXPECT_EQ(out, (Changes{watchFailed("/m", ENODEV)}));
    EXPECT_EQ(translator.watchCount(), 1u);
}

TEST_F(InotifyTranslatorTest, AddingAWatchSaysWhetherTheDirectoryWasCovered) {
    EXPECT_TRUE(translator_.addWatch(2, "/w/a"));
    EXPECT_FALSE(translator_.addWatch(5, "/w/new"));
    EXPECT_TRUE(translator_.addWatch(5, "/w/new"));
    // The same directory found at another path: the old path no longer names it.
    EXPECT_FALSE(translator_.addWatch(5, "/w/moved"));
    EXPECT_FALSE(translator_.watchAt("/w/new").has_value());
    // A path taken over by another directory keeps the newer watch when the old one ends.
    EXPECT_FALSE(translator_.addWatch(6, "/w/moved"));
    translator_.removeWatch(5);
    EXPECT_EQ(translator_.watchAt("/w/moved"), 6);
}

// Every truncation of a valid buffer: the whole records before the cut are reported exactly,
// the cut one is not, and the loss is marked. The bytes are copied into an allocation of
// exactly that size so that the address sanitizer sees any read past the end.
TEST_F(InotifyTranslatorTest, TruncatedBuffersYieldWholeRecordsAndAnOverflow) {
    EventBuffer events;
    events.add(1, IN_CREATE, "a")
        .add(2, IN_MODIFY, "a-name-longer-than-one-unit-of-sixteen-bytes")
        .add(3, IN_ATTRIB | IN_ISDIR)
        .add(-1, IN_Q_OVERFLOW)
        .add(4, IN_DELETE | IN_ISDIR, "exactly-15-char");
    const Changes perRecord = {
        created("/w/a"),
        modified("/w/a/a-name-longer-than-one-unit-of-sixteen-bytes"),
        attributes("/w/a/b", true),
        overflow(),
        removed("/w/a-1/exactly-15-char", true),
    };
    const std::string& bytes = events.bytes();
    const auto& ends = events.recordEnds();
    for (size_t length = 0; length <= bytes.size(); ++length) {
        InotifyTranslator translator;
        translator.addWatch(1, "/w");
        translator.addWatch(2, "/w/a");
        translator.addWatch(3, "/w/a/b");
        translator.addWatch(4, "/w/a-1");
        auto copy = std::make_unique<char[]>(length);
        std::memcpy(copy.get(), bytes.data(), length);
        size_t whole =
            static_cast<size_t>(std::upper_bound(ends.begin(), ends.end(), length) - ends.begin());
        bool atBoundary = length == 0 || (whole > 0 && ends[whole - 1] == length);
        Changes expected(perRecord.begin(), perRecord.begin() + static_cast<ptrdiff_t>(whole));
        if (!atBoundary)
            expected.push_back(overflow());

        Changes out;
        EXPECT_EQ(translator.translate(copy.get(), length, out), atBoundary) << "length " << length;
        EXPECT_EQ(out, expected) << "length " << length;
    }
}

TEST_F(InotifyTranslatorTest, ImpossibleRecordsStopTheTranslation) {
    struct Case {
        const char* what;
        EventBuffer bad;
    };
    std::vector<Case> cases;
    cases.push_back({"name length past the end", EventBuffer().addRaw(1, IN_CREATE, 0, 4096, "x")});
    cases.push_back(
        {"name length near UINT32_MAX", EventBuffer().addRaw(1, IN_CREATE, 0, 0xfffffff0u, "x")});
    cases.push_back({"slash in a name", EventBuffer().add(1, IN_CREATE, "../etc")});
    cases.push_back({"dot-dot name", EventBuffer().add(1, IN_DELETE, "..")});
    cases.push_back({"creation without a name", EventBuffer().add(1, IN_CREATE)});
    cases.push_back({"slash in a modified name", EventBuffer().add(2, IN_MODIFY, "x/y")});
    for (const Case& c : cases) {
        EventBuffer events;
        events.add(1, IN_CREATE, "good");
        std::string bytes =
            events.bytes() + c.bad.bytes() + EventBuffer().add(1, IN_CREATE, "never").bytes();
        Changes out;
        EXPECT_FALSE(translator_.translate(bytes.data(), bytes.size(), out)) << c.what;
        EXPECT_EQ(out, (Changes{created("/w/good"), overflow()})) << c.what;
    }
}

TEST_F(InotifyTranslatorTest, SurvivesArbitraryBytes) {
    std::mt19937 random(20240611);
    for (int round = 0; round < 2000; ++round) {
        size_t length = random() % 200;
        auto bytes = std::make_unique<char[]>(length);
        for (size_t i = 0; i < length; ++i) {
            // Small words often, so that watch descriptors and lengths are plausible.
            bytes[i] = static_cast<char>(random() % 4 == 0 ? random() : random() % 8);
        }
        Changes out;
        translator_.translate(bytes.get(), length, out);
        for (const FileChange& change : out) {
            if (change.kind != FileChange::Kind::Overflow) {
                EXPECT_TRUE(change.path.starts_with("/w")) << change.path;
            }
        }
        if (translator_.watchCount() == 0) {
            translator_.addWatch(1, "/w");
            translator_.addWatch(2, "/w/a");
        }
    }
}

}  // namespace
}  // namespace tamber
