#pragma once

#include <cstdint>
#include <string>

namespace kest {

// The one table of error numbers. They are negative and kept clear of the
// result codes that callers test for (-1 to -4), so that a number from this
// table is never mistaken for a logon or password-change result.
namespace err {
constexpr int32_t kUnknownDataSource = -1001;
constexpr int32_t kAccessDenied = -1002;
constexpr int32_t kNotLoggedOn = -1003;
constexpr int32_t kPasswordChangeRequired = -1004;
constexpr int32_t kUnknownTable = -1005;
constexpr int32_t kUnknownField = -1006;
constexpr int32_t kWrongType = -1007;
constexpr int32_t kConflict = -1008;
constexpr int32_t kRecordGone = -1009;
constexpr int32_t kDuplicateUserName = -1010;
constexpr int32_t kDuplicateKey = -1011;
constexpr int32_t kStorage = -1012;
constexpr int32_t kBadArgument = -1013;
constexpr int32_t kBadMessage = -1014;
constexpr int32_t kKeyFile = -1015;
constexpr int32_t kUnreachable = -1016;
constexpr int32_t kTimeout = -1017;
constexpr int32_t kUnknownProgID = -1018;
constexpr int32_t kInternal = -1019;
constexpr int32_t kTls = -1020;
constexpr int32_t kSchemaVersion = -1021;
}  // namespace err

// The general description of an error number ("Access denied", ...); the
// text for a number outside the table says so and names the number.
std::string describeError(int32_t number);

}  // namespace kest
