#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "support/Result.h"

namespace tamber {

// SQLite integers are signed; unsigned 64-bit values (inodes, event IDs) round-trip through the
// same bits.
inline int64_t toSqlite(uint64_t v) {
    return static_cast<int64_t>(v);
}
inline uint64_t fromSqlite(int64_t v) {
    return static_cast<uint64_t>(v);
}

// Errors reported by SQLite: the code is the extended result code, the description names the
// operation and carries SQLite's own message.
inline constexpr const char* kSqliteErrorDomain = "SqliteErrorDomain";

// One SQLite connection. Not thread-safe: the owner serialises access, so the connection is
// opened without SQLite's own mutex.
class SqliteDatabase {
public:
    // A prepared statement. Binding errors are remembered and reported by the next step(), so
    // that binds can be chained. A statement that returned a row keeps a read transaction open
    // until it is reset or destroyed; reuse it through reset().
    class Statement {
    public:
        Statement() = default;
        Statement(Statement&& other) noexcept;
        Statement& operator=(Statement&& other) noexcept;
        Statement(const Statement&) = delete;
        Statement& operator=(const Statement&) = delete;
        ~Statement();

        // Indexes start at 1, as in SQL.
        Statement& bind(int index, int64_t value);
        Statement& bind(int index, std::string_view value);
        Statement& bind(int index, double value);
        Statement& bindNull(int index);
        Statement& bindBlob(int index, std::span<const uint8_t> value);

        // true: a row is ready; false: the statement is done.
        Result<bool> step();
        // Steps to the end, for statements that return no rows, then resets.
        Status run();
        // Calls `visit` (returning a Status) on each row in turn; stops at the first failure of
        // a step or of `visit` and returns it.
        template <class Visit>
        Status eachRow(Visit&& visit) {
            for (;;) {
                Result<bool> row = step();
                if (!row.ok())
                    return row.error();
                if (!row.value())
                    return Status::OK();
                if (Status visited = visit(); !visited.ok())
                    return visited;
            }
        }
        // Ready to run again, with no bindings.
        void reset();

        int64_t columnInt64(int index) const;
        // Empty for NULL.
        std::string columnText(int index) const;
        // Empty for NULL.
        std::vector<uint8_t> columnBlob(int index) const;
        bool columnIsNull(int index) const;

    private:
        friend class SqliteDatabase;
        Statement(sqlite3* db, sqlite3_stmt* stmt, bool owned)
            : db_(db), stmt_(stmt), owned_(owned) {}
        void noteBind(int rc);
        void release();

        sqlite3* db_ = nullptr;
        sqlite3_stmt* stmt_ = nullptr;
        bool owned_ = true;  // false: a handle on a cached statement
        int bindError_ = SQLITE_OK;
    };

    // A write transaction (BEGIN IMMEDIATE) that rolls back unless committed. Begun inside
    // another one, it is a savepoint of it: committing it makes its changes part of the outer
    // transaction, and only the outer commit writes them.
    class Transaction {
    public:
        Transaction(Transaction&& other) noexcept;
        Transaction& operator=(Transaction&&) = delete;
        Transaction(const Transaction&) = delete;
        ~Transaction();
        Status commit();

    private:
        friend class SqliteDatabase;
        Transaction(SqliteDatabase* db, bool nested) : db_(db), nested_(nested) {}
        SqliteDatabase* db_;
        bool nested_;
    };

    // Opens (and by default creates) the database file. Extended result codes are on.
    static Result<std::unique_ptr<SqliteDatabase>> open(const std::string& path,
                                                        int flags = SQLITE_OPEN_READWRITE |
                                                                    SQLITE_OPEN_CREATE);
    ~SqliteDatabase();
    SqliteDatabase(const SqliteDatabase&) = delete;
    SqliteDatabase& operator=(const SqliteDatabase&) = delete;

    // Runs one or more statements that return no values of interest.
    Status exec(const std::string& sql);
    Result<Statement> prepare(std::string_view sql);
    // A statement prepared on first use and kept with the connection. The handle returned
    // resets it instead of finalising it when it goes, so no read transaction stays open. One
    // handle per SQL text at a time.
    Result<Statement> cached(std::string_view sql);
    // The first column of the first row, as an integer or as text; an error when no row.
    Result<int64_t> queryInt64(std::string_view sql);
    Result<std::string> queryText(std::string_view sql);
    Result<Transaction> begin();

    // Commits made on this connection, explicit or not: lets callers and tests see how many
    // transactions an operation cost.
    uint64_t commitCount() const { return commits_; }
    int64_t totalChanges() const { return sqlite3_total_changes64(db_); }
    // Rows changed by the last INSERT, UPDATE or DELETE.
    int64_t changes() const { return sqlite3_changes64(db_); }
    const std::string& path() const { return path_; }

    // An error from the connection's last failure, described as "<what>: <SQLite message>".
    Error lastError(std::string_view what, int rc) const;
    static Error makeError(int rc, std::string_view what, std::string_view message);

private:
    // Runs a statement kept prepared with the connection: the transaction statements, which
    // every batch of the journal and every document ID pays for, are parsed once.
    Status runCached(std::string_view sql);
    // A statement stepped onto its first row; an error when the query has none.
    Result<Statement> firstRow(std::string_view sql);
    SqliteDatabase(sqlite3* db, std::string path);
    static int onCommit(void* self);

    sqlite3* db_;
    std::string path_;
    uint64_t commits_ = 0;
    std::map<std::string, Statement, std::less<>> cache_;
};

}  // namespace tamber
