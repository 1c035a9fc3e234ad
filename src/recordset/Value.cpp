#include "recordset/Value.h"
#include "recordset/AsciiText.h"

#include <array>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <limits>

namespace kest {

namespace {

constexpr int64_t kSecondsPerDay = 86400;
// The platform's date range: 1 January 100 to 31 December 9999.
constexpr double kMinDay = -657434.0;
constexpr double kMaxDay = 2958465.0;
// Days from 1970-01-01 to 1899-12-30 (the day numbers' origin).
constexpr int64_t kOriginFromUnix = -25569;

std::string_view trim(std::string_view s) {
    auto isSpace = [](char c) {
        return c == ' ' || c == '\t' || c == '\r' || c == '\n' || c == '\f' || c == '\v';
    };
    while (!s.empty() && isSpace(s.front()))
        s.remove_prefix(1);
    while (!s.empty() && isSpace(s.back()))
        s.remove_suffix(1);
    return s;
}

[[noreturn]] void fail(const std::string& what) {
    throw ConversionError(what);
}

std::string quoted(std::string_view text) {
    constexpr std::size_t kShown = 40;
    std::string out = "\"";
    out.append(text.substr(0, kShown));
    if (text.size() > kShown)
        out += "...";
    out += '"';
    return out;
}

// Text as a number, the whole text or nothing; surrounding blanks are allowed.
double parseNumber(std::string_view raw) {
    std::string_view s = trim(raw);
    if (s.empty())
        fail("Type mismatch: an empty text is not a number");
    std::string_view digits = s;
    if (digits.front() == '+')
        digits.remove_prefix(1);
    // from_chars takes "inf" and "nan", which are no numbers for a field.
    if (digits.empty() || !(std::isdigit(static_cast<unsigned char>(digits.front())) ||
                            digits.front() == '.' || digits.front() == '-')) {
        fail("Type mismatch: " + quoted(raw) + " is not a number");
    }
    double d = 0;
    auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), d);
    if (ec != std::errc() || end != digits.data() + digits.size() || !std::isfinite(d)) {
        fail("Type mismatch: " + quoted(raw) + " is not a number");
    }
    return d;
}

int32_t roundToInt(double d) {
    if (std::isnan(d))
        fail("Overflow: not a number cannot become an integer");
    // The default rounding mode is to nearest, ties to even: the platform's rule.
    double r = std::nearbyint(d);
    if (r < -2147483648.0 || r > 2147483647.0) {
        fail("Overflow: " + std::to_string(d) + " does not fit a 32-bit integer");
    }
    return static_cast<int32_t>(r);
}

std::string formatDouble(double d) {
    std::array<char, 64> buf{};
    auto [end, ec] = std::to_chars(buf.data(), buf.data() + buf.size(), d);
    if (ec != std::errc())
        return std::to_string(d);
    return std::string(buf.data(), end);
}

// Howard Hinnant's civil-date algorithms, on days since 1970-01-01.
int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
    y -= m <= 2 ? 1 : 0;
    const int64_t era = (y >= 0 ? y : y - 399) / 400;
    const auto yoe = static_cast<unsigned>(y - era * 400);
    const unsigned doy = (153 * (m > 2 ? m - 3 : m + 9) + 2) / 5 + d - 1;
    const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
    return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

struct Civil {
    int year;
    int month;
    int day;
};

Civil civilFromDays(int64_t z) {
    z += 719468;
    const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
    const auto doe = static_cast<unsigned>(z - era * 146097);
    const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
    const int64_t y = static_cast<int64_t>(yoe) + era * 400;
    const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
    const unsigned mp = (5 * doy + 2) / 153;
    const unsigned d = doy - (153 * mp + 2) / 5 + 1;
    const unsigned m = mp < 10 ? mp + 3 : mp - 9;
    return {static_cast<int>(y + (m <= 2 ? 1 : 0)), static_cast<int>(m), static_cast<int>(d)};
}

bool isLeap(int y) {
    return (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
}

int daysInMonth(int y, int m) {
    static constexpr std::array<int, 12> kDays = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
    return m == 2 && isLeap(y) ? 29 : kDays[static_cast<std::size_t>(m - 1)];
}

// A date number split into its day number and the second of that day, rounded
// to the nearest second. Before the origin the integer part counts days
// backwards while the fraction is still the time of day, so -1.25 is the day
// before the origin at 06:00.
struct DayTime {
    int64_t day;
    int64_t second;
};

DayTime split(Date d) {
    if (!std::isfinite(d.days) || d.days < kMinDay - 1 || d.days > kMaxDay + 1) {
        fail("Overflow: " + formatDouble(d.days) + " is outside the range of dates");
    }
    double whole = std::trunc(d.days);
    double fraction = std::fabs(d.days - whole);
    auto day = static_cast<int64_t>(whole);
    auto second = static_cast<int64_t>(std::llround(fraction * kSecondsPerDay));
    if (second >= kSecondsPerDay) {
        // 23:59:59.6 is the next day at midnight, whichever side of the origin.
        second -= kSecondsPerDay;
        day += 1;
    }
    return {day, second};
}

Date combine(int64_t day, int64_t second) {
    double fraction = static_cast<double>(second) / static_cast<double>(kSecondsPerDay);
    auto whole = static_cast<double>(day);
    return Date{day < 0 ? whole - fraction : whole + fraction};
}

std::string twoDigits(int64_t n) {
    std::string s(2, '0');
    s[0] = static_cast<char>('0' + n / 10 % 10);
    s[1] = static_cast<char>('0' + n % 10);
    return s;
}

std::string formatDay(int64_t day) {
    Civil c = civilFromDays(day + kOriginFromUnix);
    std::array<char, 16> buf{};
    std::snprintf(buf.data(), buf.size(), "%04d-%02d-%02d", c.year, c.month, c.day);
    return buf.data();
}

std::string formatTime(int64_t second) {
    return twoDigits(second / 3600) + ":" + twoDigits(second / 60 % 60) + ":" +
           twoDigits(second % 60);
}

// A small cursor over the date text.
class Scanner {
public:
    explicit Scanner(std::string_view s) : s_(s) {}
    bool atEnd() const { return pos_ == s_.size(); }
    bool accept(char c) {
        if (!atEnd() && s_[pos_] == c) {
            ++pos_;
            return true;
        }
        return false;
    }
    bool acceptBlanks() {
        std::size_t start = pos_;
        while (!atEnd() && (s_[pos_] == ' ' || s_[pos_] == 'T'))
            ++pos_;
        return pos_ > start;
    }
    // Between minDigits and maxDigits decimal digits; -1 when absent.
    int number(std::size_t minDigits, std::size_t maxDigits) {
        std::size_t start = pos_;
        int value = 0;
        while (!atEnd() && pos_ - start < maxDigits && s_[pos_] >= '0' && s_[pos_] <= '9') {
            value = value * 10 + (s_[pos_] - '0');
            ++pos_;
        }
        if (pos_ - start < minDigits)
            return -1;
        if (!atEnd() && s_[pos_] >= '0' && s_[pos_] <= '9')
            return -1;
        return value;
    }

private:
    std::string_view s_;
    std::size_t pos_ = 0;
};

bool validCalendar(int year, int month, int day) {
    return year >= 100 && year <= 9999 && month >= 1 && month <= 12 && day >= 1 &&
           day <= daysInMonth(year, month);
}

bool validClock(int hour, int minute, int second) {
    return hour >= 0 && hour <= 23 && minute >= 0 && minute <= 59 && second >= 0 && second <= 59;
}

// "hh:nn" or "hh:nn:ss"; false when the text does not hold one.
bool scanTime(Scanner& in, int& hour, int& minute, int& second) {
    hour = in.number(1, 2);
    if (hour < 0 || !in.accept(':'))
        return false;
    minute = in.number(2, 2);
    if (minute < 0)
        return false;
    second = 0;
    if (in.accept(':')) {
        second = in.number(2, 2);
        if (second < 0)
            return false;
    }
    return validClock(hour, minute, second);
}

}  // namespace

bool Value::toBool() const {
    switch (type()) {
        case ValueType::Empty:
            return false;
        case ValueType::Null:
            fail("Invalid use of Null");
        case ValueType::Boolean:
            return asBool();
        case ValueType::Integer:
            return asInt() != 0;
        case ValueType::Double:
            return asDouble() != 0.0;
        case ValueType::Date:
            return asDate().days != 0.0;
        case ValueType::Text: {
            std::string_view s = trim(asText());
            if (equalsIgnoringCase(s, "true"))
                return true;
            if (equalsIgnoringCase(s, "false"))
                return false;
            return parseNumber(s) != 0.0;
        }
    }
    fail("Type mismatch");
}

int32_t Value::toInt() const {
    switch (type()) {
        case ValueType::Empty:
            return 0;
        case ValueType::Null:
            fail("Invalid use of Null");
        case ValueType::Boolean:
            return asBool() ? -1 : 0;
        case ValueType::Integer:
            return asInt();
        case ValueType::Double:
            return roundToInt(asDouble());
        case ValueType::Date:
            return roundToInt(asDate().days);
        case ValueType::Text:
            return roundToInt(parseNumber(asText()));
    }
    fail("Type mismatch");
}

double Value::toDouble() const {
    switch (type()) {
        case ValueType::Empty:
            return 0.0;
        case ValueType::Null:
            fail("Invalid use of Null");
        case ValueType::Boolean:
            return asBool() ? -1.0 : 0.0;
        case ValueType::Integer:
            return asInt();
        case ValueType::Double:
            return asDouble();
        case ValueType::Date:
            return asDate().days;
        case ValueType::Text:
            return parseNumber(asText());
    }
    fail("Type mismatch");
}

Date Value::toDate() const {
    switch (type()) {
        case ValueType::Empty:
            return Date{0.0};
        case ValueType::Null:
            fail("Invalid use of Null");
        case ValueType::Boolean:
            return Date{asBool() ? -1.0 : 0.0};
        case ValueType::Integer:
            return Date{static_cast<double>(asInt())};
        case ValueType::Double: {
            double d = asDouble();
            if (!std::isfinite(d) || d < kMinDay || d >= kMaxDay + 1) {
                fail("Overflow: " + formatDouble(d) + " is outside the range of dates");
            }
            return Date{d};
        }
        case ValueType::Date:
            return asDate();
        case ValueType::Text:
            return parseDate(asText());
    }
    fail("Type mismatch");
}

std::string Value::toText() const {
    switch (type()) {
        case ValueType::Empty:
        case ValueType::Null:
            return {};
        case ValueType::Boolean:
            return asBool() ? "True" : "False";
        case ValueType::Integer:
            return std::to_string(asInt());
        case ValueType::Double:
            return formatDouble(asDouble());
        case ValueType::Date:
            return formatDate(asDate());
        case ValueType::Text:
            return asText();
    }
    return {};
}

Value Value::convertTo(ValueType target) const {
    if (isNull() || isEmpty())
        return *this;
    if (type() == target)
        return *this;
    switch (target) {
        case ValueType::Empty:
            return Value();
        case ValueType::Null:
            return Value::null();
        case ValueType::Boolean:
            return Value(toBool());
        case ValueType::Integer:
            return Value(toInt());
        case ValueType::Double:
            return Value(toDouble());
        case ValueType::Date:
            return Value(toDate());
        case ValueType::Text:
            return Value(toText());
    }
    fail("Type mismatch");
}

bool operator==(const Value& a, const Value& b) {
    auto numeric = [](ValueType t) { return t == ValueType::Integer || t == ValueType::Double; };
    if (a.type() != b.type()) {
        if (numeric(a.type()) && numeric(b.type()))
            return a.toDouble() == b.toDouble();
        return false;
    }
    return a.v_ == b.v_;
}

std::string formatDate(Date d) {
    DayTime dt = split(d);
    if (dt.day == 0)
        return formatTime(dt.second);
    if (dt.second == 0)
        return formatDay(dt.day);
    return formatDay(dt.day) + " " + formatTime(dt.second);
}

std::string formatSortableDate(Date d) {
    DayTime dt = split(d);
    return formatDay(dt.day) + " " + formatTime(dt.second);
}

Date parseDate(std::string_view raw) {
    std::string_view text = trim(raw);
    auto bad = [&]() -> ConversionError {
        return ConversionError("Type mismatch: " + quoted(raw) + " is not a date");
    };
    Scanner in(text);
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    bool hasDate = false;

    Scanner probe = in;
    int first = probe.number(1, 4);
    if (first < 0)
        throw bad();
    if (probe.accept('-')) {
        // yyyy-mm-dd
        year = in.number(4, 4);
        if (year < 0 || !in.accept('-'))
            throw bad();
        month = in.number(1, 2);
        if (month < 0 || !in.accept('-'))
            throw bad();
        day = in.number(1, 2);
        if (day < 0)
            throw bad();
        hasDate = true;
    } else if (probe.accept('/')) {
        // dd/mm/yyyy
        day = in.number(1, 2);
        if (day < 0 || !in.accept('/'))
            throw bad();
        month = in.number(1, 2);
        if (month < 0 || !in.accept('/'))
            throw bad();
        year = in.number(4, 4);
        if (year < 0)
            throw bad();
        hasDate = true;
    }

    if (hasDate) {
        if (!validCalendar(year, month, day))
            throw bad();
        if (!in.atEnd()) {
            if (!in.acceptBlanks() || !scanTime(in, hour, minute, second))
                throw bad();
        }
    } else if (!scanTime(in, hour, minute, second)) {
        throw bad();
    }
    if (!in.atEnd())
        throw bad();

    int64_t dayNumber =
        hasDate ? daysFromCivil(year, static_cast<unsigned>(month), static_cast<unsigned>(day)) -
                      kOriginFromUnix
                : 0;
    return combine(dayNumber, int64_t{hour} * 3600 + minute * 60 + second);
}

Date makeDate(int year, int month, int day, int hour, int minute, int second) {
    if (!validCalendar(year, month, day) || !validClock(hour, minute, second)) {
        fail("Invalid date " + std::to_string(year) + "-" + std::to_string(month) + "-" +
             std::to_string(day) + " " + std::to_string(hour) + ":" + std::to_string(minute) + ":" +
             std::to_string(second));
    }
    int64_t dayNumber =
        daysFromCivil(year, static_cast<unsigned>(month), static_cast<unsigned>(day)) -
        kOriginFromUnix;
    return combine(dayNumber, int64_t{hour} * 3600 + minute * 60 + second);
}

Date nowDate() {
    using namespace std::chrono;
    // Half a second ahead, then floored: the nearest second.
    auto now = floor<seconds>(system_clock::now() + milliseconds(500));
    std::time_t t = system_clock::to_time_t(now);
    std::tm local{};
    localtime_r(&t, &local);
    return makeDate(local.tm_year + 1900, local.tm_mon + 1, local.tm_mday, local.tm_hour,
                    local.tm_min, local.tm_sec > 59 ? 59 : local.tm_sec);
}

Date roundToSecond(Date d) {
    DayTime dt = split(d);
    return combine(dt.day, dt.second);
}

}  // namespace kest
