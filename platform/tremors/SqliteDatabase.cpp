#include "platform/tremors/SqliteDatabase.h"

#include <utility>

namespace tamber {

// ---- Statement ----

SqliteDatabase::Statement::Statement(Statement&& other) noexcept
    : db_(other.db_),
      stmt_(std::exchange(other.stmt_, nullptr)),
      owned_(other.owned_),
      bindError_(other.bindError_) {}

SqliteDatabase::Statement& SqliteDatabase::Statement::operator=(Statement&& other) noexcept {
    if (this != &other) {
        release();
        db_ = other.db_;
        stmt_ = std::exchange(other.stmt_, nullptr);
        owned_ = other.owned_;
        bindError_ = other.bindError_;
    }
    return *this;
}

SqliteDatabase::Statement::~Statement() {
    release();
}

void SqliteDatabase::Statement::release() {
    if (!stmt_)
        return;
    if (owned_) {
        sqlite3_finalize(stmt_);
    } else {
        reset();
    }
    stmt_ = nullptr;
}

void SqliteDatabase::Statement::noteBind(int rc) {
    if (rc != SQLITE_OK && bindError_ == SQLITE_OK)
        bindError_ = rc;
}

SqliteDatabase::Statement& SqliteDatabase::Statement::bind(int index, int64_t value) {
    noteBind(sqlite3_bind_int64(stmt_, index, value));
    return *this;
}

SqliteDatabase::Statement& SqliteDatabase::Statement::bind(int index, std::string_view value) {
    // A null pointer would bind NULL rather than the empty text.
    const char* text = value.data() ? value.data() : "";
    noteBind(sqlite3_bind_text64(stmt_, index, text, value.size(), SQLITE_TRANSIENT, SQLITE_UTF8));
    return *this;
}

SqliteDatabase::Statement& SqliteDatabase::Statement::bind(int index, double value) {
    noteBind(sqlite3_bind_double(stmt_, index, value));
    return *this;
}

SqliteDatabase::Statement& SqliteDatabase::Statement::bindNull(int index) {
    noteBind(sqlite3_bind_null(stmt_, index));
    return *this;
}

SqliteDatabase::Statement& SqliteDatabase::Statement::bindBlob(int index,
                                                               std::span<const uint8_t> value) {
    // A null pointer would bind NULL rather than the empty blob.
    static const uint8_t kEmpty = 0;
    const void* bytes = value.data() ? value.data() : &kEmpty;
    noteBind(sqlite3_bind_blob64(stmt_, index, bytes, value.size(), SQLITE_TRANSIENT));
    return *this;
}

Result<bool> SqliteDatabase::Statement::step() {
    if (bindError_ != SQLITE_OK) {
        return makeError(bindError_, std::string("binding ") + sqlite3_sql(stmt_),
                         sqlite3_errstr(bindError_));
    }
    int rc = sqlite3_step(stmt_);
    if (rc == SQLITE_ROW)
        return true;
    if (rc == SQLITE_DONE)
        return false;
    return makeError(rc, sqlite3_sql(stmt_), sqlite3_errmsg(db_));
}

Status SqliteDatabase::Statement::run() {
    Result<bool> r = step();
    while (r.ok() && r.value()) r = step();
    Status status;
    if (!r.ok())
        status = r.error();
    reset();
    return status;
}

void SqliteDatabase::Statement::reset() {
    sqlite3_reset(stmt_);
    sqlite3_clear_bindings(stmt_);
    bindError_ = SQLITE_OK;
}

int64_t SqliteDatabase::Statement::columnInt64(int index) const {
    return sqlite3_column_int64(stmt_, index);
}

std::string SqliteDatabase::Statement::columnText(int index) const {
    auto text = reinterpret_cast<const char*>(sqlite3_column_text(stmt_, index));
    if (!text)
        return {};
    return std::string(text, static_cast<size_t>(sqlite3_column_bytes(stmt_, index)));
}

std::vector<uint8_t> SqliteDatabase::Statement::columnBlob(int index) const {
    auto bytes = static_cast<const uint8_t*>(sqlite3_column_blob(stmt_, index));
    if (!bytes)
        return {};
    return std::vector<uint8_t>(bytes, bytes + sqlite3_column_bytes(stmt_, index));
}

bool SqliteDatabase::Statement::columnIsNull(int index) const {
    return sqlite3_column_type(stmt_, index) == SQLITE_NULL;
}

// ---- Transaction ----

SqliteDatabase::Transaction::Transaction(Transaction&& other) noexcept
    : db_(std::exchange(other.db_, nullptr)), nested_(other.nested_) {}

SqliteDatabase::Transaction::~Transaction() {
    // An error may have rolled the whole transaction back already; then there is nothing to undo.
    if (db_ && !sqlite3_get_autocommit(db_->db_)) {
        sqlite3_exec(db_->db_, nested_ ? "ROLLBACK TO nested; RELEASE nested" : "ROLLBACK", nullptr,
                     nullptr, nullptr);
    }
}

Status SqliteDatabase::Transaction::commit() {
    if (!db_)
        return makeError(SQLITE_MISUSE, "COMMIT", "no transaction");
    Status status = db_->runCached(nested_ ? "RELEASE nested" : "COMMIT");
    if (status.ok())
        db_ = nullptr;
    return status;
}

// ---- SqliteDatabase ----

SqliteDatabase::SqliteDatabase(sqlite3* db, std::string path) : db_(db), path_(std::move(path)) {
    sqlite3_commit_hook(db_, &SqliteDatabase::onCommit, this);
}

SqliteDatabase::~SqliteDatabase() {
    cache_.clear();
    // v2 closes once the last statement is finalised, should one outlive the connection.
    sqlite3_close_v2(db_);
}

int SqliteDatabase::onCommit(void* self) {
    ++static_cast<SqliteDatabase*>(self)->commits_;
    return 0;  // let the commit go ahead
}

Result<std::unique_ptr<SqliteDatabase>> SqliteDatabase::open(const std::string& path, int flags) {
    sqlite3* db = nullptr;
    int rc = sqlite3_open_v2(path.c_str(), &db, flags | SQLITE_OPEN_NOMUTEX, nullptr);
    if (rc != SQLITE_OK) {
        std::string message = db ? sqlite3_errmsg(db) : sqlite3_errstr(rc);
        int code = db ? sqlite3_extended_errcode(db) : rc;
        sqlite3_close_v2(db);
        return makeError(code, "opening " + path, message);
    }
    sqlite3_extended_result_codes(db, 1);
    return std::unique_ptr<SqliteDatabase>(new SqliteDatabase(db, path));
}

Error SqliteDatabase::makeError(int rc, std::string_view what, std::string_view message) {
    std::string description(what);
    description.append(": ").append(message);
    return Error(kSqliteErrorDomain, rc, {{"description", std::move(description)}});
}

Error SqliteDatabase::lastError(std::string_view what, int rc) const {
    return makeError(rc, what, sqlite3_errmsg(db_));
}

Status SqliteDatabase::exec(const std::string& sql) {
    char* message = nullptr;
    int rc = sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &message);
    if (rc == SQLITE_OK)
        return Status::OK();
    Error error = makeError(rc, sql, message ? message : sqlite3_errstr(rc));
    sqlite3_free(message);
    return error;
}

Result<SqliteDatabase::Statement> SqliteDatabase::prepare(std::string_view sql) {
    sqlite3_stmt* stmt = nullptr;
    int rc = sqlite3_prepare_v2(db_, sql.data(), static_cast<int>(sql.size()), &stmt, nullptr);
    if (rc != SQLITE_OK)
        return lastError("preparing " + std::string(sql), rc);
    return Statement(db_, stmt, true);
}

Result<SqliteDatabase::Statement> SqliteDatabase::cached(std::string_view sql) {
    auto it = cache_.find(sql);
    if (it == cache_.end()) {
        auto stmt = prepare(sql);
        if (!stmt.ok())
            return stmt.error();
        it = cache_.emplace(std::string(sql), std::move(stmt).value()).first;
    }
    return Statement(db_, it->second.stmt_, false);
}

Status SqliteDatabase::runCached(std::string_view sql) {
    auto stmt = cached(sql);
    if (!stmt.ok())
        return stmt.error();
    return stmt->run();
}

Result<SqliteDatabase::Statement> SqliteDatabase::firstRow(std::string_view sql) {
    auto stmt = prepare(sql);
    if (!stmt.ok())
        return stmt.error();
    auto row = stmt->step();
    if (!row.ok())
        return row.error();
    if (!row.value())
        return makeError(SQLITE_ERROR, sql, "no row");
    return std::move(stmt.value());
}

Result<int64_t> SqliteDatabase::queryInt64(std::string_view sql) {
    auto stmt = firstRow(sql);
    if (!stmt.ok())
        return stmt.error();
    return stmt->columnInt64(0);
}

Result<std::string> SqliteDatabase::queryText(std::string_view sql) {
    auto stmt = firstRow(sql);
    if (!stmt.ok())
        return stmt.error();
    return stmt->columnText(0);
}

Result<SqliteDatabase::Transaction> SqliteDatabase::begin() {
    bool nested = !sqlite3_get_autocommit(db_);
    if (Status status = runCached(nested ? "SAVEPOINT nested" : "BEGIN IMMEDIATE"); !status.ok())
        return status.error();
    return Transaction(this, nested);
}

}  // namespace tamber
