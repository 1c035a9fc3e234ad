#pragma once

#include <cstdint>
#include <stdexcept>
#include <string>
#include <string_view>
#include <variant>

namespace kest {

// The kinds a value can hold. Empty is "never assigned"; Null is the database's
// missing value. Booleans follow the platform: True is -1, False is 0.
enum class ValueType : uint8_t { Empty, Null, Boolean, Integer, Double, Date, Text };

// A date number: days since 30 December 1899, the time of day as the fraction.
struct Date {
    double days = 0.0;
    friend bool operator==(Date, Date) = default;
};

// Thrown when a value cannot be converted to the type that is asked for
// (text "abc" or "" into a number or a date field, for instance). Callers that
// skip failing statements catch it and go on.
class ConversionError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

struct NullTag {
    friend bool operator==(NullTag, NullTag) = default;
};

class Value {
public:
    Value() = default;  // Empty
    static Value null() { return Value(NullTag{}); }
    Value(bool b) : v_(b) {}
    Value(int32_t i) : v_(i) {}
    Value(double d) : v_(d) {}
    Value(Date d) : v_(d) {}
    Value(std::string s) : v_(std::move(s)) {}
    Value(std::string_view s) : v_(std::string(s)) {}
    Value(const char* s) : v_(std::string(s)) {}

    ValueType type() const { return static_cast<ValueType>(v_.index()); }
    bool isEmpty() const { return type() == ValueType::Empty; }
    bool isNull() const { return type() == ValueType::Null; }

    // Conversions with the platform's defaults. Each throws ConversionError when
    // the value has no such form: Empty converts to 0, "" or False; Null to
    // nothing (it throws), as the platform's "invalid use of Null".
    bool toBool() const;
    int32_t toInt() const;       // rounds doubles half to even; text "12" gives 12
    double toDouble() const;     // a Date gives its day number
    Date toDate() const;         // numbers are day numbers; text is parsed, see fromText
    std::string toText() const;  // Null gives ""; dates as "yyyy-mm-dd hh:nn:ss" (see formatDate)

    // Typed access without conversion; undefined unless type() matches.
    bool asBool() const { return std::get<bool>(v_); }
    int32_t asInt() const { return std::get<int32_t>(v_); }
    double asDouble() const { return std::get<double>(v_); }
    Date asDate() const { return std::get<Date>(v_); }
    const std::string& asText() const { return std::get<std::string>(v_); }

    // Converts to a value of the given field type (Boolean, Integer, Double,
    // Date or Text), following the same rules; Null and Empty stay as they are.
    Value convertTo(ValueType target) const;

    // Same kind and same content. Numbers of different kinds compare by value.
    friend bool operator==(const Value& a, const Value& b);

private:
    explicit Value(NullTag n) : v_(n) {}
    std::variant<std::monostate, NullTag, bool, int32_t, double, Date, std::string> v_;
};

// The platform's default text form of a date number: "yyyy-mm-dd hh:nn:ss";
// the date alone when there is no time of day, the time alone ("hh:nn:ss")
// for day 0. The value is rounded to the nearest second.
std::string formatDate(Date d);
// "yyyy-mm-dd hh:nn:ss" always (the sortable form of hidden sort columns).
std::string formatSortableDate(Date d);
// Parses the forms formatDate writes, plus "yyyy-mm-dd hh:nn" and "dd/mm/yyyy"
// variants; throws ConversionError otherwise.
Date parseDate(std::string_view text);
// Date numbers from a calendar date and time and back.
Date makeDate(int year, int month, int day, int hour = 0, int minute = 0, int second = 0);
// The current local date and time, rounded to the second.
Date nowDate();
// A date number rounded to the nearest second.
Date roundToSecond(Date d);

}  // namespace kest
