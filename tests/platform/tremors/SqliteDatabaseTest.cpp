#include "platform/tremors/SqliteDatabase.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>

#include "tests/common/TempDir.h"

namespace tamber {
namespace {

std::unique_ptr<SqliteDatabase> openIn(const testing::TempDir& dir) {
    auto db = SqliteDatabase::open(dir / "test.sqlite");
    EXPECT_TRUE(db.ok()) << (db.ok() ? "" : db.error().description());
    return db.ok() ? std::move(db).value() : nullptr;
}

TEST(SqliteDatabaseTest, ErrorsCarryTheOperationAndSqlitesMessage) {
    testing::TempDir dir;
    auto db = openIn(dir);
    ASSERT_TRUE(db);

    Status syntax = db->exec("SELEC 1");
    ASSERT_TRUE(syntax);
    EXPECT_EQ(syntax->domain(), kSqliteErrorDomain);
    EXPECT_NE(syntax->description().find("syntax error"), std::string::npos)
        << syntax->description();

    auto missing = db->prepare("SELECT * FROM nope");
    ASSERT_FALSE(missing.ok());
    EXPECT_NE(missing.error().description().find("no such table: nope"), std::string::npos)
        << missing.error().description();

    Status duplicate = db->exec(
        "CREATE TABLE t(id INTEGER PRIMARY KEY); INSERT INTO t VALUES(1);"
        "INSERT INTO t VALUES(1)");
    ASSERT_TRUE(duplicate);
    EXPECT_EQ(duplicate->code(), SQLITE_CONSTRAINT_PRIMARYKEY);  // extended codes are on

    // A bad binding surfaces at step, and does not stick once the statement is reset.
    auto stmt = db->prepare("SELECT ?");
    ASSERT_TRUE(stmt.ok());
    auto row = stmt->bind(1, int64_t{1}).bind(5, int64_t{2}).step();
    ASSERT_FALSE(row.ok());
    EXPECT_EQ(row.error().code(), SQLITE_RANGE);
    stmt->reset();
    ASSERT_TRUE(stmt->bind(1, int64_t{7}).step().value());
    EXPECT_EQ(stmt->columnInt64(0), 7);

    auto unopenable = SqliteDatabase::open(dir / "no/such/folder/x.sqlite");
    ASSERT_FALSE(unopenable.ok());
    EXPECT_NE(unopenable.error().description().find(dir / "no/such/folder/x.sqlite"),
              std::string::npos);
}

TEST(SqliteDatabaseTest, TransactionsCommitOnceAndRollBackUnlessCommitted) {
    testing::TempDir dir;
    auto db = openIn(dir);
    ASSERT_TRUE(db);
    ASSERT_FALSE(db->exec("CREATE TABLE t(n INTEGER)"));

    {
        auto txn = db->begin();
        ASSERT_TRUE(txn.ok());
        ASSERT_FALSE(db->exec("INSERT INTO t VALUES(1)"));
    }  // abandoned
    EXPECT_EQ(db->queryInt64("SELECT count(*) FROM t").value(), 0);

    uint64_t commits = db->commitCount();
    {
        auto txn = db->begin();
        ASSERT_TRUE(txn.ok());
        auto insert = db->prepare("INSERT INTO t VALUES(?)");
        ASSERT_TRUE(insert.ok());
        for (int64_t i = 0; i < 100; ++i) ASSERT_FALSE(insert->bind(1, i).run());
        ASSERT_FALSE(txn->commit());
    }
    EXPECT_EQ(db->commitCount(), commits + 1);
    EXPECT_EQ(db->queryInt64("SELECT count(*) FROM t").value(), 100);

    // Without a transaction every statement commits on its own.
    ASSERT_FALSE(db->exec("INSERT INTO t VALUES(1); INSERT INTO t VALUES(2)"));
    EXPECT_EQ(db->commitCount(), commits + 3);

    // Nested BEGIN is refused rather than silently merged.
    auto outer = db->begin();
    ASSERT_TRUE(outer.ok());
    EXPECT_FALSE(db->begin().ok());
}

TEST(SqliteDatabaseTest, CachedStatementsComeBackResetAndUnbound) {
    testing::TempDir dir;
    auto db = openIn(dir);
    ASSERT_TRUE(db);
    ASSERT_FALSE(db->exec("CREATE TABLE t(n INTEGER); INSERT INTO t VALUES(1), (2), (3)"));
    const char* sql = "SELECT n FROM t WHERE n >= ? ORDER BY n";
    {
        auto stmt = db->cached(sql);
        ASSERT_TRUE(stmt.ok());
        ASSERT_TRUE(stmt->bind(1, int64_t{2}).step().value());
        EXPECT_EQ(stmt->columnInt64(0), 2);
    }  // left on a row
    {
        auto stmt = db->cached(sql);
        ASSERT_TRUE(stmt.ok());
        auto row = stmt->step();  // the old binding is gone: NULL matches nothing
        ASSERT_TRUE(row.ok());
        EXPECT_FALSE(row.value());
    }
    // A handle that goes lets go of its read transaction: dropping the table needs that.
    auto stmt = db->cached(sql);
    ASSERT_TRUE(stmt.ok());
    ASSERT_TRUE(stmt->bind(1, int64_t{1}).step().value());
    stmt = db->cached("SELECT 1");
    EXPECT_FALSE(db->exec("DROP TABLE t"));
}

}  // namespace
}  // namespace tamber
