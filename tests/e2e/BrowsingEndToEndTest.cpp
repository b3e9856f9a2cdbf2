#include <cerrno>

#include "tests/common/FaultyInotifyApi.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/e2e/EndToEndHost.h"

namespace tamber {
namespace {

using namespace testing;

class BrowsingEndToEndTest : public EndToEndHost {};

TEST_F(BrowsingEndToEndTest, TheHostsViewMatchesTheDiskAfterCatchingUp) {
    write(storage + "/keep.txt", "keep");
    write(storage + "/report.txt", "v1");
    write(storage + "/old-name.txt", "rename me");
    write(storage + "/moving.txt", "move me");
    write(storage + "/doomed.txt", "delete me");
    fs::create_directories(storage + "/Projects/Old");
    write(storage + "/Projects/Old/inside.txt", "goes with its folder");
    write(library + "/note.txt", "a note");

    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok()) << made.error().description();
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    // The first changes bring the working set's app libraries up to date (its own list starts
    // empty), so that the listing covers the libraries' files too.
    catchUp(anchor);
    ASSERT_TRUE(replica.contains("#com.example.notes")) << describe(replica);
    listEverything();
    expectSameView(replica, disk(), "after listing");
    if (HasFailure())
        return;
    auto reportID =
        LocalItem::make(Url::fileURLWithPath(storage + "/report.txt"))->itemIdentifier();

    write(storage + "/created.txt", "new");
    write(storage + "/keep.txt", "modified");
    // A safe save: a new file renamed over the old one keeps the document's identifier.
    write(storage + "/report.txt.sb-tmp", "v2");
    fs::rename(storage + "/report.txt.sb-tmp", storage + "/report.txt");
    fs::rename(storage + "/old-name.txt", storage + "/new-name.txt");
    fs::rename(storage + "/moving.txt", library + "/moving.txt");
    fs::remove(storage + "/doomed.txt");
    fs::remove_all(storage + "/Projects/Old");
    fs::create_directories(storage + "/Projects/New");
    write(storage + "/Projects/New/a.txt", "a");
    write(storage + "/Projects/New/b.txt", "b");
    write(library + "/note.txt", "edited");

    catchUp(anchor);
    expectSameView(replica, disk(), "after catching up");
    EXPECT_EQ(LocalItem::make(Url::fileURLWithPath(storage + "/report.txt"))->itemIdentifier(),
              reportID);

    // Caught up: a further request reports nothing new and keeps the view.
    Replica before = replica;
    catchUp(anchor);
    expectSameView(replica, before, "after a request with nothing new");
}

// The kernel's watch limit is reached: a folder of the storage is not watched, yet the host
// still lists it and, catching up, learns what changed in it.
class WatchLimitEndToEndTest : public EndToEndHost {
protected:
    WatchLimitEndToEndTest() { inotify = faulty; }
    std::shared_ptr<FaultyInotifyApi> faulty = std::make_shared<FaultyInotifyApi>();
};

TEST_F(WatchLimitEndToEndTest, AFolderPastTheLimitIsListedAndItsChangesReachTheHost) {
    ScopedLogCapture log;
    faulty->failAddWatch("/Full", ENOSPC);
    fs::create_directories(storage + "/Full/Inner");
    write(storage + "/Full/before.txt", "b");
    write(storage + "/Full/Inner/doomed.txt", "d");

    auto made =
        porter->enumeratorForContainerItemIdentifier(HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok()) << made.error().description();
    enumerator = made.value();
    HostPorterSyncAnchor anchor = currentAnchor();
    catchUp(anchor);
    listEverything();
    expectSameView(replica, disk(), "after listing");
    ASSERT_TRUE(replica.contains(
        LocalItem::make(Url::fileURLWithPath(storage + "/Full/before.txt"))->itemIdentifier()));

    write(storage + "/Full/created.txt", "new");
    fs::create_directories(storage + "/Full/Inner/Deeper");
    write(storage + "/Full/Inner/Deeper/deep.txt", "deep");
    fs::rename(storage + "/Full/before.txt", storage + "/Full/Inner/after.txt");
    fs::remove(storage + "/Full/Inner/doomed.txt");
    catchUp(anchor);
    expectSameView(replica, disk(), "after catching up");

    size_t limitLines = 0;
    for (const auto& line : log->lines()) {
        if (line.level != LogLevel::Error)
            continue;
        EXPECT_NE(line.text.find("fs.inotify.max_user_watches"), std::string::npos) << line.text;
        ++limitLines;
    }
    EXPECT_EQ(limitLines, 1u);
}

}  // namespace
}  // namespace tamber
