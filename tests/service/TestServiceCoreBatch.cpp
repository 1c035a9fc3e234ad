#include <gtest/gtest.h>

#include "service/Errors.h"
#include "support/ServiceFixture.h"

namespace kest::test {
namespace {

class ServiceCoreBatch : public ServiceFixture {
protected:
    void SetUp() override {
        ServiceFixture::SetUp();
        bo_ = admin();
    }
    RecordsetPtr table(const std::string& name) {
        auto r = bo_->GetTable(db_, name);
        EXPECT_TRUE(r.ok()) << (r.ok() ? "" : r.error().description);
        return r.ok() ? r.value() : nullptr;
    }
    Result<int32_t> send(RecordsetPtr& rs, std::string name) {
        rs->SetFilter(1);
        auto r = bo_->UpdateRS(db_, rs, name);
        rs->SetFilter(0);
        return r;
    }
    void addOption(RecordsetPtr& rs, Value key, const std::string& item) {
        rs->AddNew();
        rs->Fields("OptionID").SetValue(key);
        rs->Fields("Item").SetValue(Value(item));
        rs->Fields("Category").SetValue(Value("Test"));
        rs->Fields("Value").SetValue(Value("v-" + item));
        rs->Update();
    }
    int64_t options() { return scalar("SELECT COUNT(*) FROM Options"); }
    void expectError(const Result<int32_t>& r, int32_t number) {
        ASSERT_FALSE(r.ok());
        EXPECT_EQ(r.error().number, number) << r.error().description;
    }
    BusinessObjectPtr bo_;
    std::string db_ = "Test";
};

TEST_P(ServiceCoreBatch, InsertUpdateAndDeleteAreWrittenAndSettled) {
    RecordsetPtr rs = table("Options");
    const int64_t before = options();
    auto id = bo_->GetUniqueID(db_, "OptionID");
    ASSERT_TRUE(id.ok());
    addOption(rs, Value(id.value()), "given");
    addOption(rs, Value::null(), "fresh");
    auto written = send(rs, "Options");
    ASSERT_TRUE(written.ok()) << written.error().description;
    EXPECT_EQ(written.value(), 2);
    EXPECT_EQ(rs->pendingCount(), 0u);
    EXPECT_EQ(options(), before + 2);
    rs->MoveFirst();
    rs->Find("Item = 'fresh'");
    ASSERT_GT(rs->AbsolutePosition(), 0);
    const int32_t freshKey = rs->Fields("OptionID").Value().toInt();
    EXPECT_GT(freshKey, id.value());
    EXPECT_EQ(scalar("SELECT OptionID FROM Options WHERE Item = 'fresh'"), freshKey);

    rs->Fields("Value").SetValue(Value("changed"));
    rs->Update();
    rs->MoveFirst();
    rs->Find("OptionID = " + std::to_string(id.value()));
    rs->Delete();
    written = send(rs, "Options");
    ASSERT_TRUE(written.ok()) << written.error().description;
    EXPECT_EQ(written.value(), 2);
    EXPECT_EQ(options(), before + 1);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Options WHERE Value = 'changed'"), 1);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Events WHERE Code = 5 AND Text LIKE "
                     "'Options: 0 inserted, 1 updated, 1 deleted by admin'"),
              1);
}

TEST_P(ServiceCoreBatch, ConcurrentChangeIsAConflictAndTheFirstChangeStays) {
    RecordsetPtr rs = table("Options");
    addOption(rs, Value::null(), "shared");
    ASSERT_TRUE(send(rs, "Options").ok());
    RecordsetPtr first = table("Options");
    RecordsetPtr second = table("Options");
    for (auto* r : {&first, &second}) {
        (*r)->MoveFirst();
        (*r)->Find("Item = 'shared'");
        (*r)->Fields("Value").SetValue(Value(r == &first ? "first" : "second"));
        (*r)->Update();
    }
    ASSERT_TRUE(send(first, "Options").ok());
    auto late = send(second, "Options");
    expectError(late, err::kConflict);
    EXPECT_NE(late.error().description.find("OptionID = "), std::string::npos);
    EXPECT_EQ(second->pendingCount(), 1u);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Options WHERE Value = 'first'"), 1);

    // Deleted meanwhile: the record is gone.
    first->MoveFirst();
    first->Find("Item = 'shared'");
    first->Delete();
    ASSERT_TRUE(send(first, "Options").ok());
    expectError(send(second, "Options"), err::kRecordGone);
}

TEST_P(ServiceCoreBatch, AFailingRecordLeavesTheWholeBatchUnwritten) {
    RecordsetPtr seed = table("Options");
    addOption(seed, Value::null(), "seed");
    ASSERT_TRUE(send(seed, "Options").ok());
    RecordsetPtr rs = table("Options");
    const int64_t before = options();
    const int64_t batchEvents = events("Batch update");
    addOption(rs, Value::null(), "one");
    addOption(rs, Value::null(), "two");
    addOption(rs, Value::null(), "clash");
    rs->MoveFirst();
    int32_t existing = static_cast<int32_t>(scalar("SELECT MIN(OptionID) FROM Options"));
    rs->Find("Item = 'clash'");
    rs->Fields("OptionID").SetValue(Value(existing));
    rs->Update();
    expectError(send(rs, "Options"), err::kDuplicateKey);
    EXPECT_EQ(options(), before);
    EXPECT_EQ(rs->pendingCount(), 3u);
    EXPECT_EQ(events("Batch update"), batchEvents);
    rs->MoveFirst();
    rs->Find("Item = 'one'");
    EXPECT_TRUE(rs->Fields("OptionID").Value().isNull());
}

TEST_P(ServiceCoreBatch, HostileTableAndFieldNamesAreRefused) {
    RecordsetPtr rs = table("Options");
    addOption(rs, Value::null(), "x");
    for (std::string name : {"Options; DROP TABLE Users", "Options\" --", "' OR 1=1 --", "_Keys",
                             "sqlite_master", ""}) {
        RecordsetPtr r = rs;
        expectError(send(r, name), err::kUnknownTable);
    }
    for (std::string field : {"Bogus", "Item\" = 1; --", "Value'); DROP TABLE Options; --"}) {
        RecordsetPtr bad = std::make_shared<Recordset>(
            std::vector<FieldDef>{{"OptionID", ValueType::Integer, false}, {"Item"}, {field}});
        bad->AddNew();
        bad->Fields(1).SetValue(Value("x"));
        bad->Update();
        auto r = send(bad, "Options");
        expectError(r, err::kUnknownField);
        EXPECT_NE(r.error().description.find(field), std::string::npos);
    }
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Options WHERE Item = 'x'"), 0);
    EXPECT_GE(scalar("SELECT COUNT(*) FROM Users"), 1);
}

TEST_P(ServiceCoreBatch, WrongTypesAreRefused) {
    RecordsetPtr rs = std::make_shared<Recordset>(
        std::vector<FieldDef>{{"UserID", ValueType::Integer, false}, {"Security"}});
    rs->AddNew();
    rs->Fields("Security").SetValue(Value("high"));
    rs->Update();
    const int64_t before = scalar("SELECT COUNT(*) FROM Users");
    auto r = send(rs, "Users");
    expectError(r, err::kWrongType);
    EXPECT_NE(r.error().description.find("Security"), std::string::npos);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Users"), before);
}

TEST_P(ServiceCoreBatch, UserNamesStayUniqueAndUserOneStays) {
    int32_t id = addUser({.name = "zoe", .password = "pw"});
    bo_ = admin();
    RecordsetPtr users = table("Users");
    users->AddNew();
    users->Fields("Name").SetValue(Value(" ZOE "));
    users->Update();
    auto dup = send(users, "Users");
    expectError(dup, err::kDuplicateUserName);
    EXPECT_NE(dup.error().description.find("ZOE"), std::string::npos);

    users = table("Users");
    users->Find("UserID = " + std::to_string(id));
    users->Fields("Name").SetValue(Value("Admin"));
    users->Update();
    expectError(send(users, "Users"), err::kDuplicateUserName);

    users = table("Users");
    users->Find("UserID = 1");
    users->Delete();
    expectError(send(users, "Users"), err::kAccessDenied);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Users WHERE UserID = 1"), 1);

    users = table("Users");
    users->Find("UserID = " + std::to_string(id));
    users->Delete();
    auto gone = send(users, "Users");
    ASSERT_TRUE(gone.ok()) << gone.error().description;
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Users WHERE Name = 'zoe'"), 0);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM PasswordHistory WHERE UserID = " + std::to_string(id)),
              0);
}

TEST_P(ServiceCoreBatch, UnchangedValuesWriteNothing) {
    RecordsetPtr rs = table("Options");
    addOption(rs, Value::null(), "same");
    ASSERT_TRUE(send(rs, "Options").ok());
    rs = table("Options");
    rs->Find("Item = 'same'");
    rs->Fields("Value").SetValue(Value("v-same"));
    rs->Update();
    auto r = send(rs, "Options");
    ASSERT_TRUE(r.ok());
    EXPECT_EQ(r.value(), 0);
    EXPECT_EQ(rs->pendingCount(), 0u);
}

TEST_P(ServiceCoreBatch, TablesComeBackTypedAndInStoredOrder) {
    RecordsetPtr users = table("Users");
    ASSERT_TRUE(users);
    EXPECT_EQ(users->RecordCount(), 1);
    users->MoveFirst();
    EXPECT_EQ(users->Fields("Active").Value().type(), ValueType::Boolean);
    EXPECT_TRUE(users->Fields("Active").Value().asBool());
    EXPECT_EQ(users->Fields("PasswordChangeDate").Value().type(), ValueType::Date);
    EXPECT_EQ(users->Fields("UserID").Value().type(), ValueType::Integer);
    auto missing = bo_->GetTable(db_, "Users; DROP TABLE Users");
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().number, err::kUnknownTable);
}

INSTANTIATE_TEST_SUITE_P(Modes, ServiceCoreBatch, testing::Values(Mode::Local, Mode::Remote),
                         modeName);

}  // namespace
}  // namespace kest::test
