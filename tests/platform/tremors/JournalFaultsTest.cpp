#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <vector>

#include "tests/platform/tremors/TremorServiceFixture.h"

namespace tamber {
namespace {

using namespace testing;

// The journal's database refuses to grow, as on a full disk, while files keep changing.
class JournalDiskFullTest : public TremorServiceTest {
protected:
    TremorStore& store() {
        TremorStore* store = service_->storeForDevice(device_);
        EXPECT_NE(store, nullptr);
        return *store;
    }
    // Enough new files that their events cannot fit in the pages the database already has.
    std::vector<std::string> createMany(const std::string& prefix) {
        std::vector<std::string> paths;
        for (int i = 0; i < 300; ++i) {
            paths.push_back(tree_ + "/" + prefix + std::string(120, 'n') + std::to_string(i));
            writeText(paths.back(), "x");
        }
        return paths;
    }
};

TEST_F(JournalDiskFullTest, LostEventsLeaveAGapBeforeAnythingJournaledLater) {
    ASSERT_NO_FATAL_FAILURE(startWatching());
    writeText(tree_ + "/before.txt", "b");
    const uint64_t anchor = service_->currentEventId();
    ASSERT_GT(anchor, 0u);

    ScopedLogCapture log;
    ASSERT_TRUE(store().capSizeForTesting(true).ok());
    std::vector<std::string> lost = createMany("lost");
    service_->sync();
    EXPECT_GE(log->countStartingWith("[ERROR] Could not journal events: "), 1u)
        << "the full database went unnoticed";

    // Space comes back; the next change is journaled.
    ASSERT_TRUE(store().capSizeForTesting(false).ok());
    std::string after = tree_ + "/after.txt";
    writeText(after, "a");
    service_->sync();

    auto events = journaled(*service_, device_, anchor, {tree_});
    const JournalEvent* created = findEvent(events, after, kTremorItemCreated);
    ASSERT_NE(created, nullptr) << "a change after the disk freed up was lost\n"
                                << describe(events);
    // A reader from the anchor must learn that history is incomplete before it reaches the
    // later event: otherwise the files created while the disk was full are never reported.
    bool gapFirst = false;
    for (const auto& event : events) {
        if (event.id >= created->id)
            break;
        if ((event.flags & kTremorUserDropped) &&
            (event.flags & kTremorMustScanSubdirs))
            gapFirst = true;
    }
    EXPECT_TRUE(gapFirst) << "events were lost without a trace in the journal\n"
                          << describe(events);

    // And the index is back in step: the files made while the disk was full have their place.
    for (const std::string& path : {lost.front(), lost.back()}) {
        auto indexed = store().inode(inodeOf(path));
        ASSERT_TRUE(indexed.ok());
        EXPECT_TRUE(indexed.value().has_value()) << path << " is missing from the index";
    }
}

}  // namespace
}  // namespace tamber
