#pragma once

#include <stdexcept>
#include <string>
#include <string_view>

#include "Recordset.h"

namespace kest {

// A wire message that cannot be decoded: truncated, oversized for what it
// claims, inconsistent counts, an unknown type.
class WireError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

enum class EncodeScope { All, Pending };

// Encodes field definitions, records, statuses and original values by columns
// (packed numbers, one text buffer with lengths). With Pending, only records
// with pending changes are written, in their order.
std::string encodeRecordset(const Recordset& rs, EncodeScope scope = EncodeScope::All);
// The inverse; throws WireError for anything malformed. Never trusts a count
// in the message beyond what the bytes can hold.
RecordsetPtr decodeRecordset(std::string_view bytes);

}  // namespace kest
