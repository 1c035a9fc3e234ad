#include <gtest/gtest.h>

#include <cmath>

#include "service/Errors.h"
#include "service/LocalBusinessRules.h"
#include "service/Provisioning.h"
#include "service/ServiceCore.h"
#include "service/TicketCache.h"
#include "support/ServiceFixture.h"
#include "support/TempDir.h"

namespace kest::test {
namespace {

class ServiceCoreRights : public ServiceFixture {
protected:
    // Every operation that needs an administrator's session, each expected
    // to fail with `number`.
    void expectAllRefused(BusinessObjectPtr bo, int32_t number) {
        std::string db = dsn_;
        auto table = bo->GetTable(db, "Users");
        ASSERT_FALSE(table.ok());
        EXPECT_EQ(table.error().number, number) << table.error().description;
        auto key = bo->GetUniqueID(db, "UserID");
        ASSERT_FALSE(key.ok());
        EXPECT_EQ(key.error().number, number);
        auto repaired = bo->ValidateID(db, "UserID", "Users");
        ASSERT_FALSE(repaired.ok());
        EXPECT_EQ(repaired.error().number, number);
        RecordsetPtr rs = std::make_shared<Recordset>(
            std::vector<FieldDef>{{"OptionID", ValueType::Integer, false}, {"Item"}});
        rs->AddNew();
        rs->Fields("Item").SetValue(Value("x"));
        rs->Update();
        std::string name = "Options";
        auto written = bo->UpdateRS(db, rs, name);
        ASSERT_FALSE(written.ok());
        EXPECT_EQ(written.error().number, number);
        EXPECT_EQ(rs->pendingCount(), 1u);
        std::string pw = "x";
        double moment = 45000;
        auto code = bo->PasswordCode(pw, moment);
        ASSERT_FALSE(code.ok());
        EXPECT_EQ(code.error().number, number);
        EXPECT_EQ(scalar("SELECT COUNT(*) FROM Options"), optionsBefore_);
    }
    void SetUp() override {
        ServiceFixture::SetUp();
        optionsBefore_ = scalar("SELECT COUNT(*) FROM Options");
    }
    int64_t optionsBefore_ = 0;
};

TEST_P(ServiceCoreRights, WithoutALogonEverythingIsRefused) {
    expectAllRefused(object(), err::kNotLoggedOn);
}

TEST_P(ServiceCoreRights, OnlySecurityEightMayAdminister) {
    addUser({.name = "worker", .password = "pw", .security = 4});
    ASSERT_EQ(logon("worker", "pw"), -1);
    expectAllRefused(object(), err::kAccessDenied);
}

TEST_P(ServiceCoreRights, RightsAreReadAtEveryCall) {
    int32_t id = addUser({.name = "boss", .password = "pw"});
    ASSERT_EQ(logon("boss", "pw"), -1);
    std::string bossTicket = ticket();
    auto bo = object();
    std::string db = dsn_;
    ASSERT_TRUE(bo->GetTable(db, "Users").ok());

    auto adminObject = admin();
    auto users = adminObject->GetTable(db, "Users");
    ASSERT_TRUE(users.ok());
    RecordsetPtr rs = users.value();
    rs->MoveFirst();
    rs->Find("UserID = " + std::to_string(id));
    rs->Fields("Security").SetValue(Value(int32_t{4}));
    rs->Update();
    std::string table = "Users";
    ASSERT_TRUE(adminObject->UpdateRS(db, rs, table).ok());

    TicketCache::instance().put(serverKey(), dsn_, bossTicket);
    auto refused = bo->GetTable(db, "Users");
    ASSERT_FALSE(refused.ok());
    EXPECT_EQ(refused.error().number, err::kAccessDenied);
}

TEST_P(ServiceCoreRights, ALaterObjectSharesTheLogonsSession) {
    ASSERT_EQ(logon("admin", "secret"), -1);
    auto later = object();
    std::string db = "TEST";  // data source names ignore letter case
    EXPECT_TRUE(later->GetTable(db, "Events").ok());
    std::string pw = "abc";
    double moment = 45000.5;
    auto code = later->PasswordCode(pw, moment);
    ASSERT_TRUE(code.ok());
    EXPECT_GE(code.value(), 1.0);
    EXPECT_EQ(code.value(), std::floor(code.value()));
}

TEST_P(ServiceCoreRights, ForgedAndForeignTicketsAreRefused) {
    addDataSource("Other");
    ASSERT_EQ(logon("admin", "secret"), -1);
    std::string testTicket = ticket();
    auto bo = object();

    // The Test session presented for the Other data source.
    TicketCache::instance().put(serverKey(), "Other", testTicket);
    std::string other = "Other";
    auto foreign = bo->GetTable(other, "Users");
    ASSERT_FALSE(foreign.ok());
    EXPECT_EQ(foreign.error().number, err::kNotLoggedOn);

    TicketCache::instance().put(serverKey(), dsn_, dsn_ + "/" + std::string(64, '0'));
    std::string db = dsn_;
    auto forged = bo->GetTable(db, "Users");
    ASSERT_FALSE(forged.ok());
    EXPECT_EQ(forged.error().number, err::kNotLoggedOn);
}

TEST_P(ServiceCoreRights, TicketsAreNotStoredInTheDatabase) {
    ASSERT_EQ(logon("admin", "secret"), -1);
    std::string t = ticket();
    ASSERT_EQ(t.rfind(dsn_ + "/", 0), 0u);
    EXPECT_EQ(t.size(), dsn_.size() + 1 + 64);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM _Sessions"), 1);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM _Sessions WHERE Ticket = '" + t + "'"), 0);
}

INSTANTIATE_TEST_SUITE_P(Modes, ServiceCoreRights, testing::Values(Mode::Local, Mode::Remote),
                         modeName);

TEST(ServiceCoreSessions, AnIdleSessionExpires) {
    TempDir dir;
    InitOptions init{dir.path(), "Test", "admin", "secret", false};
    ASSERT_TRUE(initDataSource(init).ok());
    ServiceOptions options;
    options.sessionIdle = std::chrono::seconds(0);
    ServiceCore core(dir.path(), options);
    auto logon = core.validLogon("Test", "admin", "secret");
    ASSERT_TRUE(logon.ok());
    ASSERT_EQ(logon.value().result, -1);
    auto table = core.getTable(logon.value().ticket, "Test", "Users");
    ASSERT_FALSE(table.ok());
    EXPECT_EQ(table.error().number, err::kNotLoggedOn);
}

}  // namespace
}  // namespace kest::test
