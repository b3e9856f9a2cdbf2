// Feeds arbitrary rows to the journal's database, as a damaged disk or another program could
// leave them: the input is a run of statements (a statement byte, then for each parameter a
// type byte and a value: NULL, a 64-bit integer, a real, text or a blob) applied with SQLite
// to a copy of a small journal before the store opens it; the last sixteen bytes pick an inode
// and a document ID to look up. Opening may fail or start afresh and any call may fail with an
// error; none may crash or hang, and what the store does answer must make sense:
// - a replay yields events in rising ID order, after the ID asked for and not past the last;
// - a path from the index is absolute and made of real names (no empty, "." or ".." part, so
//   no row can make a path climb out of its root);
// - IDs are never handed out twice: an event appended afterwards is the one journaled at its
//   ID, and a document ID allocated afterwards names the inode it was allocated for.
#include <sqlite3.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "fuzz/support/FuzzSupport.h"
#include "platform/tremors/TremorStore.h"

using namespace tamber;

namespace {

constexpr uint64_t kFsid = 0xf022;

using fuzz::check;

struct Statement {
    const char* sql;
    int parameters;
};

const Statement kStatements[] = {
    {"INSERT OR REPLACE INTO events(id, root, path, file_id, flags) VALUES(?,?,?,?,?)", 5},
    {"UPDATE meta SET next_event_id = ?, oldest_event_id = ?", 2},
    {"UPDATE meta SET next_document_id = ?, uuid = ?", 2},
    {"INSERT OR REPLACE INTO roots(id, path, since_event_id, inode, active) VALUES(?,?,?,?,?)", 5},
    {"INSERT OR REPLACE INTO inodes(inode, parent, name, kind, birth, size, mtime, ctime) "
     "VALUES(?,?,?,?,?,?,?,?)",
     8},
    {"INSERT OR REPLACE INTO documents(doc_id, inode) VALUES(?,?)", 2},
    {"INSERT OR REPLACE INTO document_attributes(doc_id, name, value) VALUES(?,?,?)", 3},
    {"UPDATE events SET path = ?, file_id = ? WHERE id = ?", 3},
    {"UPDATE inodes SET parent = ?, name = ? WHERE inode = ?", 3},
    {"UPDATE roots SET path = ?, inode = ? WHERE id = ?", 3},
    {"DELETE FROM meta WHERE id = ?", 1},
    {"DELETE FROM roots WHERE id = ?", 1},
};
constexpr size_t kStatementCount = sizeof kStatements / sizeof kStatements[0];
constexpr int kMaxStatements = 24;

struct Paths {
    std::string templateDir;  // the small journal, as the store left it
    std::string stateDir;     // where each input's copy is opened
    std::string storeName;    // the store's folder name within either
};

// A journal with two roots, a few events, a small tree with documents and one attribute copy.
Paths& paths() {
    static Paths* made = [] {
        fuzz::silenceLog();
        auto* p = new Paths;
        std::string base = fuzz::scratchFolder("rows");
        p->templateDir = base + "/template";
        p->stateDir = base + "/state";
        std::filesystem::create_directories(p->templateDir);
        std::filesystem::create_directories(p->stateDir);
        auto opened = TremorStore::open(p->templateDir, kFsid);
        check(opened.ok());
        std::unique_ptr<TremorStore> store = std::move(opened).value();
        check(store->addRoot("/w", 0, 100).ok());
        check(store->addRoot("/x", 0, 200).ok());
        std::vector<JournalEvent> events;
        for (int i = 0; i < 12; ++i)
            events.push_back(
                {0, (i % 2 ? "/w/f" : "/x/g") + std::to_string(i), uint64_t(101 + i), 0x100});
        check(store->append(events).ok());
        check(store
                  ->upsertInodes({{101, 100, "a", InodeRecord::kDirectory},
                                  {102, 101, "b.txt", InodeRecord::kFile},
                                  {103, 100, "c.txt", InodeRecord::kFile},
                                  {201, 200, "d", InodeRecord::kDirectory}})
                  .ok());
        auto doc = store->allocateDocumentId(102);
        check(doc.ok());
        check(store->setDocumentAttribute(doc.value(), "user.tag", Bytes{1, 2, 3}).ok());
        check(store->allocateDocumentId(103).ok());
        store.reset();
        for (const auto& entry : std::filesystem::directory_iterator(p->templateDir))
            if (entry.is_directory())
                p->storeName = entry.path().filename().string();
        check(!p->storeName.empty());
        return p;
    }();
    return *made;
}

void bindParameter(sqlite3_stmt* statement, int index, fuzz::InputReader& in) {
    switch (in.byte() % 5) {
        case 0:
            sqlite3_bind_null(statement, index);
            break;
        case 1:
            sqlite3_bind_int64(statement, index, static_cast<sqlite3_int64>(in.u64()));
            break;
        case 2: {
            uint64_t bits = in.u64();
            double value;
            std::memcpy(&value, &bits, sizeof value);
            sqlite3_bind_double(statement, index, value);
            break;
        }
        case 3: {
            std::string text = in.piece();
            sqlite3_bind_text(statement, index, text.data(), int(text.size()), SQLITE_TRANSIENT);
            break;
        }
        default: {
            std::string blob = in.piece();
            sqlite3_bind_blob(statement, index, blob.data(), int(blob.size()), SQLITE_TRANSIENT);
            break;
        }
    }
}

// Applies the input's statements to the journal file; a statement SQLite refuses is skipped.
void applyRows(const std::string& database, fuzz::InputReader& in) {
    sqlite3* db = nullptr;
    if (sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
        sqlite3_close(db);
        std::abort();
    }
    for (int n = 0; n < kMaxStatements && in.remaining() > 16; ++n) {
        const Statement& s = kStatements[in.byte() % kStatementCount];
        sqlite3_stmt* statement = nullptr;
        check(sqlite3_prepare_v2(db, s.sql, -1, &statement, nullptr) == SQLITE_OK);
        for (int i = 1; i <= s.parameters; ++i) bindParameter(statement, i, in);
        sqlite3_step(statement);
        sqlite3_finalize(statement);
    }
    check(sqlite3_close(db) == SQLITE_OK);
}

bool realPath(const std::string& path) {
    if (path.empty() || path.front() != '/')
        return false;
    if (path == "/")
        return true;
    size_t start = 1;
    while (start <= path.size()) {
        size_t end = path.find('/', start);
        if (end == std::string::npos)
            end = path.size();
        std::string_view part(path.data() + start, end - start);
        if (part.empty() || part == "." || part == "..")
            return false;
        start = end + 1;
    }
    return true;
}

void checkReplay(TremorStore& store, uint64_t since, const std::vector<std::string>& roots,
                 size_t chunk) {
    const uint64_t last = store.lastEventId();
    uint64_t previous = since;
    size_t seen = 0;
    Status status = store.replay(since, roots, chunk, [&](const JournalEvent& event) {
        check(event.id > previous && event.id <= last);
        previous = event.id;
        return ++seen < 10000;
    });
    (void)status;  // an error is an answer
    (void)store.replayability(since, roots);
}

void checkLookups(TremorStore& store, uint64_t inode, uint32_t document) {
    std::vector<uint64_t> inodes = {100, 101, 102, 103, 201, inode};
    for (uint64_t each : inodes) {
        (void)store.inode(each);
        auto path = store.pathForInode(each);
        if (path.ok() && path.value())
            check(realPath(*path.value()));
        (void)store.children(each);
        (void)store.childrenNamed(each, "a");
        (void)store.documentIdForInode(each);
    }
    auto placed = store.placeInodes(inodes);
    if (placed.ok()) {
        check(placed.value().size() == inodes.size());
        for (const auto& placement : placed.value())
            if (placement.path)
                check(realPath(*placement.path));
    }
    for (uint32_t doc : {1u, 2u, document}) {
        auto held = store.inodeForDocumentId(doc);
        (void)held;
        (void)store.documentAttributes(doc);
    }
    (void)store.roots();
    (void)store.rememberedRoots();
}

// Whatever the rows held, new IDs go to new things only. Failing is an answer too.
void checkNewIds(TremorStore& store, uint64_t inode) {
    std::vector<JournalEvent> events = {{0, "/w/appended", 7, 0x100}};
    auto appended = store.append(events);
    if (appended.ok()) {
        const uint64_t id = appended.value();
        check(id >= 1 && id <= TremorStore::kLastEventId && id == store.lastEventId());
        std::vector<JournalEvent> found;
        Status status = store.replay(id - 1, {}, 0, [&](const JournalEvent& event) {
            found.push_back(event);
            return found.size() < 2;
        });
        if (status.ok())
            check(found.size() == 1 && found[0].id == id && found[0].path == "/w/appended");
    }
    auto document = store.allocateDocumentId(inode);
    if (document.ok()) {
        check(document.value() != 0);
        auto held = store.inodeForDocumentId(document.value());
        if (held.ok())
            check(held.value() == inode);
        auto back = store.documentIdForInode(inode);
        if (back.ok())
            check(back.value() == document.value());
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    Paths& p = paths();
    const std::string working = p.stateDir + "/" + p.storeName;
    std::filesystem::remove_all(p.stateDir);
    std::filesystem::create_directories(p.stateDir);
    std::filesystem::copy(p.templateDir + "/" + p.storeName, working,
                          std::filesystem::copy_options::recursive);

    fuzz::InputReader in(data, size);
    applyRows(working + "/journal.sqlite", in);
    const uint64_t inode = in.u64();
    const uint64_t mixed = in.u64();

    auto opened = TremorStore::open(p.stateDir, kFsid);
    if (!opened.ok())
        return 0;
    TremorStore& store = *opened.value();
    checkReplay(store, 0, {}, 0);
    checkReplay(store, mixed % 16, {"/w"}, 1 + mixed % 5);
    checkReplay(store, mixed, {"/x", "/w/a"}, 2);
    checkLookups(store, inode, static_cast<uint32_t>(mixed));
    checkNewIds(store, inode);
    return 0;
}
