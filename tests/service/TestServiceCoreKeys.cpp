#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <utility>
#include <vector>

#include "service/Errors.h"
#include "support/ServiceFixture.h"

namespace kest::test {
namespace {

class ServiceCoreKeys : public ServiceFixture {
protected:
    void SetUp() override {
        ServiceFixture::SetUp();
        bo_ = admin();
    }
    // Rows planted behind the service's back, as an older program left them.
    void plant(const std::string& sql) {
        auto db = direct();
        ASSERT_TRUE(db);
        Status s = db->execute(sql);
        ASSERT_TRUE(s.ok()) << s.error().description;
    }
    std::vector<int64_t> keys(const std::string& key, const std::string& table) {
        std::vector<int64_t> out;
        auto db = direct();
        Status s = db->query(
            "SELECT " + key + " FROM " + table + " ORDER BY _rid", {},
            [&](const RowView& row) { out.push_back(row.isNull(0) ? -999 : row.getInt(0)); });
        EXPECT_TRUE(s.ok());
        return out;
    }
    BusinessObjectPtr bo_;
    std::string db_ = "Test";
};

TEST_P(ServiceCoreKeys, UniqueIdsAreDistinctAndAboveEveryKey) {
    plant("INSERT INTO Users (UserID, Name) VALUES (500, 'planted')");
    auto a = bo_->GetUniqueID(db_, "UserID");
    auto b = bo_->GetUniqueID(db_, "userid");
    ASSERT_TRUE(a.ok() && b.ok());
    EXPECT_GT(a.value(), 500);
    EXPECT_GT(b.value(), a.value());
    auto c = bo_->GetUniqueID(db_, "OptionID");
    ASSERT_TRUE(c.ok());
    EXPECT_GT(c.value(), scalar("SELECT MAX(OptionID) FROM Options"));
}

TEST_P(ServiceCoreKeys, OnlyKeyFieldsHaveIds) {
    for (std::string field : {"Name", "Nothing", "", "UserID; DROP TABLE Users", "\"UserID\""}) {
        auto r = bo_->GetUniqueID(db_, field);
        ASSERT_FALSE(r.ok()) << field;
        EXPECT_EQ(r.error().number, err::kUnknownField);
    }
    EXPECT_GE(scalar("SELECT COUNT(*) FROM Users"), 1);
}

TEST_P(ServiceCoreKeys, RepairGivesBrokenKeysFreshOnesAndLogsEach) {
    plant(
        "INSERT INTO ListUnits (UnitID, Name, Active) VALUES "
        "(NULL, 'a', -1), (0, 'b', -1), (-3, 'c', 0), (7, 'd', -1), (7, 'e', -1), (9, 'f', 0)");
    int64_t eventsBefore = events("Identifier repaired");
    auto fixed = bo_->ValidateID(db_, "UnitID", "ListUnits");
    ASSERT_TRUE(fixed.ok()) << fixed.error().description;
    EXPECT_EQ(fixed.value(), 4);
    auto after = keys("UnitID", "ListUnits");
    ASSERT_EQ(after.size(), 6u);
    EXPECT_EQ(after[3], 7);  // the first holder of a key keeps it
    EXPECT_EQ(after[5], 9);
    EXPECT_EQ(std::set<int64_t>(after.begin(), after.end()).size(), 6u);
    for (int64_t k : after)
        EXPECT_GT(k, 0);
    EXPECT_EQ(events("Identifier repaired"), eventsBefore + 4);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Events WHERE Code = 4 AND Text LIKE '%ListUnits%'"), 4);
    auto next = bo_->GetUniqueID(db_, "UnitID");
    ASSERT_TRUE(next.ok());
    EXPECT_GT(next.value(), *std::max_element(after.begin(), after.end()));

    // Repaired once, clean afterwards.
    auto again = bo_->ValidateID(db_, "unitid", "listunits");
    ASSERT_TRUE(again.ok());
    EXPECT_EQ(again.value(), 0);
    EXPECT_EQ(keys("UnitID", "ListUnits"), after);
}

TEST_P(ServiceCoreKeys, ACleanDatabaseIsLeftAlone) {
    const std::vector<std::pair<std::string, std::string>> checked = {
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
        {"ProgrammeID", "ListProgrammes"}};
    int64_t eventsBefore = scalar("SELECT COUNT(*) FROM Events");
    int64_t countersBefore = scalar("SELECT COUNT(*) FROM _Keys");
    int64_t nextBefore = scalar("SELECT SUM(Next) FROM _Keys");
    for (const auto& [key, table] : checked) {
        auto r = bo_->ValidateID(db_, key, table);
        ASSERT_TRUE(r.ok()) << table << ": " << r.error().description;
        EXPECT_EQ(r.value(), 0) << table;
    }
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM Events"), eventsBefore);
    EXPECT_EQ(scalar("SELECT COUNT(*) FROM _Keys"), countersBefore);
    EXPECT_EQ(scalar("SELECT SUM(Next) FROM _Keys"), nextBefore);
}

TEST_P(ServiceCoreKeys, RepairRefusesWrongNames) {
    auto wrongKey = bo_->ValidateID(db_, "UserID", "ListUnits");
    ASSERT_FALSE(wrongKey.ok());
    EXPECT_EQ(wrongKey.error().number, err::kUnknownField);
    for (std::string table : {"Nothing", "Users; DROP TABLE Users", "_Keys", "_Sessions",
                              "Users\" --", "sqlite_master"}) {
        auto r = bo_->ValidateID(db_, "UserID", table);
        ASSERT_FALSE(r.ok()) << table;
        EXPECT_EQ(r.error().number, err::kUnknownTable) << table;
    }
    EXPECT_GE(scalar("SELECT COUNT(*) FROM Users"), 1);
}

INSTANTIATE_TEST_SUITE_P(Modes, ServiceCoreKeys, testing::Values(Mode::Local, Mode::Remote),
                         modeName);

}  // namespace
}  // namespace kest::test
