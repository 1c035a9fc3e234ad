#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <cmath>
#include <fstream>
#include <map>
#include <set>
#include <string>

#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Password.h"
#include "service/Provisioning.h"
#include "service/Schema.h"
#include "support/TempDir.h"

namespace kest {
namespace {

class ProvisioningTest : public ::testing::Test {
protected:
    InitOptions options(const std::string& dsn, bool demo = false) {
        InitOptions o;
        o.dataDir = dir.path() / "data";
        o.dsn = dsn;
        o.adminName = "Admin";
        o.password = "Secret";
        o.demo = demo;
        return o;
    }
    std::unique_ptr<Connection> open(const std::string& dsn) {
        auto config = findDataSource(dir.path() / "data", dsn);
        EXPECT_TRUE(config.ok());
        auto db = openSqlite(resolvePath(dir.path() / "data", config.value().database), false);
        EXPECT_TRUE(db.ok());
        return std::move(db.value());
    }
    int64_t count(Connection& db, const std::string& sql) {
        int64_t n = -1;
        EXPECT_TRUE(db.query(sql, {}, [&](const RowView& r) { n = r.getInt(0); }).ok()) << sql;
        return n;
    }
    test::TempDir dir;
};

TEST_F(ProvisioningTest, CreatesTheDataSourceWithItsAdministrator) {
    auto st = initDataSource(options("Main"));
    ASSERT_TRUE(st.ok()) << st.error().description;
    auto config = findDataSource(dir.path() / "data", "main");
    ASSERT_TRUE(config.ok());
    EXPECT_EQ(config.value().driver, "sqlite");
    auto keyPath = resolvePath(dir.path() / "data", config.value().keyFile);
    struct stat info {};
    ASSERT_EQ(stat(keyPath.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    auto key = loadKeyFile(keyPath);
    ASSERT_TRUE(key.ok());

    auto db = open("Main");
    EXPECT_EQ(schemaVersion(*db).value(), kSchemaVersion);
    EXPECT_EQ(count(*db, "SELECT count(*) FROM Users"), 1);
    double password = 0, changed = 0;
    int64_t security = 0, active = 0, id = 0, fails = -1;
    std::string name, createdBy;
    ASSERT_TRUE(db->query("SELECT UserID, Name, Security, Active, Password, PasswordChangeDate, "
                          "LogonFailCount, CreatedBy FROM Users",
                          {},
                          [&](const RowView& r) {
                              id = r.getInt(0);
                              name = std::string(r.getText(1));
                              security = r.getInt(2);
                              active = r.getInt(3);
                              password = r.getDouble(4);
                              changed = r.getDouble(5);
                              fails = r.getInt(6);
                              createdBy = std::string(r.getText(7));
                          })
                    .ok());
    EXPECT_EQ(id, 1);
    EXPECT_EQ(name, "Admin");
    EXPECT_EQ(security, 8);
    EXPECT_EQ(active, -1);
    EXPECT_EQ(fails, 0);
    EXPECT_EQ(createdBy, "kestlogon");
    EXPECT_NEAR(changed, nowDate().days, 1.0 / 24);
    auto expected = passwordCode(key.value(), "secret", Date{changed});
    ASSERT_TRUE(expected.ok());
    EXPECT_EQ(password, expected.value());

    EXPECT_EQ(count(*db, "SELECT count(*) FROM AdministerTables"), 9);
    EXPECT_EQ(count(*db,
                    "SELECT count(*) FROM AdministerTables a WHERE Description <> '' AND "
                    "Name IN (SELECT name FROM sqlite_master)"),
              9);
    EXPECT_EQ(count(*db, "SELECT Next FROM _Keys WHERE KeyField = 'UserID'"), 2);
    EXPECT_EQ(count(*db, "SELECT Next FROM _Keys WHERE KeyField = 'ListID'"), 10);
    EXPECT_EQ(count(*db, "SELECT count(*) FROM _Keys"),
              static_cast<int64_t>(publicTables().size()));
}

TEST_F(ProvisioningTest, RefusesAnExistingNameAndLeavesItAlone) {
    ASSERT_TRUE(initDataSource(options("Main")).ok());
    auto before = findDataSource(dir.path() / "data", "Main").value();
    auto again = initDataSource(options("MAIN"));
    ASSERT_FALSE(again.ok());
    EXPECT_EQ(again.error().number, err::kBadArgument);
    auto db = open("Main");
    EXPECT_EQ(count(*db, "SELECT count(*) FROM Users"), 1);
    EXPECT_EQ(findDataSource(dir.path() / "data", "main").value().database, before.database);
}

TEST_F(ProvisioningTest, RefusesALeftoverDatabaseFileWithoutAnEntry) {
    std::filesystem::create_directories(dir.path() / "data");
    std::ofstream(dir.path() / "data" / "main.db") << "precious";
    auto st = initDataSource(options("Main"));
    ASSERT_FALSE(st.ok());
    EXPECT_EQ(findDataSource(dir.path() / "data", "Main").error().number, err::kUnknownDataSource);
    EXPECT_FALSE(std::filesystem::exists(dir.path() / "data" / "main.key"));
    std::ifstream in(dir.path() / "data" / "main.db");
    std::string content;
    in >> content;
    EXPECT_EQ(content, "precious");
}

TEST_F(ProvisioningTest, RefusesBadArgumentsBeforeCreatingAnything) {
    auto badName = options("a/../b");
    auto blank = options("Main");
    blank.password = "   ";
    auto noAdmin = options("Main");
    noAdmin.adminName = " ";
    for (const InitOptions& o : {badName, blank, noAdmin}) {
        auto st = initDataSource(o);
        ASSERT_FALSE(st.ok());
        EXPECT_EQ(st.error().number, err::kBadArgument);
    }
    EXPECT_FALSE(std::filesystem::exists(dir.path() / "data" / std::string(kDataSourcesFile)));
}

TEST_F(ProvisioningTest, DemoDataCoversEveryCase) {
    auto start = std::chrono::steady_clock::now();
    auto st = initDataSource(options("Demo", true));
    ASSERT_TRUE(st.ok()) << st.error().description;
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
    auto db = open("Demo");
    double now = nowDate().days;

    int64_t users = count(*db, "SELECT count(*) FROM Users");
    EXPECT_GE(users, 30);
    EXPECT_LE(users, 60);
    for (int level : {0, 1, 2, 4, 8})
        EXPECT_GT(
            count(*db, "SELECT count(*) FROM Users WHERE Security = " + std::to_string(level)), 0)
            << level;
    EXPECT_GT(count(*db, "SELECT count(*) FROM Users WHERE Active = 0"), 0);
    EXPECT_GT(count(*db, "SELECT count(*) FROM Users WHERE ExpiryDate > 0 AND ExpiryDate < " +
                             std::to_string(now)),
              0);
    EXPECT_GT(count(*db,
                    "SELECT count(*) FROM Users WHERE LogonFailCount > 0 AND "
                    "LogonFailDate IS NOT NULL"),
              0);
    EXPECT_GT(count(*db,
                    "SELECT count(*) FROM Users WHERE PasswordLifetime > 0 AND "
                    "PasswordChangeDate + PasswordLifetime < " +
                        std::to_string(now)),
              0);
    EXPECT_EQ(count(*db, "SELECT count(DISTINCT UserID) FROM Users WHERE UserID > 0"), users);
    EXPECT_EQ(count(*db, "SELECT count(*) FROM Users WHERE Password IS NULL OR Password = 0"), 0);
    EXPECT_EQ(count(*db, "SELECT Next FROM _Keys WHERE KeyField = 'UserID'"),
              count(*db, "SELECT max(UserID) + 1 FROM Users"));

    int64_t events = count(*db, "SELECT count(*) FROM Events");
    EXPECT_GE(events, 900);
    EXPECT_LE(events, 1100);
    const std::map<std::string, int> codes{{"Logon", 1},
                                           {"Logon failed", 2},
                                           {"Password changed", 3},
                                           {"Identifier repaired", 4},
                                           {"Batch update", 5}};
    std::set<std::string> types;
    ASSERT_TRUE(db->query("SELECT Type, Code, Date, Text FROM Events", {}, [&](const RowView& r) {
                      std::string type(r.getText(0));
                      types.insert(type);
                      ASSERT_TRUE(codes.count(type)) << type;
                      EXPECT_EQ(r.getInt(1), codes.at(type));
                      EXPECT_LE(r.getDouble(2), now + 1);
                      EXPECT_GT(r.getDouble(2), now - 400);
                      EXPECT_FALSE(r.getText(3).empty());
                  }).ok());
    EXPECT_EQ(types.size(), codes.size());

    int64_t options = count(*db, "SELECT count(*) FROM Options");
    EXPECT_GE(options, 10);
    EXPECT_LE(options, 20);
    EXPECT_GT(count(*db, "SELECT count(*) FROM Options WHERE Value = ''"), 0);
    EXPECT_GE(count(*db, "SELECT count(DISTINCT Category) FROM Options"), 3);

    ASSERT_TRUE(
        db->query("SELECT Name FROM AdministerTables", {}, [&](const RowView& r) {
              std::string list(r.getText(0));
              ASSERT_NE(findTable(list), nullptr);
              int64_t items = count(*db, "SELECT count(*) FROM " + quoteIdent(list));
              EXPECT_GE(items, 5) << list;
              EXPECT_LE(items, 12) << list;
              EXPECT_GT(
                  count(*db, "SELECT count(*) FROM " + quoteIdent(list) + " WHERE Active = 0"), 0)
                  << list;
          }).ok());
    for (const char* table : {"Projects", "Documents", "Milestones", "Minutes", "History"})
        EXPECT_GT(count(*db, std::string("SELECT count(*) FROM ") + table), 0) << table;
}

}  // namespace
}  // namespace kest
