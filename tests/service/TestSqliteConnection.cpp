#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "service/Errors.h"
#include "service/SqliteConnection.h"
#include "support/TempDir.h"

namespace kest {
namespace {

class SqliteConnectionTest : public ::testing::Test {
protected:
    void SetUp() override {
        auto opened = openSqlite(dir.path() / "t.db", true);
        ASSERT_TRUE(opened.ok()) << opened.error().description;
        db = std::move(opened.value());
        ASSERT_TRUE(db->execute("CREATE TABLE t (id INTEGER, v)").ok());
    }

    // The single value of a one-row, one-column query, as text, with its type.
    std::pair<std::string, std::string> scalar(const std::string& sql,
                                               std::vector<Value> params = {}) {
        std::pair<std::string, std::string> out;
        auto st = db->query(sql, params, [&](const RowView& r) {
            out.first = std::string(r.getText(0));
            out.second = std::string(r.getText(1));
        });
        EXPECT_TRUE(st.ok()) << st.error().description;
        return out;
    }

    int64_t count(const std::string& table = "t") {
        int64_t n = -1;
        EXPECT_TRUE(db->query("SELECT count(*) FROM " + table, {}, [&](const RowView& r) {
                          n = r.getInt(0);
                      }).ok());
        return n;
    }

    test::TempDir dir;
    std::unique_ptr<Connection> db;
};

TEST_F(SqliteConnectionTest, BindsEveryTypeAsDocumented) {
    std::vector<Value> values{Value(true),           Value(false),  Value(int32_t{-42}), Value(2.5),
                              Value(Date{45000.75}), Value("text"), Value::null(),       Value()};
    for (std::size_t i = 0; i < values.size(); ++i) {
        std::vector<Value> p{Value(static_cast<int32_t>(i)), values[i]};
        ASSERT_TRUE(db->execute("INSERT INTO t VALUES (?, ?)", p).ok());
    }
    const char* expected[][2] = {{"-1", "integer"}, {"0", "integer"},     {"-42", "integer"},
                                 {"2.5", "real"},   {"45000.75", "real"}, {"text", "text"},
                                 {"", "null"},      {"", "null"}};
    for (std::size_t i = 0; i < values.size(); ++i) {
        auto [v, type] =
            scalar("SELECT v, typeof(v) FROM t WHERE id = ?", {Value(static_cast<int32_t>(i))});
        EXPECT_EQ(v, expected[i][0]) << i;
        EXPECT_EQ(type, expected[i][1]) << i;
    }
    int nulls = 0;
    ASSERT_TRUE(db->query("SELECT v FROM t WHERE id >= 6", {}, [&](const RowView& r) {
                      nulls += r.isNull(0) ? 1 : 0;
                  }).ok());
    EXPECT_EQ(nulls, 2);
}

TEST_F(SqliteConnectionTest, HostileTextIsStoredVerbatim) {
    const std::string hostile = "x'); DROP TABLE t; -- \"quoted\" ;\n\xc3\xa9";
    std::vector<Value> p{Value(int32_t{1}), Value(hostile)};
    ASSERT_TRUE(db->execute("INSERT INTO t VALUES (?, ?)", p).ok());
    EXPECT_EQ(scalar("SELECT v, 'x' FROM t").first, hostile);
    EXPECT_EQ(count(), 1);
}

TEST_F(SqliteConnectionTest, RefusesSeveralStatementsInOneCall) {
    auto st = db->execute("INSERT INTO t VALUES (1, 1); DROP TABLE t");
    ASSERT_FALSE(st.ok());
    EXPECT_EQ(st.error().number, err::kStorage);
    EXPECT_EQ(count(), 0);
    EXPECT_TRUE(db->execute("INSERT INTO t VALUES (1, 1);  ").ok());
}

TEST_F(SqliteConnectionTest, ReportsSqliteMessagesAndParameterMismatch) {
    auto st = db->execute("SELECT * FROM missing");
    ASSERT_FALSE(st.ok());
    EXPECT_EQ(st.error().number, err::kStorage);
    EXPECT_NE(st.error().description.find("no such table"), std::string::npos);

    std::vector<Value> one{Value(int32_t{1})};
    EXPECT_FALSE(db->execute("INSERT INTO t VALUES (?, ?)", one).ok());
    EXPECT_EQ(count(), 0);
}

TEST_F(SqliteConnectionTest, RollbackLeavesNothingAndCommitKeeps) {
    ASSERT_TRUE(db->begin().ok());
    ASSERT_TRUE(db->execute("INSERT INTO t VALUES (1, 'a')").ok());
    ASSERT_TRUE(db->rollback().ok());
    EXPECT_EQ(count(), 0);
    EXPECT_TRUE(db->rollback().ok()) << "a rollback without a transaction is harmless";

    ASSERT_TRUE(db->begin().ok());
    ASSERT_TRUE(db->execute("INSERT INTO t VALUES (1, 'a')").ok());
    ASSERT_TRUE(db->commit().ok());
    EXPECT_EQ(count(), 1);
}

TEST_F(SqliteConnectionTest, CountsChangedRows) {
    for (int i = 0; i < 5; ++i) {
        std::vector<Value> p{Value(int32_t{i}), Value(i % 2 == 0)};
        ASSERT_TRUE(db->execute("INSERT INTO t VALUES (?, ?)", p).ok());
    }
    int64_t changed = -1;
    ASSERT_TRUE(db->execute("UPDATE t SET v = 7 WHERE v = -1", {}, &changed).ok());
    EXPECT_EQ(changed, 3);
}

TEST_F(SqliteConnectionTest, NestedQueriesAndManyStatementsWork) {
    for (int i = 0; i < 3; ++i) {
        std::vector<Value> p{Value(int32_t{i}), Value(int32_t{i * 10})};
        ASSERT_TRUE(db->execute("INSERT INTO t VALUES (?, ?)", p).ok());
    }
    // The same statement run again from inside its own callback.
    const std::string sql = "SELECT id, v FROM t WHERE id >= ?";
    int inner = 0;
    std::vector<Value> from0{Value(int32_t{0})};
    ASSERT_TRUE(db->query(sql, from0, [&](const RowView& outer) {
                      std::vector<Value> p{Value(static_cast<int32_t>(outer.getInt(0)))};
                      ASSERT_TRUE(db->query(sql, p, [&](const RowView&) { ++inner; }).ok());
                  }).ok());
    EXPECT_EQ(inner, 3 + 2 + 1);

    // More distinct statements than the cache keeps.
    for (std::size_t i = 0; i < SqliteConnection::kStatementCacheSize * 2; ++i) {
        int64_t n = -1;
        ASSERT_TRUE(db->query("SELECT count(*) + " + std::to_string(i) + " FROM t", {},
                              [&](const RowView& r) { n = r.getInt(0); })
                        .ok());
        EXPECT_EQ(n, static_cast<int64_t>(3 + i));
    }
}

TEST_F(SqliteConnectionTest, OpensInWalModeWithForeignKeys) {
    EXPECT_EQ(scalar("SELECT journal_mode, 'x' FROM pragma_journal_mode").first, "wal");
    EXPECT_EQ(scalar("SELECT foreign_keys, 'x' FROM pragma_foreign_keys").first, "1");
    EXPECT_EQ(dynamic_cast<SqliteConnection&>(*db).dialect(), Dialect::SQLite);
    EXPECT_EQ(db->param(3), "?");
}

TEST(SqliteOpen, MissingFileIsAnErrorAndStaysMissing) {
    test::TempDir dir;
    auto file = dir.path() / "absent.db";
    auto opened = openSqlite(file, false);
    ASSERT_FALSE(opened.ok());
    EXPECT_EQ(opened.error().number, err::kStorage);
    EXPECT_FALSE(std::filesystem::exists(file));
}

TEST(SqliteOpen, RefusesAFileThatIsNoDatabase) {
    test::TempDir dir;
    auto file = dir.path() / "junk.db";
    std::ofstream(file) << std::string(4096, 'x');
    auto opened = openSqlite(file, false);
    ASSERT_FALSE(opened.ok());
    EXPECT_EQ(opened.error().number, err::kStorage);
}

TEST(SqliteOpen, SecondConnectionSeesCommittedData) {
    test::TempDir dir;
    auto file = dir.path() / "shared.db";
    auto a = openSqlite(file, true);
    ASSERT_TRUE(a.ok());
    ASSERT_TRUE(a.value()->execute("CREATE TABLE t (x)").ok());
    ASSERT_TRUE(a.value()->execute("INSERT INTO t VALUES (5)").ok());
    auto b = openSqlite(file, false);
    ASSERT_TRUE(b.ok()) << b.error().description;
    int64_t x = 0;
    ASSERT_TRUE(
        b.value()->query("SELECT x FROM t", {}, [&](const RowView& r) { x = r.getInt(0); }).ok());
    EXPECT_EQ(x, 5);
}

}  // namespace
}  // namespace kest
