#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <thread>

#include "items/ExtendedAttributes.h"
#include "items/ItemMetadata.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/String.h"
#include "tests/provider/ProviderOperationsTest.h"

namespace tamber {
namespace {

using namespace testing;

class AutoDeletionTest : public ProviderOperationsTest {
protected:
    // Runs one sweep and waits for its completion; the thread it ran on.
    std::thread::id sweep(std::shared_ptr<const Date> reference) {
        auto calls = std::make_shared<std::atomic<int>>(0);
        auto done = std::make_shared<std::promise<std::thread::id>>();
        porter->_removeTrashedItemsOlderThanDate(std::move(reference), [calls, done] {
            if (++*calls == 1)
                done->set_value(std::this_thread::get_id());
        });
        auto future = done->get_future();
        EXPECT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);
        EXPECT_EQ(calls->load(), 1);
        return future.valid() ? future.get() : std::thread::id();
    }
    // An item already in a trash folder, resolvable, with this trash date (none for null).
    std::string trashed(const std::string& path, std::shared_ptr<const Date> date) {
        writeFile(path);
        if (date) {
            EXPECT_TRUE(ItemMetadata::writeTrashDate(Url::fileURLWithPath(path), date).ok());
        }
        return path;
    }
    std::string libraryTrash() const { return library + "/.Trash"; }
};

TEST_F(AutoDeletionTest, RemovesOnlyWhatWasTrashedStrictlyBeforeTheReferenceDate) {
    auto reference = Date::make(1'700'000'000);
    std::string older = trashed(libraryTrash() + "/older.txt", Date::make(1'699'999'999.5));
    std::string same = trashed(libraryTrash() + "/same.txt", reference);
    std::string newer = trashed(storage + "/.Trash/newer.txt", Date::make(1'700'000'100));
    std::string sharedOlder = trashed(storage + "/.Trash/old.txt", Date::make(1'000));

    sweep(reference);
    EXPECT_FALSE(std::filesystem::exists(older));
    EXPECT_FALSE(std::filesystem::exists(sharedOlder));
    EXPECT_TRUE(std::filesystem::exists(same));
    EXPECT_TRUE(std::filesystem::exists(newer));
    // Their dates are left as they were.
    EXPECT_EQ(ItemMetadata::readTrashDate(Url::fileURLWithPath(same))->timeIntervalSince1970(),
              reference->timeIntervalSince1970());
    EXPECT_EQ(log->countStartingWith("[DEBUG] item did="), 2u);
    EXPECT_EQ(log->count("[DEBUG] wait until all deletions are complete", LogLevel::Debug), 1u);
    EXPECT_EQ(sectionsTitled("remove trashed items older than " + reference->description()), 1u);
}

// Hosts learn from the sweep itself what it deleted: only the items that went, counted once
// every deletion has finished, never the kept or restamped ones.
TEST_F(AutoDeletionTest, TheHostFacingSweepReportsWhatItDeleted) {
    auto reference = Date::make(1'700'000'000);
    std::string older = trashed(libraryTrash() + "/older.txt", Date::make(1'000));
    std::string folder = makeFolder(storage + "/.Trash/old folder");
    writeFile(folder + "/inside.txt");
    ASSERT_TRUE(ItemMetadata::writeTrashDate(Url::fileURLWithPath(folder), Date::make(2'000)).ok());
    std::string kept = trashed(storage + "/.Trash/kept.txt", reference);
    std::string undated = trashed(libraryTrash() + "/undated.txt", nullptr);

    auto sweepCounting = [&] {
        auto calls = std::make_shared<std::atomic<int>>(0);
        auto counted = std::make_shared<std::promise<std::pair<size_t, bool>>>();
        HostPorterExtension& host = *porter;
        host.removeTrashedItemsOlderThanDate(reference, [=](size_t removed) {
            if (++*calls == 1)
                counted->set_value({removed, std::filesystem::exists(older)});
        });
        auto future = counted->get_future();
        EXPECT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);
        auto result = future.get();
        EXPECT_EQ(calls->load(), 1);
        return result;
    };
    auto [removed, olderStillThere] = sweepCounting();
    EXPECT_EQ(removed, 2u) << "the old file and the old folder, as one item with its contents";
    EXPECT_FALSE(olderStillThere) << "counted before its deletion finished";
    EXPECT_FALSE(std::filesystem::exists(folder));
    EXPECT_TRUE(std::filesystem::exists(kept));
    EXPECT_TRUE(std::filesystem::exists(undated));
    EXPECT_EQ(sweepCounting().first, 0u) << "nothing older is left";
}

TEST_F(AutoDeletionTest, ItemsWithoutAReadableDateAreRestampedAndGoLater) {
    std::string undated = trashed(libraryTrash() + "/undated.txt", nullptr);
    std::string broken = trashed(storage + "/.Trash/broken.txt", nullptr);
    auto notADate = KeyedArchiver::archivedDataWithRootObject(String::make("yesterday"));
    ASSERT_TRUE(notADate.ok());
    ASSERT_TRUE(ItemMetadata::writeAttributeData(Url::fileURLWithPath(broken),
                                                 LocalItem::xattrTrashDateName(), notADate.value())
                    .ok());

    double before = Date::now()->timeIntervalSince1970();
    sweep(Date::make(before + 3600));
    for (const std::string& path : {undated, broken}) {
        ASSERT_TRUE(std::filesystem::exists(path)) << path;
        auto stamp = ItemMetadata::readTrashDate(Url::fileURLWithPath(path));
        ASSERT_TRUE(stamp) << path;
        EXPECT_GE(stamp->timeIntervalSince1970(), before);
    }
    EXPECT_EQ(
        log->count("[DEBUG] can't find trash date for URL \"" + undated + "\"; set current date",
                   LogLevel::Debug),
        1u);
    EXPECT_EQ(log->countStartingWith("[ERROR] can't unarchive xattr data for URL \"" + broken +
                                     "\"; set current date"),
              1u);

    // From now on they age like any other trashed item.
    sweep(Date::make(Date::now()->timeIntervalSince1970() + 1));
    EXPECT_FALSE(std::filesystem::exists(undated));
    EXPECT_FALSE(std::filesystem::exists(broken));
}

// A symbolic link can carry no attributes, so it can hold no trash date: it ages from when it
// was moved into the trash (its status change), or a trashed link would stay there forever.
TEST_F(AutoDeletionTest, ATrashedLinkAgesFromWhenItWasMovedThere) {
    std::string link = libraryTrash() + "/shortcut";
    std::filesystem::create_directories(libraryTrash());
    std::filesystem::create_symlink("/etc/passwd", link);
    publishWithParents(link);

    sweep(Date::make(Date::now()->timeIntervalSince1970() - 3600));
    EXPECT_TRUE(std::filesystem::is_symlink(link)) << "it was moved there only now";
    sweep(Date::make(Date::now()->timeIntervalSince1970() + 1));
    EXPECT_FALSE(std::filesystem::is_symlink(link));
    EXPECT_TRUE(std::filesystem::exists("/etc/passwd"));
    EXPECT_EQ(log->countStartingWith("[ERROR] can't set xattr"), 0u);
}

TEST_F(AutoDeletionTest, ATrashedFolderIsOneItemAndHiddenEntriesAreLeftAlone) {
    std::string folder = libraryTrash() + "/Old";
    writeFile(folder + "/inner/a.txt");
    writeFile(folder + "/b.txt");
    std::string hidden = trashed(libraryTrash() + "/.hidden", nullptr);
    ASSERT_TRUE(ItemMetadata::writeTrashDate(Url::fileURLWithPath(folder), Date::make(5'000)).ok());

    sweep(Date::make(4'000));
    // Nothing below the folder was visited, so nothing there was stamped.
    for (const std::string& inside :
         {folder + "/inner", folder + "/inner/a.txt", folder + "/b.txt"})
        EXPECT_FALSE(ReadXattrData(LocalItem::xattrTrashDateName(), Url::fileURLWithPath(inside)))
            << inside;
    EXPECT_FALSE(ReadXattrData(LocalItem::xattrTrashDateName(), Url::fileURLWithPath(hidden)));
    EXPECT_EQ(log->countStartingWith("[DEBUG] can't find trash date"), 0u);

    sweep(Date::make(6'000));
    EXPECT_FALSE(std::filesystem::exists(folder));
    EXPECT_TRUE(std::filesystem::exists(hidden));
    EXPECT_EQ(log->countStartingWith("[DEBUG] item fid="), 1u);
}

TEST_F(AutoDeletionTest, CompletesOnItsOwnQueueEvenWithNothingToDelete) {
    ASSERT_FALSE(std::filesystem::exists(libraryTrash()));
    ASSERT_FALSE(std::filesystem::exists(storage + "/.Trash"));
    const auto before = tree();
    std::thread::id ranOn = sweep(Date::now());
    EXPECT_NE(ranOn, std::thread::id());
    EXPECT_NE(ranOn, std::this_thread::get_id());
    EXPECT_EQ(tree(), before);

    // A sweep with deletions also answers off the caller's thread, after they finished.
    std::string old = trashed(libraryTrash() + "/old.txt", Date::make(1));
    ranOn = sweep(Date::now());
    EXPECT_NE(ranOn, std::this_thread::get_id());
    EXPECT_FALSE(std::filesystem::exists(old));
}

}  // namespace
}  // namespace tamber
