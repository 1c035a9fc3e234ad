#include "remote/RemoteBusinessRules.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>

#include "recordset/Wire.h"
#include "remote/ObjectFactory.h"
#include "remote/RemoteServer.h"
#include "service/Connection.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Provisioning.h"
#include "service/TicketCache.h"
#include "support/TempDir.h"

namespace kest {
namespace {

using std::chrono::steady_clock;

// A data source served on loopback, and a logged-on remote object on it.
class RemoteBusinessRulesTest : public ::testing::Test {
protected:
    void SetUp() override {
        TicketCache::instance().clear();
        ASSERT_TRUE(initDataSource({dir_.path(), dsn_, "admin", "secret", false}).ok());
        core_ = std::make_shared<ServiceCore>(dir_.path());
        auto started = RemoteServer::start(core_, {});
        ASSERT_TRUE(started.ok()) << started.error().description;
        server_ = std::move(started.value());
        address_ = "127.0.0.1:" + std::to_string(server_->port());
        auto created = CreateObject(kBusinessRulesProgID, address_);
        ASSERT_TRUE(created.ok()) << created.error().description;
        bo_ = created.value();
    }
    void TearDown() override { unsetenv("KESTLOGON_CALL_TIMEOUT"); }

    void logOn(int expected = -1) {
        std::string user = "admin", password = "secret";
        RecordsetPtr record;
        auto logon = bo_->ValidLogon(dsn_, user, password, record);
        ASSERT_TRUE(logon.ok()) << logon.error().description;
        ASSERT_EQ(logon.value(), expected);
        ASSERT_TRUE(record);
    }

    std::filesystem::path databaseFile() const {
        auto config = findDataSource(dir_.path(), dsn_);
        EXPECT_TRUE(config.ok());
        return resolvePath(dir_.path(), config.value().database);
    }

    // Writes `count` events straight into the database, far quicker than
    // through the service.
    void insertEvents(int count) {
        auto db = openSqlite(databaseFile(), false);
        ASSERT_TRUE(db.ok()) << db.error().description;
        ASSERT_TRUE(db.value()
                        ->execute("WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n "
                                  "WHERE i < " +
                                  std::to_string(count) +
                                  ") INSERT INTO Events (EventID, Type, Date, Code, Text) "
                                  "SELECT 100000 + i, 'Test', 45000.25 + i / 86400.0, i, "
                                  "'event, \"number\" ' || i FROM n")
                        .ok());
    }

    test::TempDir dir_;
    std::string dsn_ = "Test";
    std::shared_ptr<ServiceCore> core_;
    std::unique_ptr<RemoteServer> server_;
    std::string address_;
    BusinessObjectPtr bo_;
};

TEST_F(RemoteBusinessRulesTest, LogsOnAndReadsATable) {
    std::string user = "ADMIN", password = "wrong";
    RecordsetPtr record;
    auto refused = bo_->ValidLogon(dsn_, user, password, record);
    ASSERT_TRUE(refused.ok());
    EXPECT_EQ(refused.value(), 0);

    auto beforeLogon = bo_->GetTable(dsn_, "Users");
    ASSERT_FALSE(beforeLogon.ok());
    EXPECT_EQ(beforeLogon.error().number, err::kNotLoggedOn);

    logOn(1);  // one failure came before
    auto users = bo_->GetTable(dsn_, "Users");
    ASSERT_TRUE(users.ok()) << users.error().description;
    ASSERT_EQ(users.value()->RecordCount(), 1);
    users.value()->MoveFirst();
    EXPECT_EQ(users.value()->Fields("name").Value().toText(), "admin");

    auto unknown = bo_->GetTable(dsn_, "Users; DROP TABLE Users");
    ASSERT_FALSE(unknown.ok());
    EXPECT_EQ(unknown.error().number, err::kUnknownTable);
}

TEST_F(RemoteBusinessRulesTest, ASecondObjectSharesTheLogonSession) {
    logOn();
    auto second = CreateObject(kBusinessRulesProgID, address_);
    ASSERT_TRUE(second.ok());
    auto id = second.value()->GetUniqueID(dsn_, "UserID");
    ASSERT_TRUE(id.ok()) << id.error().description;
    EXPECT_GT(id.value(), 1);
    std::string password = "new one";
    double moment = 45000.5;
    auto code = second.value()->PasswordCode(password, moment);
    ASSERT_TRUE(code.ok()) << code.error().description;
    EXPECT_GE(code.value(), 1.0);
}

TEST_F(RemoteBusinessRulesTest, ALargeTablePassesIntact) {
    constexpr int kEvents = 200'000;
    insertEvents(kEvents);
    logOn();
    auto events = bo_->GetTable(dsn_, "Events");
    ASSERT_TRUE(events.ok()) << events.error().description;
    const Recordset& rs = *events.value();
    EXPECT_GT(encodeRecordset(rs).size(), std::size_t{4} << 20);
    ASSERT_GE(rs.size(), std::size_t{kEvents});
    std::size_t checked = 0;
    for (std::size_t r = 0; r < rs.size(); ++r) {
        const int id = rs.cell(r, 0).toInt();
        if (id <= 100000 || id > 100000 + kEvents)
            continue;  // the service's own events
        const int i = id - 100000;
        ASSERT_EQ(rs.cell(r, rs.fieldIndex("Code")).toInt(), i);
        ASSERT_EQ(rs.cell(r, rs.fieldIndex("Text")).toText(),
                  "event, \"number\" " + std::to_string(i));
        ++checked;
    }
    EXPECT_EQ(checked, std::size_t{kEvents});
}

TEST_F(RemoteBusinessRulesTest, UpdateRSSettlesOnSuccessAndLeavesTheRecordsetOnFailure) {
    logOn();
    auto table = bo_->GetTable(dsn_, "Options");
    ASSERT_TRUE(table.ok());
    RecordsetPtr rs = table.value();
    auto id = bo_->GetUniqueID(dsn_, "OptionID");
    ASSERT_TRUE(id.ok());
    rs->AddNew();
    rs->Fields("OptionID").SetValue(id.value());
    rs->Fields("Item").SetValue("Colour");
    rs->Fields("Category").SetValue("Display");
    rs->Fields("Value").SetValue("blue");
    rs->Update();
    const Recordset* same = rs.get();
    std::string table_name = "Options";
    auto written = bo_->UpdateRS(dsn_, rs, table_name);
    ASSERT_TRUE(written.ok()) << written.error().description;
    EXPECT_EQ(written.value(), 1);
    EXPECT_EQ(rs.get(), same);
    EXPECT_EQ(rs->pendingCount(), 0u);

    // The same key again is a duplicate: refused, the record still pending.
    rs->AddNew();
    rs->Fields("OptionID").SetValue(id.value());
    rs->Fields("Item").SetValue("Again");
    rs->Update();
    auto refused = bo_->UpdateRS(dsn_, rs, table_name);
    ASSERT_FALSE(refused.ok());
    EXPECT_LT(refused.error().number, 0);
    EXPECT_EQ(rs->pendingCount(), 1u);

    auto reread = bo_->GetTable(dsn_, "Options");
    ASSERT_TRUE(reread.ok());
    reread.value()->MoveFirst();
    reread.value()->Find("Item = 'Colour'");
    EXPECT_GT(reread.value()->AbsolutePosition(), 0);
}

TEST_F(RemoteBusinessRulesTest, AStoppedServerIsAnErrorWithinTheDeadline) {
    logOn();
    setenv("KESTLOGON_CALL_TIMEOUT", "3", 1);
    server_->shutdown();
    server_->wait();
    const auto start = steady_clock::now();
    auto table = bo_->GetTable(dsn_, "Users");
    ASSERT_FALSE(table.ok());
    EXPECT_TRUE(table.error().number == err::kUnreachable || table.error().number == err::kTimeout)
        << table.error().number;
    EXPECT_NE(table.error().description.find(address_), std::string::npos);
    EXPECT_LT(steady_clock::now() - start, std::chrono::seconds(5));
}

TEST(RemoteBusinessRulesDeadline, ASilentServerTimesOut) {
    // Accepts connections (the kernel does, through the backlog) and never
    // says a word.
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ASSERT_EQ(listen(fd, 8), 0);
    socklen_t len = sizeof addr;
    getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
    const std::string server = "127.0.0.1:" + std::to_string(ntohs(addr.sin_port));

    setenv("KESTLOGON_CALL_TIMEOUT", "1", 1);
    RemoteBusinessRules bo(server, RemoteBusinessRules::makeChannel(server));
    const auto start = steady_clock::now();
    const Status answered = bo.Version(false);
    const auto elapsed = steady_clock::now() - start;
    unsetenv("KESTLOGON_CALL_TIMEOUT");
    close(fd);
    ASSERT_FALSE(answered.ok());
    EXPECT_TRUE(answered.error().number == err::kTimeout ||
                answered.error().number == err::kUnreachable);
    EXPECT_NE(answered.error().description.find(server), std::string::npos);
    EXPECT_LT(elapsed, std::chrono::seconds(4));
}

}  // namespace
}  // namespace kest
