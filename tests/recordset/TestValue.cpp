#include <gtest/gtest.h>

#include <cmath>

#include "recordset/Value.h"

namespace kest {
namespace {

TEST(ValueConversion, TextToNumbers) {
    EXPECT_EQ(Value("12").toInt(), 12);
    EXPECT_EQ(Value(" -7 ").toInt(), -7);
    EXPECT_EQ(Value("+3").toInt(), 3);
    EXPECT_DOUBLE_EQ(Value("2.5").toDouble(), 2.5);
    EXPECT_THROW(Value("").toInt(), ConversionError);
    EXPECT_THROW(Value("abc").toInt(), ConversionError);
    EXPECT_THROW(Value("12abc").toDouble(), ConversionError);
    EXPECT_THROW(Value("inf").toDouble(), ConversionError);
    EXPECT_THROW(Value("nan").toDouble(), ConversionError);
    EXPECT_THROW(Value("").toDate(), ConversionError);
    EXPECT_THROW(Value("abc").toDate(), ConversionError);
}

TEST(ValueConversion, IntegerRoundsHalfToEvenAndChecksRange) {
    EXPECT_EQ(Value(2.5).toInt(), 2);
    EXPECT_EQ(Value(3.5).toInt(), 4);
    EXPECT_EQ(Value(-2.5).toInt(), -2);
    EXPECT_EQ(Value(2.4999).toInt(), 2);
    EXPECT_EQ(Value("0.5").toInt(), 0);
    EXPECT_EQ(Value(2147483647.0).toInt(), 2147483647);
    EXPECT_EQ(Value(-2147483648.0).toInt(), INT32_MIN);
    EXPECT_THROW(Value(2147483648.0).toInt(), ConversionError);
    EXPECT_THROW(Value(-2147483649.0).toInt(), ConversionError);
    EXPECT_THROW(Value("99999999999").toInt(), ConversionError);
    EXPECT_THROW(Value(std::nan("")).toInt(), ConversionError);
}

TEST(ValueConversion, Booleans) {
    EXPECT_EQ(Value(true).toText(), "True");
    EXPECT_EQ(Value(false).toText(), "False");
    EXPECT_EQ(Value(true).toInt(), -1);
    EXPECT_EQ(Value(false).toInt(), 0);
    EXPECT_TRUE(Value("True").toBool());
    EXPECT_TRUE(Value("true").toBool());
    EXPECT_FALSE(Value("False").toBool());
    EXPECT_TRUE(Value("-1").toBool());
    EXPECT_FALSE(Value("0").toBool());
    EXPECT_TRUE(Value(int32_t{5}).toBool());
    EXPECT_TRUE(Value(0.1).toBool());
    EXPECT_FALSE(Value(0.0).toBool());
    EXPECT_THROW(Value("maybe").toBool(), ConversionError);
    EXPECT_THROW(Value("").toBool(), ConversionError);
}

TEST(ValueConversion, NullAndEmpty) {
    Value null = Value::null();
    EXPECT_EQ(null.toText(), "");
    EXPECT_THROW(null.toInt(), ConversionError);
    EXPECT_THROW(null.toDouble(), ConversionError);
    EXPECT_THROW(null.toDate(), ConversionError);
    EXPECT_THROW(null.toBool(), ConversionError);
    Value empty;
    EXPECT_EQ(empty.toInt(), 0);
    EXPECT_EQ(empty.toDouble(), 0.0);
    EXPECT_EQ(empty.toText(), "");
    EXPECT_FALSE(empty.toBool());
    EXPECT_TRUE(null.convertTo(ValueType::Integer).isNull());
    EXPECT_TRUE(empty.convertTo(ValueType::Text).isEmpty());
}

TEST(ValueConversion, DoublesRoundTripThroughText) {
    const double code = 4503599627370495.0;  // 2^52 - 1, the largest password code
    EXPECT_EQ(Value(code).toText(), "4503599627370495");
    EXPECT_EQ(Value(Value(code).toText()).toDouble(), code);
    for (double d : {0.1, 1.0 / 3.0, -123.456e-7, 1e300, 4503599627370496.0}) {
        EXPECT_EQ(Value(Value(d).toText()).toDouble(), d) << d;
    }
    EXPECT_EQ(Value(2.5).toText(), "2.5");
    EXPECT_EQ(Value(int32_t{-42}).toText(), "-42");
}

TEST(ValueConversion, ConvertToFieldTypes) {
    EXPECT_EQ(Value("12").convertTo(ValueType::Integer), Value(int32_t{12}));
    EXPECT_EQ(Value(int32_t{1}).convertTo(ValueType::Text), Value("1"));
    EXPECT_EQ(Value("-1").convertTo(ValueType::Boolean), Value(true));
    EXPECT_EQ(Value("2026-03-01").convertTo(ValueType::Date), Value(makeDate(2026, 3, 1)));
    EXPECT_EQ(Value(makeDate(2026, 3, 1, 8, 5)).convertTo(ValueType::Text),
              Value("2026-03-01 08:05:00"));
    EXPECT_THROW(Value("abc").convertTo(ValueType::Double), ConversionError);
    EXPECT_THROW(Value(1e12).convertTo(ValueType::Integer), ConversionError);
}

TEST(ValueEquality, KindsAndNumbers) {
    EXPECT_EQ(Value(int32_t{3}), Value(3.0));
    EXPECT_NE(Value(int32_t{3}), Value(3.5));
    EXPECT_NE(Value("3"), Value(int32_t{3}));
    EXPECT_NE(Value::null(), Value());
    EXPECT_EQ(Value::null(), Value::null());
    EXPECT_NE(Value("a"), Value("A"));
}

TEST(DateText, FormsOfFormatDate) {
    EXPECT_EQ(formatDate(makeDate(2026, 3, 1, 14, 5, 9)), "2026-03-01 14:05:09");
    EXPECT_EQ(formatDate(makeDate(2026, 3, 1)), "2026-03-01");
    EXPECT_EQ(formatDate(Date{0.0}), "00:00:00");
    EXPECT_EQ(formatDate(Date{0.75}), "18:00:00");
    EXPECT_EQ(formatDate(Date{1.0}), "1899-12-31");
    EXPECT_EQ(formatSortableDate(makeDate(2026, 3, 1)), "2026-03-01 00:00:00");
    EXPECT_EQ(formatSortableDate(Date{0.0}), "1899-12-30 00:00:00");
}

TEST(DateText, NegativeDayNumbersCountBackwardsWithForwardTime) {
    EXPECT_EQ(formatDate(Date{-1.25}), "1899-12-29 06:00:00");
    EXPECT_EQ(formatDate(Date{-1.0}), "1899-12-29");
    EXPECT_EQ(formatDate(Date{-2.5}), "1899-12-28 12:00:00");
    EXPECT_EQ(makeDate(1899, 12, 29, 6).days, -1.25);
    EXPECT_EQ(parseDate("1899-12-28 12:00:00").days, -2.5);
    EXPECT_EQ(formatDate(makeDate(1800, 1, 1, 23, 59, 59)), "1800-01-01 23:59:59");
}

TEST(DateText, RoundsToTheNearestSecond) {
    const double second = 1.0 / 86400.0;
    Date d = makeDate(2026, 3, 1, 10, 0, 0);
    EXPECT_EQ(formatDate(Date{d.days + 0.4 * second}), "2026-03-01 10:00:00");
    EXPECT_EQ(formatDate(Date{d.days + 0.6 * second}), "2026-03-01 10:00:01");
    // 23:59:59.6 belongs to the next day.
    Date late = makeDate(2026, 2, 28, 23, 59, 59);
    EXPECT_EQ(formatDate(Date{late.days + 0.6 * second}), "2026-03-01");
    EXPECT_EQ(roundToSecond(Date{late.days + 0.6 * second}), makeDate(2026, 3, 1));
    // The same before the origin: day -2 at 23:59:59.6 is day -1 at midnight.
    EXPECT_EQ(formatDate(Date{-2.0 - (86399.6 / 86400.0)}), "1899-12-29");
}

TEST(DateText, RoundTripsToTheSecond) {
    for (Date d : {makeDate(2026, 3, 1, 14, 5, 9), makeDate(2000, 2, 29), makeDate(100, 1, 1),
                   makeDate(9999, 12, 31, 23, 59, 59), Date{0.0}, Date{0.5}, Date{-1.25},
                   Date{45000.123456789}}) {
        Date back = parseDate(formatDate(d));
        EXPECT_EQ(back, roundToSecond(d)) << formatDate(d);
        EXPECT_EQ(Value(Value(d).toText()).toDate(), roundToSecond(d));
    }
}

TEST(DateText, ParsesTheAcceptedForms) {
    Date full = makeDate(2026, 3, 1, 14, 5, 9);
    EXPECT_EQ(parseDate("2026-03-01 14:05:09"), full);
    EXPECT_EQ(parseDate("  2026-3-1 14:05:09 "), full);
    EXPECT_EQ(parseDate("2026-03-01 14:05"), makeDate(2026, 3, 1, 14, 5));
    EXPECT_EQ(parseDate("01/03/2026"), makeDate(2026, 3, 1));
    EXPECT_EQ(parseDate("1/3/2026 14:05"), makeDate(2026, 3, 1, 14, 5));
    EXPECT_EQ(parseDate("01/03/2026 14:05:09"), full);
    EXPECT_EQ(parseDate("14:05:09"), Date{(14 * 3600 + 5 * 60 + 9) / 86400.0});
}

TEST(DateText, RejectsInvalidDates) {
    for (const char* text :
         {"2026-02-30", "2025-02-29", "2026-13-01", "2026-00-10", "32/01/2026",
          "2026-03-01 24:00:00", "2026-03-01 12:60", "2026-03-01 12:00:60", "2026-03-01x",
          "2026/03/01", "26-03-01", "abc", "", "12", "2026-03-01 12", "0099-12-31"}) {
        EXPECT_THROW(parseDate(text), ConversionError) << text;
    }
    EXPECT_THROW(makeDate(2026, 2, 30), ConversionError);
    EXPECT_THROW(formatDate(Date{1e12}), ConversionError);
    EXPECT_THROW(formatDate(Date{std::nan("")}), ConversionError);
}

TEST(DateText, NowIsWholeSeconds) {
    Date now = nowDate();
    EXPECT_EQ(roundToSecond(now), now);
    EXPECT_GT(now.days, makeDate(2020, 1, 1).days);
}

}  // namespace
}  // namespace kest
