#include <gtest/gtest.h>

#include "recordset/Recordset.h"

namespace kest {
namespace {

// A small users table: UserID, Name, Security, Active, Expiry.
Recordset makeUsers() {
    Recordset rs({{"UserID", ValueType::Integer, false},
                  {"Name", ValueType::Text, true},
                  {"Security", ValueType::Integer, true},
                  {"Active", ValueType::Boolean, true},
                  {"ExpiryDate", ValueType::Date, true}});
    struct Row {
        int32_t id;
        const char* name;
        int32_t security;
    };
    for (Row row :
         {Row{1, "admin", 8}, Row{2, "O'Brien", 4}, Row{3, "smith", 2}, Row{4, "Jones", 8}}) {
        rs.appendRecord();
        std::size_t r = rs.size() - 1;
        rs.cellRef(r, 0) = Value(row.id);
        rs.cellRef(r, 1) = Value(row.name);
        rs.cellRef(r, 2) = Value(row.security);
        rs.cellRef(r, 3) = Value(true);
        rs.cellRef(r, 4) = Value::null();
    }
    rs.MoveFirst();
    return rs;
}

TEST(RecordsetFields, LookupIgnoresCaseAndRejectsUnknownNames) {
    Recordset rs = makeUsers();
    EXPECT_EQ(rs.Fields("name").Value(), Value("admin"));
    EXPECT_EQ(rs.Fields("NAME").Name(), "Name");
    EXPECT_EQ(rs.fieldIndex("security"), 2);
    EXPECT_EQ(rs.fieldIndex("Nope"), -1);
    EXPECT_THROW(rs.Fields("Nope"), RecordsetError);
    EXPECT_THROW(rs.Fields(5), RecordsetError);
    EXPECT_THROW(Recordset({{"a", ValueType::Text, true}, {"A", ValueType::Integer, true}}),
                 RecordsetError);
}

TEST(RecordsetFields, SetValueConvertsOrLeavesTheCellAlone) {
    Recordset rs = makeUsers();
    rs.Fields("Security").SetValue(Value("12"));
    EXPECT_EQ(rs.Fields("Security").Value().type(), ValueType::Integer);
    EXPECT_EQ(rs.Fields("Security").Value().asInt(), 12);
    EXPECT_THROW(rs.Fields("Security").SetValue(Value("abc")), ConversionError);
    EXPECT_THROW(rs.Fields("Security").SetValue(Value("")), ConversionError);
    EXPECT_THROW(rs.Fields("ExpiryDate").SetValue(Value("")), ConversionError);
    EXPECT_EQ(rs.Fields("Security").Value().asInt(), 12);
    rs.Fields("ExpiryDate").SetValue(Value("2026-02-28"));
    EXPECT_EQ(rs.Fields("ExpiryDate").Value(), Value(makeDate(2026, 2, 28)));
    rs.Fields("Active").SetValue(Value(int32_t{0}));
    EXPECT_EQ(rs.Fields("Active").Value(), Value(false));
}

TEST(RecordsetFields, NoCurrentRecordIsAnError) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(4);
    rs.MoveNext();
    EXPECT_TRUE(rs.Eof());
    EXPECT_THROW(rs.Fields("Name").Value(), RecordsetError);
    EXPECT_THROW(rs.Fields("Name").SetValue(Value("x")), RecordsetError);
    EXPECT_THROW(rs.Status(), RecordsetError);
    EXPECT_THROW(rs.MoveNext(), RecordsetError);
    Recordset empty({{"ID", ValueType::Integer, false}});
    empty.MoveFirst();
    EXPECT_TRUE(empty.Eof());
    EXPECT_TRUE(empty.Bof());
    EXPECT_THROW(empty.Delete(), RecordsetError);
}

TEST(RecordsetState, ModifyKeepsTheOriginalValues) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(2);
    EXPECT_EQ(rs.Status(), 8);
    rs.Fields("Name").SetValue(Value("Murphy"));
    rs.Fields("Name").SetValue(Value("Kelly"));
    rs.Update();
    EXPECT_EQ(rs.Status(), 2);
    EXPECT_EQ(rs.Fields("Name").Value(), Value("Kelly"));
    EXPECT_EQ(rs.Fields("Name").OriginalValue(), Value("O'Brien"));
    EXPECT_EQ(rs.Fields("Security").OriginalValue(), Value(int32_t{4}));
    EXPECT_TRUE(rs.hasOriginals(1));
    EXPECT_FALSE(rs.hasOriginals(0));
    EXPECT_EQ(rs.original(0, 1), Value("admin"));
    EXPECT_EQ(rs.pendingCount(), 1U);
    // Deleting a modified record keeps what the service must check against.
    rs.Delete();
    EXPECT_EQ(rs.Status(), 4);
    EXPECT_EQ(rs.original(1, 1), Value("O'Brien"));
    EXPECT_THROW(rs.Fields("Name").SetValue(Value("x")), RecordsetError);
}

TEST(RecordsetState, AddNewThenDeleteDropsTheRecord) {
    Recordset rs = makeUsers();
    rs.AddNew();
    EXPECT_EQ(rs.Status(), 1);
    EXPECT_EQ(rs.AbsolutePosition(), 5);
    EXPECT_TRUE(rs.Fields("Name").Value().isNull());
    rs.Fields("UserID").SetValue(Value(int32_t{9}));
    rs.Update();
    EXPECT_EQ(rs.Status(), 1);
    EXPECT_EQ(rs.RecordCount(), 5);
    rs.Delete();
    EXPECT_EQ(rs.RecordCount(), 4);
    EXPECT_TRUE(rs.Eof());
    EXPECT_EQ(rs.pendingCount(), 0U);

    // A new record in the middle: the position moves to the following one.
    rs.AddNew();
    rs.AddNew();
    rs.Fields("UserID").SetValue(Value(int32_t{11}));
    rs.SetAbsolutePosition(5);
    rs.Delete();
    EXPECT_EQ(rs.RecordCount(), 5);
    EXPECT_EQ(rs.AbsolutePosition(), 5);
    EXPECT_EQ(rs.Fields("UserID").Value(), Value(int32_t{11}));
}

TEST(RecordsetState, DeletedRecordsStayCountedUntilSettled) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(3);
    rs.Delete();
    EXPECT_EQ(rs.Status(), 4);
    EXPECT_EQ(rs.RecordCount(), 4);
    EXPECT_EQ(rs.AbsolutePosition(), 3);
    rs.MoveFirst();
    int seen = 0;
    int deleted = 0;
    for (; !rs.Eof(); rs.MoveNext()) {
        ++seen;
        if (rs.Status() == 4)
            ++deleted;
    }
    EXPECT_EQ(seen, 4);
    EXPECT_EQ(deleted, 1);
}

TEST(RecordsetState, FilterShowsPendingRecordsOnly) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(2);
    rs.Fields("Security").SetValue(Value(int32_t{1}));
    rs.SetAbsolutePosition(4);
    rs.Delete();
    rs.AddNew();
    rs.Fields("UserID").SetValue(Value(int32_t{5}));

    rs.SetFilter(1);
    EXPECT_EQ(rs.Filter(), 1);
    EXPECT_EQ(rs.RecordCount(), 3);
    EXPECT_EQ(rs.AbsolutePosition(), 1);
    EXPECT_EQ(rs.Fields("UserID").Value(), Value(int32_t{2}));
    rs.MoveNext();
    EXPECT_EQ(rs.Status(), 4);
    EXPECT_EQ(rs.AbsolutePosition(), 2);
    rs.SetAbsolutePosition(3);
    EXPECT_EQ(rs.Status(), 1);
    EXPECT_THROW(rs.SetAbsolutePosition(4), RecordsetError);
    EXPECT_THROW(rs.SetAbsolutePosition(0), RecordsetError);

    rs.SetFilter(0);
    EXPECT_EQ(rs.RecordCount(), 5);
    EXPECT_EQ(rs.AbsolutePosition(), 1);
    EXPECT_THROW(rs.SetFilter(2), RecordsetError);

    Recordset clean = makeUsers();
    clean.SetFilter(1);
    EXPECT_EQ(clean.RecordCount(), 0);
    EXPECT_TRUE(clean.Eof());
    EXPECT_TRUE(clean.Bof());
}

TEST(RecordsetState, SettleAcceptsEveryChange) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(1);
    rs.Fields("Name").SetValue(Value("root"));
    rs.SetAbsolutePosition(2);
    rs.Delete();
    rs.AddNew();
    rs.Fields("UserID").SetValue(Value(int32_t{5}));
    rs.SetFilter(1);
    rs.settle();
    EXPECT_EQ(rs.size(), 4U);
    EXPECT_EQ(rs.pendingCount(), 0U);
    EXPECT_EQ(rs.RecordCount(), 0);  // still filtered
    rs.SetFilter(0);
    EXPECT_EQ(rs.AbsolutePosition(), 1);
    EXPECT_EQ(rs.Fields("Name").Value(), Value("root"));
    EXPECT_EQ(rs.Fields("Name").OriginalValue(), Value("root"));
    EXPECT_EQ(rs.Status(), 8);
    EXPECT_EQ(rs.cell(1, 0), Value(int32_t{3}));
    EXPECT_EQ(rs.cell(3, 0), Value(int32_t{5}));
    for (std::size_t r = 0; r < rs.size(); ++r)
        EXPECT_FALSE(rs.hasOriginals(r));
}

TEST(RecordsetState, MergeSettledTakesTheServiceValues) {
    Recordset rs = makeUsers();
    rs.SetAbsolutePosition(2);
    rs.Fields("Name").SetValue(Value("Murphy"));
    rs.SetAbsolutePosition(3);
    rs.Delete();
    rs.AddNew();
    rs.Fields("Name").SetValue(Value("new"));

    // What the service hands back: the kept pending records, settled, with the
    // key it gave the new one.
    Recordset settled(rs.fieldDefs());
    for (std::size_t r : {1U, 4U}) {
        settled.appendRecord();
        for (int f = 0; f < rs.FieldCount(); ++f) {
            settled.cellRef(settled.size() - 1, f) = rs.cell(r, f);
        }
    }
    settled.cellRef(1, 0) = Value(int32_t{77});

    Recordset wrongCount(rs.fieldDefs());
    wrongCount.appendRecord();
    EXPECT_THROW(rs.mergeSettled(wrongCount), RecordsetError);
    Recordset wrongShape({{"UserID", ValueType::Integer, false}});
    EXPECT_THROW(rs.mergeSettled(wrongShape), RecordsetError);
    EXPECT_EQ(rs.pendingCount(), 3U);  // the failures changed nothing

    rs.mergeSettled(settled);
    EXPECT_EQ(rs.size(), 4U);
    EXPECT_EQ(rs.pendingCount(), 0U);
    EXPECT_EQ(rs.cell(1, 1), Value("Murphy"));
    EXPECT_EQ(rs.cell(3, 0), Value(int32_t{77}));
    EXPECT_EQ(rs.cell(3, 1), Value("new"));
}

TEST(RecordsetFind, NumbersAndQuotedText) {
    Recordset rs = makeUsers();
    rs.Find("UserID = 3");
    EXPECT_EQ(rs.AbsolutePosition(), 3);
    rs.MoveFirst();
    rs.Find("  userid=4  ");
    EXPECT_EQ(rs.AbsolutePosition(), 4);
    rs.MoveFirst();
    rs.Find("Name = 'o''brien'");
    EXPECT_EQ(rs.AbsolutePosition(), 2);
    rs.MoveFirst();
    rs.Find("Name = \"JONES\"");
    EXPECT_EQ(rs.AbsolutePosition(), 4);
    rs.MoveFirst();
    rs.Find("Security = 8.0");
    EXPECT_EQ(rs.AbsolutePosition(), 1);
    // Forward from the current record, inclusive.
    rs.Find("Security = 8");
    EXPECT_EQ(rs.AbsolutePosition(), 1);
    rs.MoveNext();
    rs.Find("Security = 8");
    EXPECT_EQ(rs.AbsolutePosition(), 4);
    rs.MoveFirst();
    rs.Find("Name = 12");  // a number against a text field compares as text
    EXPECT_TRUE(rs.Eof());
}

TEST(RecordsetFind, NoMatchLeavesNoPositionAboveZero) {
    Recordset rs = makeUsers();
    rs.Find("UserID = 99");
    EXPECT_TRUE(rs.Eof());
    EXPECT_EQ(rs.AbsolutePosition(), Recordset::kPosEOF);
    EXPECT_FALSE(rs.AbsolutePosition() > 0);
    // From EOF nothing is found, even a record that exists.
    rs.Find("UserID = 1");
    EXPECT_TRUE(rs.Eof());
    rs.MoveFirst();
    rs.Find("UserID = -1");
    EXPECT_TRUE(rs.Eof());
    // A Null cell matches nothing.
    rs.MoveFirst();
    rs.Find("ExpiryDate = #2026-01-01#");
    EXPECT_TRUE(rs.Eof());
    rs.SetAbsolutePosition(2);
    rs.Fields("ExpiryDate").SetValue(Value(makeDate(2026, 1, 1)));
    rs.MoveFirst();
    rs.Find("ExpiryDate = #2026-01-01#");
    EXPECT_EQ(rs.AbsolutePosition(), 2);
}

TEST(RecordsetFind, MalformedCriteria) {
    Recordset rs = makeUsers();
    for (const char* bad : {"", "UserID", "UserID =", "= 3", "UserID > 3", "UserID = 3 4",
                            "Name = 'open", "Name = 'a' OR 1=1", "UserID = 1.2.3", "UserID = -",
                            "UserID = abc", "Nope = 3", "UserID = 'x'", "ExpiryDate = #bad#"}) {
        rs.MoveFirst();
        EXPECT_THROW(rs.Find(bad), RecordsetError) << bad;
    }
}

TEST(RecordsetBulk, AppendRecordsBuildsLargeTables) {
    Recordset rs({{"ID", ValueType::Integer, false}, {"Text", ValueType::Text, true}});
    const std::size_t n = 50000;
    rs.reserve(n);
    for (std::size_t i = 0; i < n; ++i) {
        rs.appendRecord();
        rs.cellRef(i, 0) = Value(static_cast<int32_t>(i + 1));
        rs.cellRef(i, 1) = Value("row");
    }
    rs.MoveFirst();
    EXPECT_EQ(rs.RecordCount(), static_cast<int>(n));
    rs.Find("ID = 40000");
    EXPECT_EQ(rs.AbsolutePosition(), 40000);
    EXPECT_THROW(rs.cellRef(n, 0), RecordsetError);
    EXPECT_THROW(rs.cell(0, 2), RecordsetError);
}

}  // namespace
}  // namespace kest
