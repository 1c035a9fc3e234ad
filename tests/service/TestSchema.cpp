#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

#include "service/Errors.h"
#include "service/Schema.h"
#include "support/TempDir.h"

namespace kest {
namespace {

TEST(SchemaTables, FindTableIgnoresCaseAndGivesTheSchemaSpelling) {
    for (const char* name : {"users", "USERS", "Users", "administertables", "listMinuteType"}) {
        const TableDef* def = findTable(name);
        ASSERT_NE(def, nullptr) << name;
    }
    EXPECT_EQ(findTable("uSeRs")->name, "Users");
}

TEST(SchemaTables, RefusesEveryNameOutsideTheSchema) {
    for (const char* name : {"Users; DROP TABLE Users", "\"Users\"", "[Users]", "Users ", " Users",
                             "_Sessions", "_Keys", "_SchemaVersion", "sqlite_master",
                             "sqlite_schema", "", "Users--", "main.Users"}) {
        EXPECT_EQ(findTable(name), nullptr) << name;
    }
    EXPECT_EQ(findTable(std::string_view("Users\0x", 7)), nullptr);
}

TEST(SchemaTables, EveryCheckedTableHasItsKeyFirst) {
    const std::vector<std::pair<const char*, const char*>> checked{
        {"DocumentID", "Documents"},
        {"EventID", "Events"},
        {"GroupID", "ListGroups"},
        {"HistoryID", "History"},
        {"MilestoneID", "Milestones"},
        {"MinuteID", "Minutes"},
        {"OptionID", "Options"},
        {"PasswordID", "PasswordHistory"},
        {"ProjectID", "Projects"},
        {"UnitID", "ListUnits"},
        {"UserID", "Users"},
        {"PhaseID", "ListPhases"},
        {"StatusID", "ListStatus"},
        {"ComplexityID", "ListComplexity"},
        {"DocumentStatusID", "ListDocumentStatus"},
        {"DocTypeID", "ListDocumentTypes"},
        {"MinuteStatusID", "ListMinuteType"},
        {"ProgrammeID", "ListProgrammes"},
        {"ListID", "AdministerTables"}};
    for (auto [key, table] : checked) {
        const TableDef* def = findTable(table);
        ASSERT_NE(def, nullptr) << table;
        EXPECT_EQ(def->key().name, key);
        EXPECT_EQ(def->key().type, ValueType::Integer);
        auto users = tablesWithKey(key);
        ASSERT_EQ(users.size(), 1u) << key;
        EXPECT_EQ(users[0], def);
    }
    EXPECT_EQ(publicTables().size(), checked.size());
    // ProjectID is a plain field of Documents, not its key.
    EXPECT_EQ(tablesWithKey("projectid").size(), 1u);
    EXPECT_TRUE(tablesWithKey("Name").empty());
}

TEST(SchemaTables, UsersHasEveryFieldWithItsType) {
    const TableDef* users = findTable("Users");
    ASSERT_NE(users, nullptr);
    const std::vector<std::pair<const char*, ValueType>> fields{
        {"UserID", ValueType::Integer},
        {"Name", ValueType::Text},
        {"Firstname", ValueType::Text},
        {"Lastname", ValueType::Text},
        {"Address", ValueType::Text},
        {"Description", ValueType::Text},
        {"Company", ValueType::Text},
        {"Email", ValueType::Text},
        {"Phone", ValueType::Text},
        {"Fax", ValueType::Text},
        {"Security", ValueType::Integer},
        {"Active", ValueType::Boolean},
        {"ExpiryDate", ValueType::Date},
        {"Password", ValueType::Double},
        {"PasswordChangeDate", ValueType::Date},
        {"PasswordLifetime", ValueType::Integer},
        {"PasswordMinLength", ValueType::Integer},
        {"PasswordRemember", ValueType::Integer},
        {"LogonLastDate", ValueType::Date},
        {"LogonFailDate", ValueType::Date},
        {"LogonFailCount", ValueType::Integer},
        {"CreatedBy", ValueType::Text},
        {"CreatedDate", ValueType::Date},
        {"UpdatedBy", ValueType::Text},
        {"UpdatedDate", ValueType::Date}};
    ASSERT_EQ(users->fields.size(), fields.size());
    for (auto [name, type] : fields) {
        const FieldDef* f = users->field(name);
        ASSERT_NE(f, nullptr) << name;
        EXPECT_EQ(f->type, type) << name;
    }
    EXPECT_EQ(users->field("PASSWORDCHANGEDATE")->name, "PasswordChangeDate");
    EXPECT_EQ(users->field("_rid"), nullptr);
    EXPECT_EQ(users->field("Name; --"), nullptr);
}

TEST(SchemaTables, QuoteIdentDoublesQuotes) {
    EXPECT_EQ(quoteIdent("Users"), "\"Users\"");
    EXPECT_EQ(quoteIdent("a\"b"), "\"a\"\"b\"");
}

class SchemaMigrationTest : public ::testing::Test {
protected:
    void SetUp() override {
        auto opened = openSqlite(dir.path() / "s.db", true);
        ASSERT_TRUE(opened.ok());
        db = std::move(opened.value());
    }
    std::set<std::string> tableNames() {
        std::set<std::string> names;
        EXPECT_TRUE(db->query("SELECT name FROM sqlite_master WHERE type = 'table'", {},
                              [&](const RowView& r) { names.insert(std::string(r.getText(0))); })
                        .ok());
        return names;
    }
    test::TempDir dir;
    std::unique_ptr<Connection> db;
};

TEST_F(SchemaMigrationTest, CreatesEveryTableOnAnEmptyDatabase) {
    auto before = schemaVersion(*db);
    ASSERT_TRUE(before.ok());
    EXPECT_EQ(before.value(), 0);
    auto st = migrate(*db);
    ASSERT_TRUE(st.ok()) << st.error().description;
    EXPECT_EQ(schemaVersion(*db).value(), kSchemaVersion);
    auto names = tableNames();
    for (const TableDef& def : publicTables()) {
        EXPECT_TRUE(names.count(def.name)) << def.name;
        // Each field is a column, plus the hidden row id.
        std::vector<Value> p{Value(def.name)};
        std::vector<std::string> columns;
        ASSERT_TRUE(db->query("SELECT name FROM pragma_table_info(?) ORDER BY cid", p,
                              [&](const RowView& r) { columns.emplace_back(r.getText(0)); })
                        .ok());
        ASSERT_EQ(columns.size(), def.fields.size() + 1) << def.name;
        EXPECT_EQ(columns[0], "_rid");
    }
    for (const char* internal : {"_SchemaVersion", "_Keys", "_Sessions"})
        EXPECT_TRUE(names.count(internal)) << internal;
}

TEST_F(SchemaMigrationTest, SecondRunChangesNothing) {
    ASSERT_TRUE(migrate(*db).ok());
    ASSERT_TRUE(db->execute("INSERT INTO Users (UserID, Name) VALUES (1, 'x')").ok());
    auto again = migrate(*db);
    ASSERT_TRUE(again.ok()) << again.error().description;
    EXPECT_EQ(schemaVersion(*db).value(), kSchemaVersion);
    int64_t n = 0;
    ASSERT_TRUE(db->query("SELECT count(*) FROM Users", {}, [&](const RowView& r) {
                      n = r.getInt(0);
                  }).ok());
    EXPECT_EQ(n, 1);
}

TEST_F(SchemaMigrationTest, RefusesANewerDatabase) {
    ASSERT_TRUE(migrate(*db).ok());
    ASSERT_TRUE(db->execute("UPDATE _SchemaVersion SET Version = Version + 1").ok());
    auto st = migrate(*db);
    ASSERT_FALSE(st.ok());
    EXPECT_EQ(st.error().number, err::kSchemaVersion);
    EXPECT_EQ(schemaVersion(*db).value(), kSchemaVersion + 1);
}

TEST_F(SchemaMigrationTest, KeysMayBeBrokenButUserNamesAreUnique) {
    ASSERT_TRUE(migrate(*db).ok());
    // Legacy keys: null, zero and duplicates must be storable until repaired.
    EXPECT_TRUE(db->execute("INSERT INTO Options (OptionID) VALUES (NULL), (0), (3), (3)").ok());
    ASSERT_TRUE(db->execute("INSERT INTO Users (UserID, Name) VALUES (1, 'Admin')").ok());
    auto dup = db->execute("INSERT INTO Users (UserID, Name) VALUES (2, 'aDMIN')");
    ASSERT_FALSE(dup.ok());
    EXPECT_EQ(dup.error().number, err::kStorage);
}

TEST_F(SchemaMigrationTest, FailedMigrationLeavesTheDatabaseEmpty) {
    // A table in the way makes version 1 fail half-way; nothing of it stays.
    ASSERT_TRUE(db->execute("CREATE TABLE Projects (x)").ok());
    ASSERT_FALSE(migrate(*db).ok());
    auto names = tableNames();
    EXPECT_EQ(names, std::set<std::string>{"Projects"});
}

}  // namespace
}  // namespace kest
