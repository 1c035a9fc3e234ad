#pragma once

#include <ostream>
#include <string>
#include <string_view>

#include "recordset/Recordset.h"

namespace kest::tool {

// A field as RFC 4180 wants it: quoted, with quotes doubled, when it holds a
// comma, a quote or a line break; as it is otherwise.
std::string csvField(std::string_view text);

// The recordset as CSV: a header line of field names, then one line per
// record. Dates in their text form (formatDate), Null and Empty as nothing.
void writeCsv(const Recordset& rs, std::ostream& out);

}  // namespace kest::tool
