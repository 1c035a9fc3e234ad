#include <gtest/gtest.h>

#include <chrono>
#include <random>

#include "recordset.pb.h"
#include "recordset/Wire.h"

namespace kest {
namespace {

// One field of every type, and records that hold every kind of cell.
Recordset makeMixed() {
    Recordset rs({{"ID", ValueType::Integer, false},
                  {"Flag", ValueType::Boolean, true},
                  {"Amount", ValueType::Double, true},
                  {"When", ValueType::Date, true},
                  {"Note", ValueType::Text, true}});
    auto add = [&](RecordStatus s, Value id, Value flag, Value amount, Value when, Value note) {
        rs.appendRecord(s);
        std::size_t r = rs.size() - 1;
        rs.cellRef(r, 0) = std::move(id);
        rs.cellRef(r, 1) = std::move(flag);
        rs.cellRef(r, 2) = std::move(amount);
        rs.cellRef(r, 3) = std::move(when);
        rs.cellRef(r, 4) = std::move(note);
    };
    add(RecordStatus::Unmodified, Value(int32_t{1}), Value(true), Value(4503599627370495.0),
        Value(makeDate(2026, 3, 1, 14, 5, 9)), Value("plain"));
    add(RecordStatus::Modified, Value(int32_t{-2}), Value(false), Value::null(), Value(Date{-1.25}),
        Value(std::string("nul\0inside", 10)));
    add(RecordStatus::New, Value(INT32_MIN), Value::null(), Value(-0.0), Value::null(), Value(""));
    add(RecordStatus::Deleted, Value(INT32_MAX), Value(), Value(1e-300), Value(Date{0.0}),
        Value::null());
    add(RecordStatus::Unmodified, Value(int32_t{5}), Value(true), Value(2.5), Value(Date{1.5}),
        Value("\xc3\xa9t\xc3\xa9 'quoted'"));
    rs.setOriginal(1, 4, Value("before"));
    rs.setOriginal(1, 2, Value(7.25));
    rs.setOriginal(3, 1, Value(true));
    return rs;
}

void expectSameRecords(const Recordset& a, const Recordset& b) {
    ASSERT_EQ(a.fieldDefs(), b.fieldDefs());
    ASSERT_EQ(a.size(), b.size());
    for (std::size_t r = 0; r < a.size(); ++r) {
        EXPECT_EQ(a.status(r), b.status(r)) << r;
        EXPECT_EQ(a.hasOriginals(r), b.hasOriginals(r)) << r;
        for (int f = 0; f < a.FieldCount(); ++f) {
            EXPECT_EQ(a.cell(r, f).type(), b.cell(r, f).type()) << r << "," << f;
            EXPECT_EQ(a.cell(r, f), b.cell(r, f)) << r << "," << f;
            EXPECT_EQ(a.original(r, f), b.original(r, f)) << r << "," << f;
        }
    }
}

TEST(WireRoundTrip, EveryTypeKindStatusAndOriginal) {
    Recordset rs = makeMixed();
    RecordsetPtr back = decodeRecordset(encodeRecordset(rs));
    expectSameRecords(rs, *back);
    EXPECT_EQ(back->AbsolutePosition(), 1);
    EXPECT_EQ(back->Fields("note").Value(), Value("plain"));
}

TEST(WireRoundTrip, PendingScopeKeepsOnlyPendingRecordsInOrder) {
    Recordset rs = makeMixed();
    RecordsetPtr back = decodeRecordset(encodeRecordset(rs, EncodeScope::Pending));
    ASSERT_EQ(back->size(), 3U);
    EXPECT_EQ(back->status(0), RecordStatus::Modified);
    EXPECT_EQ(back->status(1), RecordStatus::New);
    EXPECT_EQ(back->status(2), RecordStatus::Deleted);
    EXPECT_EQ(back->cell(0, 0), Value(int32_t{-2}));
    EXPECT_EQ(back->original(0, 4), Value("before"));
    EXPECT_EQ(back->original(2, 1), Value(true));
    EXPECT_FALSE(back->hasOriginals(1));
}

TEST(WireRoundTrip, EmptyAndFieldlessRecordsets) {
    Recordset noRows({{"ID", ValueType::Integer, false}});
    RecordsetPtr back = decodeRecordset(encodeRecordset(noRows));
    EXPECT_EQ(back->size(), 0U);
    EXPECT_EQ(back->fieldDefs(), noRows.fieldDefs());
    EXPECT_TRUE(back->Eof());
    Recordset noFields({});
    EXPECT_EQ(decodeRecordset(encodeRecordset(noFields))->FieldCount(), 0);
}

TEST(WireRoundTrip, CellsOfAnotherKindTravelAsTheFieldType) {
    Recordset rs({{"Amount", ValueType::Double, true}, {"Name", ValueType::Text, true}});
    rs.appendRecord();
    rs.cellRef(0, 0) = Value(int32_t{3});
    rs.cellRef(0, 1) = Value(int32_t{12});
    RecordsetPtr back = decodeRecordset(encodeRecordset(rs));
    EXPECT_EQ(back->cell(0, 0).type(), ValueType::Double);
    EXPECT_EQ(back->cell(0, 1), Value("12"));
    rs.cellRef(0, 0) = Value("abc");
    EXPECT_THROW(encodeRecordset(rs), WireError);
}

TEST(WireRoundTrip, LargeTableIsCompactAndQuick) {
    Recordset rs({{"EventID", ValueType::Integer, false},
                  {"Date", ValueType::Date, true},
                  {"Code", ValueType::Integer, true},
                  {"Text", ValueType::Text, true}});
    const std::size_t n = 100000;
    rs.reserve(n);
    for (std::size_t i = 0; i < n; ++i) {
        rs.appendRecord();
        rs.cellRef(i, 0) = Value(static_cast<int32_t>(i + 1));
        rs.cellRef(i, 1) = Value(Date{45000.0 + static_cast<double>(i) / 1000.0});
        rs.cellRef(i, 2) = i % 10 == 0 ? Value::null() : Value(static_cast<int32_t>(i % 500));
        rs.cellRef(i, 3) = Value("Logon of user " + std::to_string(i % 97));
    }
    auto start = std::chrono::steady_clock::now();
    std::string bytes = encodeRecordset(rs);
    RecordsetPtr back = decodeRecordset(bytes);
    auto took = std::chrono::steady_clock::now() - start;
    // Columns, not messages per value: about the size of the data itself.
    EXPECT_LT(bytes.size(), n * 40);
    EXPECT_LT(took, std::chrono::seconds(10));
    ASSERT_EQ(back->size(), n);
    for (std::size_t i : {0UL, 1UL, 10UL, n / 2, n - 1}) {
        for (int f = 0; f < 4; ++f)
            EXPECT_EQ(back->cell(i, f), rs.cell(i, f)) << i << "," << f;
    }
}

// --- Hostile input ---------------------------------------------------------

TEST(WireHostile, EveryTruncationFailsCleanly) {
    std::string bytes = encodeRecordset(makeMixed());
    for (std::size_t len = 0; len < bytes.size(); ++len) {
        try {
            RecordsetPtr rs = decodeRecordset(std::string_view(bytes).substr(0, len));
            // A prefix may happen to be a smaller well-formed message; then it
            // must be consistent.
            ASSERT_NE(rs, nullptr);
            EXPECT_LE(rs->size(), 5U);
        } catch (const WireError&) {
        }
    }
}

TEST(WireHostile, RandomGarbageAndFlippedBytes) {
    std::mt19937 rng(1234);
    std::string good = encodeRecordset(makeMixed());
    for (int round = 0; round < 2000; ++round) {
        std::string bytes;
        if (round % 2 == 0) {
            bytes.resize(rng() % 200);
            for (char& c : bytes)
                c = static_cast<char>(rng());
        } else {
            bytes = good;
            for (int k = 0; k < 3; ++k)
                bytes[rng() % bytes.size()] = static_cast<char>(rng());
        }
        try {
            RecordsetPtr rs = decodeRecordset(bytes);
            ASSERT_NE(rs, nullptr);
            // Whatever came through is internally consistent.
            for (std::size_t r = 0; r < rs->size(); ++r) {
                for (int f = 0; f < rs->FieldCount(); ++f)
                    (void)rs->cell(r, f).toText();
            }
        } catch (const WireError&) {
        }
    }
}

class WireForged : public ::testing::Test {
protected:
    // A valid message of one Integer and one Text column over two rows.
    void SetUp() override {
        auto* id = msg.add_fields();
        id->set_name("ID");
        id->set_type(wire::FIELD_TYPE_INTEGER);
        auto* name = msg.add_fields();
        name->set_name("Name");
        name->set_type(wire::FIELD_TYPE_TEXT);
        msg.set_row_count(2);
        msg.add_status(8);
        msg.add_status(2);
        auto* ids = msg.add_columns();
        ids->add_ints(1);
        ids->add_ints(2);
        auto* names = msg.add_columns();
        names->set_text("abcde");
        names->add_text_lengths(2);
        names->add_text_lengths(3);
    }
    RecordsetPtr decode() const { return decodeRecordset(msg.SerializeAsString()); }
    wire::Recordset msg;
};

TEST_F(WireForged, TheUntouchedMessageDecodes) {
    RecordsetPtr rs = decode();
    EXPECT_EQ(rs->cell(1, 1), Value("cde"));
}

TEST_F(WireForged, HugeRowCountWithoutDataFailsFast) {
    msg.set_row_count(0x80000000U);
    EXPECT_THROW(decode(), WireError);
    msg.set_row_count(0xFFFFFFFFU);
    EXPECT_THROW(decode(), WireError);
}

TEST_F(WireForged, MismatchedCounts) {
    msg.add_status(8);  // three statuses for two rows
    EXPECT_THROW(decode(), WireError);
    SetUp();
    msg.mutable_columns(0)->add_ints(3);
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_columns(0)->set_kinds(std::string("\0\0\0", 3));
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_columns(0)->set_kinds(std::string("\0\1", 2));  // one value expected, two sent
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_columns()->RemoveLast();
    EXPECT_THROW(decode(), WireError);
}

TEST_F(WireForged, TextLengthsMustMatchTheBuffer) {
    msg.mutable_columns(1)->set_text_lengths(1, 4);
    EXPECT_THROW(decode(), WireError);
    msg.mutable_columns(1)->set_text_lengths(1, 0xFFFFFFFFU);
    EXPECT_THROW(decode(), WireError);
    msg.mutable_columns(1)->set_text_lengths(1, 1);  // text left over
    EXPECT_THROW(decode(), WireError);
}

TEST_F(WireForged, UnknownTypesKindsAndStatuses) {
    msg.mutable_fields(0)->set_type(static_cast<wire::FieldType>(1));
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_fields(0)->set_type(static_cast<wire::FieldType>(99));
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_columns(0)->set_kinds(std::string("\0\7", 2));
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.set_status(0, 3);
    EXPECT_THROW(decode(), WireError);
}

TEST_F(WireForged, CellsThatDoNotFitTheFieldType) {
    msg.mutable_columns(0)->add_doubles(1.0);  // doubles in an Integer column
    EXPECT_THROW(decode(), WireError);
    msg.Clear();
    SetUp();
    msg.mutable_fields(0)->set_type(wire::FIELD_TYPE_BOOLEAN);
    EXPECT_THROW(decode(), WireError);  // 1 and 2 are no booleans
    msg.Clear();
    SetUp();
    msg.mutable_fields(0)->set_type(wire::FIELD_TYPE_DATE);
    EXPECT_THROW(decode(), WireError);  // ints where doubles belong
    msg.Clear();
    SetUp();
    msg.mutable_fields(0)->set_type(wire::FIELD_TYPE_DATE);
    msg.mutable_columns(0)->clear_ints();
    msg.mutable_columns(0)->add_doubles(1.0);
    msg.mutable_columns(0)->add_doubles(1e300);  // beyond the range of dates
    EXPECT_THROW(decode(), WireError);
}

TEST_F(WireForged, FieldDefinitions) {
    msg.mutable_fields(1)->set_name("id");
    EXPECT_THROW(decode(), WireError);
    msg.mutable_fields(1)->set_name("");
    EXPECT_THROW(decode(), WireError);
    msg.mutable_fields(1)->set_name(std::string(300, 'x'));
    EXPECT_THROW(decode(), WireError);

    wire::Recordset wide;
    for (int i = 0; i < 1001; ++i) {
        auto* f = wide.add_fields();
        f->set_name("F" + std::to_string(i));
        f->set_type(wire::FIELD_TYPE_INTEGER);
        wide.add_columns();
    }
    EXPECT_THROW(decodeRecordset(wide.SerializeAsString()), WireError);
}

TEST_F(WireForged, OriginalsMustBelongToChangedRows) {
    auto addOriginalColumns = [&] {
        msg.add_original_columns()->add_ints(9);
        auto* text = msg.add_original_columns();
        text->set_text("z");
        text->add_text_lengths(1);
    };
    msg.add_original_rows(1);
    addOriginalColumns();
    RecordsetPtr rs = decode();
    EXPECT_EQ(rs->original(1, 0), Value(int32_t{9}));
    EXPECT_EQ(rs->original(1, 1), Value("z"));

    msg.set_original_rows(0, 0);  // row 0 is unmodified
    EXPECT_THROW(decode(), WireError);
    msg.set_original_rows(0, 5);  // no such row
    EXPECT_THROW(decode(), WireError);
    msg.set_original_rows(0, 1);
    msg.add_original_rows(1);  // twice, and too few values
    EXPECT_THROW(decode(), WireError);
    msg.clear_original_rows();
    EXPECT_THROW(decode(), WireError);  // columns without rows
}

}  // namespace
}  // namespace kest
