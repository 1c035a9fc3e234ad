#include <gtest/gtest.h>

#include <chrono>

#include "recordset/Value.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/LocalBusinessRules.h"
#include "service/Provisioning.h"
#include "service/ServiceCore.h"
#include "support/ServiceFixture.h"
#include "support/TempDir.h"

namespace kest::test {
namespace {

class ServiceCoreLogon : public ServiceFixture {
protected:
    int32_t change(BusinessObjectPtr bo, RecordsetPtr& record, const std::string& oldPw,
                   const std::string& newPw) {
        std::string db = dsn_, o = oldPw, n = newPw;
        auto r = bo->ChangePassword(db, record, o, n);
        EXPECT_TRUE(r.ok()) << (r.ok() ? "" : r.error().description);
        return r.ok() ? r.value() : 99;
    }
    int64_t userField(int32_t id, const std::string& field) {
        return scalar("SELECT " + field + " FROM Users WHERE UserID = " + std::to_string(id));
    }
};

TEST_P(ServiceCoreLogon, AdminLogsOnAndGetsHisRecordWithoutThePassword) {
    RecordsetPtr record;
    ASSERT_EQ(logon("admin", "secret", &record), -1);
    ASSERT_TRUE(record);
    ASSERT_EQ(record->RecordCount(), 1);
    EXPECT_EQ(record->Fields("UserID").Value().toInt(), 1);
    EXPECT_EQ(record->Fields("Name").Value().toText(), "admin");
    EXPECT_EQ(record->Fields("Security").Value().toInt(), 8);
    EXPECT_EQ(record->fieldIndex("Firstname") >= 0 && record->fieldIndex("Lastname") >= 0 &&
                  record->fieldIndex("PasswordMinLength") >= 0,
              true);
    EXPECT_EQ(record->fieldIndex("Password"), -1);
    EXPECT_GT(userField(1, "LogonLastDate"), 0);
    EXPECT_EQ(events("Logon"), 1);
}

TEST_P(ServiceCoreLogon, NameIgnoresCaseAndPasswordIsTrimmedAndLowered) {
    EXPECT_EQ(logon("  ADMIN ", " SeCrEt  "), -1);
    EXPECT_EQ(logon("Admin", "secret"), -1);
}

TEST_P(ServiceCoreLogon, UnknownUserAndWrongPasswordAreRejectedAndLeaveTheRecordAlone) {
    auto bo = object();
    std::string db = dsn_, user = "nobody", pw = "secret";
    RecordsetPtr before = std::make_shared<Recordset>(std::vector<FieldDef>{{"X"}});
    RecordsetPtr record = before;
    auto r = bo->ValidLogon(db, user, pw, record);
    ASSERT_TRUE(r.ok());
    EXPECT_EQ(r.value(), 0);
    EXPECT_EQ(record, before);
    EXPECT_EQ(logon("admin", "wrong"), 0);
    EXPECT_EQ(logon("", ""), 0);
    EXPECT_EQ(events("Logon failed"), 3);
    EXPECT_EQ(events("Logon"), 0);
}

TEST_P(ServiceCoreLogon, InactiveAndExpiredAccountsAreRejected) {
    double today = nowDate().days;
    addUser({.name = "sleeper", .password = "pw", .active = false});
    addUser({.name = "gone", .password = "pw", .expiry = today - 1});
    addUser({.name = "lasts", .password = "pw", .expiry = today + 1});
    EXPECT_EQ(logon("sleeper", "pw"), 0);
    EXPECT_EQ(logon("gone", "pw"), 0);
    EXPECT_EQ(logon("lasts", "pw"), -1);
}

TEST_P(ServiceCoreLogon, FailuresAreCountedReportedOnceAndReset) {
    int32_t id = addUser({.name = "fumbler", .password = "right"});
    EXPECT_EQ(logon("fumbler", "wrong"), 0);
    EXPECT_EQ(logon("FUMBLER", "wrong"), 0);
    EXPECT_EQ(userField(id, "LogonFailCount"), 2);
    EXPECT_GT(userField(id, "LogonFailDate"), 0);
    EXPECT_EQ(logon("fumbler", "right"), 2);
    EXPECT_EQ(userField(id, "LogonFailCount"), 0);
    EXPECT_EQ(logon("fumbler", "right"), -1);
}

TEST_P(ServiceCoreLogon, OldPasswordMustBeChanged) {
    double longAgo = nowDate().days - 100;
    addUser({.name = "old", .password = "pw", .changed = longAgo, .lifetime = 30});
    addUser({.name = "fresh", .password = "pw", .changed = longAgo, .lifetime = 365});
    EXPECT_EQ(logon("old", "pw"), -2);
    EXPECT_EQ(logon("fresh", "pw"), -1);
}

TEST_P(ServiceCoreLogon, BlankPasswordGivesARestrictedSessionUntilChanged) {
    addUser({.name = "blank", .password = "", .blank = true});
    EXPECT_EQ(logon("blank", "anything"), 0);
    RecordsetPtr record;
    ASSERT_EQ(logon("blank", "  "), -2);
    auto bo = object();
    std::string db = dsn_;
    auto refused = bo->GetTable(db, "Users");
    ASSERT_FALSE(refused.ok());
    EXPECT_EQ(refused.error().number, err::kPasswordChangeRequired);
    ASSERT_EQ(logon("blank", "", &record), -2);
    ASSERT_TRUE(record);
    EXPECT_EQ(change(bo, record, "", "newpass"), -1);
    EXPECT_TRUE(bo->GetTable(db, "Users").ok());
    EXPECT_EQ(logon("blank", "newpass"), -1);
}

TEST_P(ServiceCoreLogon, ChangePasswordAnswersEachRule) {
    int32_t id = addUser({.name = "carol", .password = "one", .minLength = 3, .remember = 2});
    RecordsetPtr record;
    ASSERT_EQ(logon("carol", "one", &record), -1);
    auto bo = object();
    EXPECT_EQ(change(bo, record, "wrong", "four"), -3);
    EXPECT_EQ(change(bo, record, "one", " ab "), 0);
    EXPECT_EQ(change(bo, record, "one", "one"), -4);
    EXPECT_EQ(change(bo, record, "one", "two"), -1);
    EXPECT_EQ(change(bo, record, "two", "three"), -1);
    EXPECT_EQ(change(bo, record, "three", "TWO"), -4);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM PasswordHistory WHERE UserID = " + std::to_string(id)),
              2);
    // "one" has dropped out of the two remembered passwords.
    EXPECT_EQ(change(bo, record, "three", "one"), -1);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->Fields("UserID").Value().toInt(), id);
    EXPECT_EQ(record->fieldIndex("Password"), -1);
    EXPECT_EQ(logon("carol", "three"), 0);
    // The refused attempt just before counts as one failure since the last logon.
    EXPECT_EQ(logon("carol", "one"), 1);
    EXPECT_EQ(events("Password changed"), 3);
}

TEST_P(ServiceCoreLogon, WithoutRememberTheSamePasswordMayBeKept) {
    int32_t id = addUser({.name = "dave", .password = "same"});
    RecordsetPtr record;
    ASSERT_EQ(logon("dave", "same", &record), -1);
    EXPECT_EQ(change(object(), record, "same", "same"), -1);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM PasswordHistory WHERE UserID = " + std::to_string(id)),
              1);
}

TEST_P(ServiceCoreLogon, OldPasswordAloneAllowsAChangeAndOpensASession) {
    addUser({.name = "erin", .password = "before"});
    forgetTickets();
    auto bo = object();
    auto record = std::make_shared<Recordset>(
        std::vector<FieldDef>{{"UserID", ValueType::Integer, false}, {"Name"}});
    record->appendRecord();
    record->cellRef(0, 0) = Value::null();
    record->cellRef(0, 1) = Value("ERIN");
    RecordsetPtr r = record;
    EXPECT_EQ(change(bo, r, "wrong", "after"), -3);
    EXPECT_EQ(change(bo, r, "before", "after"), -1);
    std::string db = dsn_;
    EXPECT_TRUE(bo->GetTable(db, "Options").ok());
    EXPECT_EQ(logon("erin", "after"), -1);
}

TEST_P(ServiceCoreLogon, UnknownDataSourceIsAnErrorAndCreatesNothing) {
    auto before = std::distance(std::filesystem::directory_iterator(dataDir()),
                                std::filesystem::directory_iterator());
    auto bo = object();
    std::string db = "Nowhere", user = "admin", pw = "secret";
    RecordsetPtr record;
    auto r = bo->ValidLogon(db, user, pw, record);
    ASSERT_FALSE(r.ok());
    EXPECT_EQ(r.error().number, err::kUnknownDataSource);
    EXPECT_FALSE(r.error().description.empty());
    auto after = std::distance(std::filesystem::directory_iterator(dataDir()),
                               std::filesystem::directory_iterator());
    EXPECT_EQ(before, after);
}

INSTANTIATE_TEST_SUITE_P(Modes, ServiceCoreLogon, testing::Values(Mode::Local, Mode::Remote),
                         modeName);

// The slowing down of repeated failures, on a core with short delays.
TEST(ServiceCoreLogonDelay, RepeatedFailuresSlowDownAndSuccessResets) {
    TempDir dir;
    InitOptions init{dir.path(), "Test", "admin", "secret", false};
    ASSERT_TRUE(initDataSource(init).ok());
    ServiceOptions options;
    options.failuresBeforeDelay = 1;
    options.delayStep = std::chrono::milliseconds(150);
    options.delayMax = std::chrono::milliseconds(200);
    ServiceCore core(dir.path(), options);
    auto timed = [&](const std::string& pw) {
        auto start = std::chrono::steady_clock::now();
        auto r = core.validLogon("Test", "admin", pw);
        EXPECT_TRUE(r.ok());
        auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(
            std::chrono::steady_clock::now() - start);
        return std::make_pair(r.ok() ? r.value().result : 99, ms.count());
    };
    auto first = timed("x");
    EXPECT_EQ(first.first, 0);
    EXPECT_LT(first.second, 150);
    auto second = timed("x");
    EXPECT_GE(second.second, 150);
    auto third = timed("x");
    EXPECT_GE(third.second, 200);
    auto right = timed("secret");
    EXPECT_EQ(right.first, 3);  // never locked out
    auto again = timed("x");
    EXPECT_LT(again.second, 150);
}

}  // namespace
}  // namespace kest::test
