#include <gtest/gtest.h>

#include <fstream>
#include <set>

#include "platform/Tag.h"
#include "platform/tremors/SqliteDatabase.h"
#include "server/ReplicaStore.h"
#include "support/Log.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::ScopedLogCapture;
using testing::TempDir;

// An item record with every field search looks at.
struct Record : HostPorterItem {
    std::string id, parent = "fid=1", name, type = "public.plain-text";
    std::vector<std::string> tags;
    std::optional<double> rank, lastUsed;
    bool trashed = false;

    HostPorterItemIdentifier itemIdentifier() const override { return id; }
    HostPorterItemIdentifier parentItemIdentifier() const override { return parent; }
    std::string filename() const override { return name; }
    std::string typeIdentifier() const override { return type; }
    HostPorterItemCapabilities capabilities() const override { return 0x3F; }
    std::shared_ptr<const Date> lastUsedDate() const override {
        return lastUsed ? Date::make(*lastUsed) : nullptr;
    }
    std::optional<Bytes> tagData() const override {
        if (tags.empty())
            return std::nullopt;
        std::vector<std::shared_ptr<const Tag>> list;
        for (const auto& label : tags) list.push_back(Tag::make(label));
        return GetTagsDataForTags(list);
    }
    std::shared_ptr<const Number> favoriteRank() const override {
        return rank ? Number::fromDouble(*rank) : nullptr;
    }
    bool isTrashed() const override { return trashed; }
    std::string description() const override { return id; }
};

std::shared_ptr<Record> record(std::string id, std::string name, std::string parent = "fid=1") {
    auto r = std::make_shared<Record>();
    r->id = std::move(id);
    r->name = std::move(name);
    r->parent = std::move(parent);
    return r;
}

ChangeCollector::Batch batch(std::vector<ChangeCollector::Change> changes, std::string anchor) {
    ChangeCollector::Batch b;
    b.changes = std::move(changes);
    b.anchor = HostPorterSyncAnchor(anchor.begin(), anchor.end());
    return b;
}
ChangeCollector::Change updated(HostPorterItemRef item) {
    return {std::move(item), {}};
}
ChangeCollector::Change deleted(std::string id) {
    return {nullptr, std::move(id)};
}

class ReplicaStoreTest : public ::testing::Test {
protected:
    void SetUp() override {
        auto opened = ReplicaStore::open(path);
        ASSERT_TRUE(opened.ok()) << opened.error().description();
        store = std::move(opened).value();
    }
    HostPorterSyncAnchor anchorOf(const std::string& text) {
        return HostPorterSyncAnchor(text.begin(), text.end());
    }
    void load(const std::vector<HostPorterItemRef>& items) {
        ASSERT_TRUE(store->replaceAll(items, anchorOf("a0")).ok());
    }
    std::set<std::string> ids(const ReplicaSearchQuery& query) {
        auto found = store->search(query);
        EXPECT_TRUE(found.ok()) << found.error().description();
        std::set<std::string> out;
        if (found.ok())
            for (const auto& item : found.value()) out.insert(item["identifier"]);
        return out;
    }
    std::vector<std::string> orderedIds(const ReplicaSearchQuery& query) {
        auto found = store->search(query);
        EXPECT_TRUE(found.ok());
        std::vector<std::string> out;
        if (found.ok())
            for (const auto& item : found.value()) out.push_back(item["identifier"]);
        return out;
    }
    static ReplicaSearchQuery text(std::string t) {
        ReplicaSearchQuery q;
        q.text = std::move(t);
        return q;
    }

    ScopedLogCapture log;
    TempDir dir;
    std::string path = dir / "state/tamber/replica.db";
    std::unique_ptr<ReplicaStore> store;
};

// Changes are applied in the order the provider sent them: an identifier deleted and then
// updated (a folder's number reused) stays, updated then deleted goes, and a folder's deletion
// takes what lay in it.
TEST_F(ReplicaStoreTest, AppliesChangesInTheOrderSentAndDeletesAFoldersContent) {
    load({record("fid=2", "folder"), record("did=3", "inside", "fid=2"),
          record("did=4", "deep", "did=3"), record("did=5", "other")});
    auto first =
        store->applyBatch(batch({deleted("did=5"), updated(record("did=5", "back")),
                                 updated(record("did=6", "x")), deleted("did=6"), deleted("fid=2")},
                                "a1"),
                          100);
    ASSERT_TRUE(first.ok()) << first.error().description();
    ASSERT_TRUE(first.value());
    EXPECT_EQ(ids({}), (std::set<std::string>{"did=5"}));
    EXPECT_EQ(store->search(text("back")).value().size(), 1u);
    // The batch keeps the provider's order for the subscribers.
    const auto& changes = first.value()->changes["changes"];
    ASSERT_EQ(changes.size(), 5u);
    EXPECT_EQ(changes[0]["deleted"], "did=5");
    EXPECT_EQ(changes[1]["updated"]["filename"], "back");
    EXPECT_EQ(changes[3]["deleted"], "did=6");
    EXPECT_FALSE(first.value()->changes.contains("anchor"));
    EXPECT_EQ(store->anchor().value(), anchorOf("a1"));
}

// A batch with no change moves the anchor but is no event; one that fails to apply leaves the
// items and the anchor as they were (one transaction).
TEST_F(ReplicaStoreTest, ABatchAndItsAnchorCommitTogetherOrNotAtAll) {
    load({record("did=1", "one")});
    const uint64_t before = store->sequence();
    auto empty = store->applyBatch(batch({}, "a1"), 100);
    ASSERT_TRUE(empty.ok());
    EXPECT_FALSE(empty.value());
    EXPECT_EQ(store->sequence(), before);
    EXPECT_EQ(store->anchor().value(), anchorOf("a1"));

    // The second update fails inside the transaction (the items table refuses it).
    ASSERT_TRUE(store->database()
                    .exec("CREATE TRIGGER refuse BEFORE INSERT ON items WHEN new.filename = 'bad' "
                          "BEGIN SELECT RAISE(ABORT, 'refused'); END")
                    .ok());
    auto failed = store->applyBatch(
        batch({updated(record("did=2", "two")), updated(record("did=3", "bad"))}, "a2"), 100);
    EXPECT_FALSE(failed.ok());
    EXPECT_EQ(ids({}), (std::set<std::string>{"did=1"}));
    EXPECT_EQ(store->anchor().value(), anchorOf("a1"));
    EXPECT_EQ(store->sequence(), before);
    auto since = store->batchesSince(before);
    ASSERT_TRUE(since.ok());
    EXPECT_TRUE(since->empty());
}

// The history keeps the last batches; asking from before them, from before a full listing, or
// from a sequence never handed out fails with -1002 so that the client starts over.
TEST_F(ReplicaStoreTest, HistoryIsBoundedAndAGapIsAnExpiredAnchor) {
    load({});
    const uint64_t start = store->sequence();
    for (int i = 0; i < 5; ++i) {
        auto applied = store->applyBatch(
            batch({updated(record("did=" + std::to_string(i + 10), "n"))}, "a"), 3);
        ASSERT_TRUE(applied.ok());
        EXPECT_EQ(applied.value()->sequence, start + i + 1);
    }
    auto kept = store->batchesSince(start + 2);
    ASSERT_TRUE(kept.ok()) << kept.error().description();
    ASSERT_EQ(kept->size(), 3u);
    EXPECT_EQ(kept->front().sequence, start + 3);
    EXPECT_EQ(kept->back().sequence, start + 5);
    EXPECT_EQ(kept->front().changes["updated"][0]["identifier"], "did=12");
    for (uint64_t gone : {start, start + 1, start + 6}) {
        auto since = store->batchesSince(gone);
        ASSERT_FALSE(since.ok()) << gone;
        EXPECT_TRUE(since.error().is(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired));
    }
    EXPECT_TRUE(store->batchesSince(start + 5).value().empty());

    // A full listing starts the history over: nothing from before it can be replayed.
    const uint64_t last = store->sequence();
    load({record("did=1", "one")});
    EXPECT_FALSE(store->batchesSince(last).ok());
    EXPECT_TRUE(store->batchesSince(store->sequence()).ok());
}

// The anchor, the items and the sequence survive a reopen; a file that is not a database, or
// one of another schema version, is replaced by an empty one with exactly one error line.
TEST_F(ReplicaStoreTest, ReopensWhatWasCommittedAndReplacesAnUnusableFileWithOneErrorLine) {
    load({record("did=1", "one")});
    ASSERT_TRUE(store->applyBatch(batch({updated(record("did=2", "two"))}, "a1"), 10).ok());
    const uint64_t sequence = store->sequence();
    store.reset();
    auto again = ReplicaStore::open(path);
    ASSERT_TRUE(again.ok());
    EXPECT_EQ(again.value()->anchor().value(), anchorOf("a1"));
    EXPECT_EQ(again.value()->itemCount().value(), 2u);
    EXPECT_EQ(again.value()->sequence(), sequence);
    again.value().reset();

    auto errorLines = [&] {
        size_t n = 0;
        for (const auto& line : log->lines())
            if (line.level == LogLevel::Error &&
                line.text.find("replica database") != std::string::npos)
                ++n;
        return n;
    };
    {
        std::ofstream garbage(path, std::ios::trunc | std::ios::binary);
        garbage << std::string(8192, '\x5a');
    }
    auto rebuilt = ReplicaStore::open(path);
    ASSERT_TRUE(rebuilt.ok()) << rebuilt.error().description();
    EXPECT_FALSE(rebuilt.value()->anchor().value());
    EXPECT_EQ(rebuilt.value()->itemCount().value(), 0u);
    EXPECT_EQ(errorLines(), 1u);
    rebuilt.value().reset();

    {
        auto db = SqliteDatabase::open(path);
        ASSERT_TRUE(db.ok());
        ASSERT_TRUE(db.value()->exec("PRAGMA user_version=99").ok());
    }
    auto newer = ReplicaStore::open(path);
    ASSERT_TRUE(newer.ok());
    EXPECT_EQ(errorLines(), 2u);
    EXPECT_FALSE(newer.value()->anchor().value());
}

// Index deletions take the library item, what hangs from it, and what lies under its folder
// even when not linked by parent (its trash); other libraries stay.
TEST_F(ReplicaStoreTest, DeletingADomainTakesEverythingUnderItsLibraryOnly) {
    load({record("#com.a", "Documents", "root"), record("did=1", "a1", "#com.a"),
          record("did=2", "a2", "did=1"), record("#com.b", "Documents", "root"),
          record("did=3", "b1", "#com.b")});
    auto removed = store->deleteDomains({"#com.a", "#com.gone"});
    ASSERT_TRUE(removed.ok()) << removed.error().description();
    EXPECT_EQ(removed.value(), 3u);
    EXPECT_EQ(ids({}), (std::set<std::string>{"#com.b", "did=3"}));
}

class ReplicaSearchTest : public ReplicaStoreTest {
protected:
    void SetUp() override {
        ReplicaStoreTest::SetUp();
        auto add = [&](std::string id, std::string name, std::string type = "public.plain-text") {
            auto r = record(std::move(id), std::move(name));
            r->type = std::move(type);
            items.push_back(r);
            return r;
        };
        add("did=1", "Quarterly Report.txt");
        add("did=2", "report_2024.TXT")->tags = {"Red", "Work"};
        add("did=3", "holiday.png", "public.png")->rank = 1;
        add("did=4", "portrait.jpeg", "public.jpeg")->lastUsed = 100;
        add("did=5", "notes.md")->lastUsed = 300;
        add("did=6", "xab%y.txt")->tags = {"Reddish"};
        add("did=7", "old.png", "public.png")->trashed = true;
        add("did=8", "a\"quote\".txt")->lastUsed = 200;
        add("fid=9", "Pictures", "public.folder");
        load(items);
    }
    std::vector<HostPorterItemRef> items;
};

// Names match as substrings in any case, through the index from three characters and below
// it too; characters that mean something to FTS or LIKE are plain characters.
TEST_F(ReplicaSearchTest, MatchesSubstringsOfAnyLengthAndCaseLiterally) {
    EXPECT_EQ(ids(text("REPORT")), (std::set<std::string>{"did=1", "did=2"}));
    EXPECT_EQ(ids(text("port")), (std::set<std::string>{"did=1", "did=2", "did=4"}));
    EXPECT_EQ(ids(text("ab")), (std::set<std::string>{"did=6"}));
    EXPECT_EQ(ids(text("X")), (std::set<std::string>{"did=1", "did=2", "did=6", "did=8"}));
    EXPECT_EQ(ids(text("%")), (std::set<std::string>{"did=6"}));
    EXPECT_EQ(ids(text("_")), (std::set<std::string>{"did=2"}));
    EXPECT_EQ(ids(text("\"quote\"")), (std::set<std::string>{"did=8"}));
    EXPECT_EQ(ids(text("t\" OR \"x")), std::set<std::string>{});
    EXPECT_EQ(ids(text(std::string("re\0po", 5))), std::set<std::string>{});
    // Renames reach the index.
    auto renamed = record("did=1", "Summary.txt");
    ASSERT_TRUE(store->applyBatch(batch({updated(renamed)}, "a1"), 10).ok());
    EXPECT_EQ(ids(text("report")), (std::set<std::string>{"did=2"}));
    EXPECT_EQ(ids(text("summ")), (std::set<std::string>{"did=1"}));
}

// Each filter alone and together: exact tag labels, type conformance, favourites, recently
// used newest first, trashed or not; the limit counts matching rows only.
TEST_F(ReplicaSearchTest, FiltersByTagTypeFavouriteRecentAndTrash) {
    ReplicaSearchQuery q;
    q.tag = "Red";
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=2"}));
    q = {};
    q.type = "public.image";
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=3", "did=4", "did=7"}));
    q.trashed = false;
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=3", "did=4"}));
    q.limit = 1;
    EXPECT_EQ(orderedIds(q), (std::vector<std::string>{"did=3"}));
    q = {};
    q.type = "public.movie";
    EXPECT_TRUE(ids(q).empty());
    q = {};
    q.favorites = true;
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=3"}));
    q = {};
    q.recent = true;
    EXPECT_EQ(orderedIds(q), (std::vector<std::string>{"did=5", "did=8", "did=4"}));
    q.text = "o";
    q.limit = 2;
    EXPECT_EQ(orderedIds(q), (std::vector<std::string>{"did=5", "did=8"}));
    q = {};
    q.trashed = true;
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=7"}));
    // Default order is by name; the limit is clamped to at least one and at most the maximum.
    q = {};
    q.limit = 0;
    EXPECT_EQ(orderedIds(q).size(), 1u);
    q.limit = 3;
    EXPECT_EQ(orderedIds(q), (std::vector<std::string>{"fid=9", "did=1", "did=8"}));
    // Answers are the items' JSON as stored.
    auto found = store->search(text("holiday"));
    ASSERT_TRUE(found.ok());
    ASSERT_EQ(found->size(), 1u);
    EXPECT_EQ(found->front()["typeIdentifier"], "public.png");
    EXPECT_EQ(found->front()["favoriteRank"], 1);
}

// A text that thousands of names match is found by walking the names in order: the answer is
// the same first names, in the same order and case, as for a rare text found in the index.
TEST_F(ReplicaStoreTest, ACommonTextAnswersTheFirstMatchesInNameOrder) {
    std::vector<HostPorterItemRef> many;
    for (int i = 0; i < 2500; ++i) {
        char name[32];
        std::snprintf(name, sizeof name, "Common %05d.txt", 2500 - i);
        auto r = record("did=" + std::to_string(i + 10), name);
        r->tags = {i % 2 ? "Odd" : "Even"};
        many.push_back(r);
    }
    many.push_back(record("did=5", "uncommon.md"));
    load(many);
    ReplicaSearchQuery q = text("COMMON");
    q.limit = 3;
    auto found = store->search(q);
    ASSERT_TRUE(found.ok());
    std::vector<std::string> names;
    for (const auto& item : found.value()) names.push_back(item["filename"]);
    EXPECT_EQ(names, (std::vector<std::string>{"Common 00001.txt", "Common 00002.txt",
                                               "Common 00003.txt"}));
    q.tag = "Odd";
    EXPECT_EQ(store->search(q).value().front()["filename"], "Common 00001.txt");
    q.tag = "Even";
    EXPECT_EQ(store->search(q).value().front()["filename"], "Common 00002.txt");
    q = text("UNCOMMON");
    EXPECT_EQ(ids(q), (std::set<std::string>{"did=5"}));
}

}  // namespace
}  // namespace tamber
