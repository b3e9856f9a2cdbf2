// Measures the event journal's store against plain SQLite doing the same work in the same run:
// appending events in transactions of 1,000, replaying them all, replaying one folder, and
// writing the inode index.
//
//   build/bench/bench_tremor_store [events=100000] [dir=$TMPDIR]
#include <sqlite3.h>
#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <string>
#include <vector>

#include "platform/tremors/SqliteDatabase.h"
#include "platform/tremors/TremorStore.h"

using namespace tamber;
using Clock = std::chrono::steady_clock;

namespace {

constexpr size_t kBatch = 1000;
constexpr int kRoots = 4;

double since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

void report(const char* what, size_t n, double store, double baseline, const char* baseName) {
    std::printf("%-28s %10.0f /s   (%7.3f s)   %-34s %10.0f /s   (%7.3f s)\n", what, n / store,
                store, baseName, n / baseline, baseline);
}

[[noreturn]] void die(const std::string& what) {
    std::fprintf(stderr, "%s\n", what.c_str());
    std::exit(1);
}

void check(const Status& status) {
    if (!status.ok())
        die(status.error().description());
}

// Configured as the store configures its own, so that the figures differ only by the store's
// indexes and bookkeeping.
std::unique_ptr<SqliteDatabase> plainDatabase(const std::string& path) {
    auto db = SqliteDatabase::open(path);
    if (!db.ok())
        die(db.error().description());
    check(db.value()->exec(
        "PRAGMA locking_mode = EXCLUSIVE; PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL;"
        "PRAGMA cache_size = -32768"));
    return std::move(db).value();
}

// Inserts `rows` through `bindRow` in transactions of kBatch.
template <class F>
double plainInsert(SqliteDatabase& db, const std::string& sql, size_t rows, F&& bindRow) {
    auto stmt = db.prepare(sql);
    if (!stmt.ok())
        die(stmt.error().description());
    auto start = Clock::now();
    for (size_t done = 0; done < rows;) {
        auto txn = db.begin();
        if (!txn.ok())
            die(txn.error().description());
        for (size_t end = std::min(rows, done + kBatch); done < end; ++done) {
            bindRow(stmt.value(), done);
            check(stmt->run());
        }
        check(txn->commit());
    }
    return since(start);
}

}  // namespace

int main(int argc, char** argv) {
    size_t count = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 100000;
    const char* tmp = argc > 2 ? argv[2] : (std::getenv("TMPDIR") ? std::getenv("TMPDIR") : "/tmp");
    std::string root = std::string(tmp) + "/tamber-bench-XXXXXX";
    if (!mkdtemp(root.data()))
        die("mkdtemp failed");

    auto opened = TremorStore::open(root + "/state", 1);
    if (!opened.ok())
        die(opened.error().description());
    auto store = std::move(opened).value();
    for (int r = 0; r < kRoots; ++r) check(store->addRoot("/bench/r" + std::to_string(r), 0));
    check(store->addRoot("/bench/small", 0));
    check(store->addRoot(TremorStore::kDocumentIdRoot, 0));
    auto plain = plainDatabase(root + "/plain.sqlite");
    check(plain->exec(
        "CREATE TABLE events(id INTEGER PRIMARY KEY, path TEXT, file_id INTEGER, flags INTEGER);"
        "CREATE TABLE inodes(inode INTEGER PRIMARY KEY, parent INTEGER, name TEXT, kind INTEGER)"));

    std::vector<JournalEvent> events;
    events.reserve(count);
    for (size_t i = 0; i < count; ++i) {
        // One event in a hundred lands in a small tree; the rest spread over four large ones.
        std::string tree = i % 100 == 0 ? "small" : "r" + std::to_string(i % kRoots);
        events.push_back({0,
                          "/bench/" + tree + "/d" + std::to_string(i / 1000) + "/file-" +
                              std::to_string(i) + ".txt",
                          1000000 + i, 0x100});
    }
    std::printf("%zu events over %d large roots and a small one, transactions of %zu, under %s\n\n",
                count, kRoots, kBatch, root.c_str());

    // Append.
    auto start = Clock::now();
    for (size_t done = 0; done < count; done += kBatch) {
        std::vector<JournalEvent> batch(events.begin() + done,
                                        events.begin() + std::min(count, done + kBatch));
        if (auto last = store->append(batch); !last.ok())
            die(last.error().description());
    }
    double appendStore = since(start);
    double appendPlain = plainInsert(*plain, "INSERT INTO events VALUES(?, ?, ?, ?)", count,
                                     [&](SqliteDatabase::Statement& stmt, size_t i) {
                                         stmt.bind(1, static_cast<int64_t>(i + 1))
                                             .bind(2, events[i].path)
                                             .bind(3, static_cast<int64_t>(events[i].fileID))
                                             .bind(4, int64_t{events[i].flags});
                                     });
    report("append", count, appendStore, appendPlain, "plain insert, no index");

    // Replay everything.
    size_t seen = 0;
    start = Clock::now();
    check(store->replay(0, {}, 0, [&](const JournalEvent&) { return ++seen > 0; }));
    double replayStore = since(start);
    if (seen != count)
        die("replay lost events");
    auto scanAll = [&](const std::string& prefix) {
        auto stmt = plain->prepare("SELECT id, path, file_id, flags FROM events ORDER BY id");
        if (!stmt.ok())
            die(stmt.error().description());
        size_t matched = 0;
        for (auto row = stmt->step(); row.ok() && row.value(); row = stmt->step()) {
            JournalEvent event{static_cast<uint64_t>(stmt->columnInt64(0)), stmt->columnText(1),
                               static_cast<uint64_t>(stmt->columnInt64(2)),
                               static_cast<uint32_t>(stmt->columnInt64(3))};
            matched += event.path.rfind(prefix, 0) == 0;
        }
        return matched;
    };
    start = Clock::now();
    scanAll("/");
    report("replay from 0", count, replayStore, since(start), "plain scan by id");

    // Replay one folder: a quarter of the events, then one in a hundred.
    for (const char* folder : {"/bench/r1", "/bench/small"}) {
        seen = 0;
        start = Clock::now();
        check(store->replay(0, {folder}, 0, [&](const JournalEvent&) { return ++seen > 0; }));
        double folderStore = since(start);
        start = Clock::now();
        size_t matched = scanAll(std::string(folder) + "/");
        double folderPlain = since(start);
        if (matched != seen)
            die("folder replay disagrees with the scan");
        std::string what = std::string("replay ") + folder + " (" + std::to_string(seen) + ")";
        report(what.c_str(), seen, folderStore, folderPlain, "plain scan by id, filtered");
    }

    // Inode index: folders of 1,000 entries, written in readdir-like (unsorted) order.
    std::vector<InodeRecord> records;
    records.reserve(count);
    for (size_t i = 0; i < count; ++i) {
        records.push_back({5000000 + i, 4000000 + i / 1000, "file-" + std::to_string(i) + ".txt",
                           InodeRecord::kFile, 0});
    }
    std::shuffle(records.begin(), records.end(), std::mt19937_64(42));
    start = Clock::now();
    for (size_t done = 0; done < count; done += kBatch) {
        check(store->upsertInodes(std::vector<InodeRecord>(
            records.begin() + done, records.begin() + std::min(count, done + kBatch))));
    }
    double upsertStore = since(start);
    double upsertPlain = plainInsert(*plain, "INSERT INTO inodes VALUES(?, ?, ?, ?)", count,
                                     [&](SqliteDatabase::Statement& stmt, size_t i) {
                                         stmt.bind(1, static_cast<int64_t>(records[i].inode))
                                             .bind(2, static_cast<int64_t>(records[i].parent))
                                             .bind(3, records[i].name)
                                             .bind(4, int64_t{records[i].kind});
                                     });
    report("inode upsert", count, upsertStore, upsertPlain, "plain insert, no parent index");

    // Path lookups need the folders and a root to resolve against.
    std::vector<InodeRecord> folders;
    for (size_t d = 0; d <= count / 1000; ++d) {
        folders.push_back(
            {4000000 + d, 3999999, "d" + std::to_string(d), InodeRecord::kDirectory, 0});
    }
    check(store->upsertInodes(folders));
    plainInsert(*plain, "INSERT INTO inodes VALUES(?, ?, ?, ?)", folders.size(),
                [&](SqliteDatabase::Statement& stmt, size_t i) {
                    stmt.bind(1, static_cast<int64_t>(folders[i].inode))
                        .bind(2, static_cast<int64_t>(folders[i].parent))
                        .bind(3, folders[i].name)
                        .bind(4, int64_t{folders[i].kind});
                });
    check(store->addRoot("/bench/tree", 0, 3999999));
    size_t lookups = std::min<size_t>(count, 20000);
    start = Clock::now();
    for (size_t i = 0; i < lookups; ++i) {
        auto path = store->pathForInode(records[i].inode);
        if (!path.ok() || !path.value())
            die("unresolved inode");
    }
    double lookupStore = since(start);
    auto lookup = plain->prepare("SELECT parent, name FROM inodes WHERE inode = ?");
    if (!lookup.ok())
        die(lookup.error().description());
    start = Clock::now();
    for (size_t i = 0; i < lookups; ++i) {
        // The same two row reads, without the root and cycle bookkeeping.
        lookup->bind(1, static_cast<int64_t>(records[i].inode)).step();
        int64_t parent = lookup->columnInt64(0);
        lookup->reset();
        lookup->bind(1, parent).step();
        lookup->reset();
    }
    report("path for inode", lookups, lookupStore, since(start), "two plain row reads");

    store.reset();
    start = Clock::now();
    auto reopened = TremorStore::open(root + "/state", 1);
    if (!reopened.ok())
        die(reopened.error().description());
    std::printf("\nreopen with quick check: %.3f s\n", since(start));
    reopened.value().reset();
    plain.reset();
    std::filesystem::remove_all(root);
    return 0;
}
