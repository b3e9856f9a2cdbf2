#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "platform/tremors/TremorStore.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

constexpr uint64_t kFsid = 0xfeed;

std::unique_ptr<TremorStore> openStore(const std::string& stateDir) {
    auto store = TremorStore::open(stateDir, kFsid);
    EXPECT_TRUE(store.ok()) << (store.ok() ? "" : store.error().description());
    return store.ok() ? std::move(store).value() : nullptr;
}

std::vector<JournalEvent> eventsAt(const std::vector<std::string>& paths) {
    std::vector<JournalEvent> events;
    for (size_t i = 0; i < paths.size(); ++i) {
        events.push_back({0, paths[i], 1000 + i, static_cast<uint32_t>(0x100 << (i % 8))});
    }
    return events;
}

uint64_t appendPaths(TremorStore& store, const std::vector<std::string>& paths) {
    auto events = eventsAt(paths);
    auto last = store.append(events);
    EXPECT_TRUE(last.ok()) << (last.ok() ? "" : last.error().description());
    return last.ok() ? last.value() : 0;
}

std::vector<JournalEvent> replayed(TremorStore& store, uint64_t since,
                                   const std::vector<std::string>& paths, size_t chunk = 0) {
    std::vector<JournalEvent> seen;
    Status status = store.replay(since, paths, chunk, [&](const JournalEvent& event) {
        seen.push_back(event);
        return true;
    });
    EXPECT_FALSE(status) << status->description();
    return seen;
}

std::vector<std::string> pathsOf(const std::vector<JournalEvent>& events) {
    std::vector<std::string> paths;
    for (const auto& event : events) paths.push_back(event.path);
    return paths;
}

std::vector<uint64_t> idsOf(const std::vector<JournalEvent>& events) {
    std::vector<uint64_t> ids;
    for (const auto& event : events) ids.push_back(event.id);
    return ids;
}

TEST(TremorStoreJournalTest, IdsAreConsecutiveAndNeverReusedAcrossReopenAndTrim) {
    testing::TempDir state;
    {
        auto store = openStore(state.path());
        ASSERT_TRUE(store);
        EXPECT_EQ(store->lastEventId(), 0u);
        EXPECT_EQ(store->oldestEventId(), 1u);

        auto events = eventsAt({"/a/1", "/a/2", "/a/3"});
        auto last = store->append(events);
        ASSERT_TRUE(last.ok());
        EXPECT_EQ(last.value(), 3u);
        EXPECT_EQ(idsOf(events), (std::vector<uint64_t>{1, 2, 3}));
        EXPECT_EQ(appendPaths(*store, {"/a/4", "/a/5"}), 5u);

        std::vector<JournalEvent> none;
        EXPECT_EQ(store->append(none).value(), 5u);  // nothing appended, nothing used up
    }
    {
        auto store = openStore(state.path());
        ASSERT_TRUE(store);
        EXPECT_EQ(store->lastEventId(), 5u);
        EXPECT_EQ(appendPaths(*store, {"/a/6"}), 6u);

        ASSERT_FALSE(store->trim(2));
        EXPECT_EQ(store->oldestEventId(), 5u);
        EXPECT_EQ(idsOf(replayed(*store, 0, {})), (std::vector<uint64_t>{5, 6}));
        ASSERT_FALSE(store->trim(0));  // everything
        EXPECT_EQ(store->oldestEventId(), 7u);
        EXPECT_TRUE(replayed(*store, 0, {}).empty());
        EXPECT_EQ(store->lastEventId(), 6u);
    }
    {
        // With no rows left, only the stored counter knows where IDs stopped.
        auto store = openStore(state.path());
        ASSERT_TRUE(store);
        EXPECT_EQ(store->oldestEventId(), 7u);
        EXPECT_EQ(appendPaths(*store, {"/a/7"}), 7u);
        EXPECT_EQ(idsOf(replayed(*store, 0, {})), (std::vector<uint64_t>{7}));
    }
}

TEST(TremorStoreJournalTest, LargeAppendIsOneTransactionAndReplaysInOrder) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/big", 0));
    std::vector<JournalEvent> events;
    for (uint64_t i = 0; i < 10000; ++i) {
        events.push_back({0, "/big/d" + std::to_string(i % 37) + "/f" + std::to_string(i), i * 3,
                          static_cast<uint32_t>(i & 0xffff)});
    }
    const auto original = events;
    uint64_t commits = store->commitCount();
    auto last = store->append(events);
    ASSERT_TRUE(last.ok());
    EXPECT_EQ(last.value(), 10000u);
    EXPECT_EQ(store->commitCount(), commits + 1);

    for (const std::vector<std::string>& paths :
         {std::vector<std::string>{}, std::vector<std::string>{"/big"}}) {
        auto seen = replayed(*store, 0, paths);
        ASSERT_EQ(seen.size(), original.size());
        for (size_t i = 0; i < seen.size(); ++i) {
            JournalEvent expected = original[i];
            expected.id = i + 1;
            ASSERT_EQ(seen[i], expected) << "at " << i;
        }
    }
}

TEST(TremorStoreJournalTest, ReplayMatchesWholePathComponents) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/r/a", 0));
    ASSERT_FALSE(store->addRoot(TremorStore::kDocumentIdRoot, 0));
    appendPaths(*store, {"/r/a", "/r/a/x", "/r/ab/x", "/r/ab", "/r", "/other/r/a/x", "/r/a/y/z",
                         "/.docid/2049/changed/5/src=10,dst=11"});

    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/a"})),
              (std::vector<std::string>{"/r/a", "/r/a/x", "/r/a/y/z"}));
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/a/"})),
              (std::vector<std::string>{"/r/a", "/r/a/x", "/r/a/y/z"}));
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/a/y"})), (std::vector<std::string>{"/r/a/y/z"}));
    // Events outside every root are kept too, and found by their own path.
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/ab"})),
              (std::vector<std::string>{"/r/ab/x", "/r/ab"}));
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r"})),
              (std::vector<std::string>{"/r/a", "/r/a/x", "/r/ab/x", "/r/ab", "/r", "/r/a/y/z"}));
    EXPECT_EQ(replayed(*store, 0, {"/"}).size(), 8u);
    EXPECT_TRUE(replayed(*store, 0, {"/nothing"}).empty());
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/.docid"})),
              (std::vector<std::string>{"/.docid/2049/changed/5/src=10,dst=11"}));
}

TEST(TremorStoreJournalTest, ReplayMergesRootsInIdOrderFromAnyStart) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/x", 0));
    ASSERT_FALSE(store->addRoot("/y", 0));
    ASSERT_FALSE(store->addRoot("/z", 0));
    std::vector<std::string> paths;
    for (int i = 0; i < 100; ++i) {
        // Uneven interleaving, so that the roots' chunks end at different places.
        const char* root = (i % 3 == 0) ? "/x" : (i % 5 == 0 ? "/y" : "/z");
        paths.push_back(std::string(root) + "/f" + std::to_string(i));
    }
    appendPaths(*store, paths);

    auto expected = [&](uint64_t since, const std::vector<std::string>& prefixes) {
        std::vector<uint64_t> ids;
        for (uint64_t id = since + 1; id <= paths.size(); ++id) {
            for (const auto& prefix : prefixes) {
                if (paths[id - 1].rfind(prefix + "/", 0) == 0)
                    ids.push_back(id);
            }
        }
        return ids;
    };
    for (size_t chunk : {size_t{1}, size_t{7}, size_t{1000}}) {
        SCOPED_TRACE("chunk " + std::to_string(chunk));
        for (uint64_t since : {uint64_t{0}, uint64_t{50}, uint64_t{99}, uint64_t{100}}) {
            SCOPED_TRACE("since " + std::to_string(since));
            EXPECT_EQ(idsOf(replayed(*store, since, {"/x", "/y"}, chunk)),
                      expected(since, {"/x", "/y"}));
            EXPECT_EQ(idsOf(replayed(*store, since, {"/y"}, chunk)), expected(since, {"/y"}));
            EXPECT_EQ(idsOf(replayed(*store, since, {}, chunk)),
                      expected(since, {"/x", "/y", "/z"}));
        }
        // Stopping early, in both the merged and the plain scan.
        for (const std::vector<std::string>& filter :
             {std::vector<std::string>{"/x", "/y"}, std::vector<std::string>{}}) {
            std::vector<uint64_t> seen;
            EXPECT_FALSE(store->replay(10, filter, chunk, [&](const JournalEvent& event) {
                seen.push_back(event.id);
                return seen.size() < 5;
            }));
            auto all = filter.empty() ? expected(10, {"/x", "/y", "/z"}) : expected(10, filter);
            EXPECT_EQ(seen, std::vector<uint64_t>(all.begin(), all.begin() + 5));
        }
    }
}

TEST(TremorStoreJournalTest, ReplayFindsEventsFiledBeforeANestedRootOrAfterRemoval) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/q", 0));  // unrelated, so that only some roots are read
    appendPaths(*store, {"/r/a/before-any-root", "/q/1"});
    ASSERT_FALSE(store->addRoot("/r", store->lastEventId()));
    appendPaths(*store, {"/r/a/under-outer", "/r/b/under-outer"});
    ASSERT_FALSE(store->addRoot("/r/a", store->lastEventId()));
    appendPaths(*store, {"/r/a/under-inner", "/r/b/still-outer"});
    ASSERT_FALSE(store->removeRoot("/r/a"));
    appendPaths(*store, {"/r/a/outer-again"});

    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/a"}, 1)),
              (std::vector<std::string>{"/r/a/before-any-root", "/r/a/under-outer",
                                        "/r/a/under-inner", "/r/a/outer-again"}));
    EXPECT_EQ(pathsOf(replayed(*store, 0, {"/r/b"})),
              (std::vector<std::string>{"/r/b/under-outer", "/r/b/still-outer"}));
    ASSERT_FALSE(store->removeRoot("/r"));
    EXPECT_EQ(replayed(*store, 0, {"/r"}).size(), 6u);
    ASSERT_EQ(store->roots().size(), 1u);
    EXPECT_EQ(store->roots()[0].path, "/q");
}

TEST(TremorStoreJournalTest, ReplayIsBoundedAtItsStartAndLetsTheCallbackUseTheStore) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/w", 0));
    appendPaths(*store, {"/w/1", "/w/2", "/w/3"});
    for (const std::vector<std::string>& filter :
         {std::vector<std::string>{}, std::vector<std::string>{"/w"}}) {
        uint64_t before = store->lastEventId();
        std::vector<uint64_t> seen;
        Status status = store->replay(before - 3, filter, 1, [&](const JournalEvent& event) {
            seen.push_back(event.id);
            // Would deadlock if the lock were held; appends only a few, so that a replay
            // that also delivered them still ends.
            if (seen.size() <= 3)
                appendPaths(*store, {"/w/during"});
            return true;
        });
        EXPECT_FALSE(status);
        EXPECT_EQ(seen, (std::vector<uint64_t>{before - 2, before - 1, before}));
        EXPECT_EQ(store->lastEventId(), before + 3);
    }
}

TEST(TremorStoreJournalTest, ConcurrentReplaysSeeEveryEventOnceInOrder) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/c", 0));
    std::atomic<bool> done{false};
    std::thread writer([&] {
        for (int batch = 0; batch < 40; ++batch) {
            std::vector<std::string> paths(50, "/c/file" + std::to_string(batch));
            appendPaths(*store, paths);
        }
        done = true;
    });
    int replays = 0;
    bool ordered = true;
    bool failed = false;
    while ((!done || replays < 2) && !failed) {
        uint64_t expectedNext = 1;
        Status status = store->replay(0, {"/c"}, 13, [&](const JournalEvent& event) {
            ordered = ordered && event.id == expectedNext++;
            return true;
        });
        failed = status.has_value();
        ++replays;
    }
    writer.join();
    EXPECT_FALSE(failed);
    EXPECT_TRUE(ordered);
    EXPECT_EQ(replayed(*store, 0, {"/c"}).size(), 2000u);
}

TEST(TremorStoreJournalTest, ReplayabilityReportsTrimmedAndUnwatchedHistory) {
    testing::TempDir state;
    auto store = openStore(state.path());
    ASSERT_TRUE(store);
    ASSERT_FALSE(store->addRoot("/r", 0));
    std::vector<std::string> paths(10, "/r/f");
    appendPaths(*store, paths);

    EXPECT_TRUE(store->replayability(0, {"/r"}).complete);
    EXPECT_TRUE(store->replayability(0, {"/r/deeper/still"}).complete);
    EXPECT_TRUE(store->replayability(10, {"/r"}).complete);

    ASSERT_FALSE(store->trim(5));  // keeps 6..10
    EXPECT_TRUE(store->replayability(5, {"/r"}).complete);
    auto trimmed = store->replayability(4, {"/r"});
    EXPECT_FALSE(trimmed.complete);
    EXPECT_FALSE(trimmed.reason.empty());
    EXPECT_FALSE(store->replayability(0, {"/r"}).complete);

    ASSERT_FALSE(store->addRoot("/late", store->lastEventId()));
    appendPaths(*store, {"/late/x"});
    auto late = store->replayability(7, {"/r", "/late"});
    EXPECT_FALSE(late.complete);
    EXPECT_NE(late.reason.find("/late"), std::string::npos) << late.reason;
    EXPECT_TRUE(store->replayability(10, {"/r", "/late"}).complete);

    EXPECT_FALSE(store->replayability(10, {"/unwatched"}).complete);
    EXPECT_FALSE(store->replayability(12, {"/r"}).complete);  // not from this history

    // Re-adding a watched root keeps its history; re-adding a removed one starts it anew.
    ASSERT_FALSE(store->addRoot("/r", 11));
    EXPECT_TRUE(store->replayability(6, {"/r"}).complete);
    ASSERT_FALSE(store->removeRoot("/r"));
    EXPECT_FALSE(store->replayability(6, {"/r"}).complete);
    ASSERT_FALSE(store->addRoot("/r", 11));
    EXPECT_FALSE(store->replayability(6, {"/r"}).complete);
    EXPECT_TRUE(store->replayability(11, {"/r"}).complete);
}

}  // namespace
}  // namespace tamber
