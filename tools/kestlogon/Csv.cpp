#include "Csv.h"

namespace kest::tool {

namespace {

std::string cellText(const Value& v) {
    switch (v.type()) {
        case ValueType::Empty:
        case ValueType::Null:
            return {};
        case ValueType::Date:
            return formatDate(v.asDate());
        default:
            return v.toText();
    }
}

}  // namespace

std::string csvField(std::string_view text) {
    if (text.find_first_of(",\"\r\n") == std::string_view::npos)
        return std::string(text);
    std::string out;
    out.reserve(text.size() + 2);
    out += '"';
    for (const char c : text) {
        if (c == '"')
            out += '"';
        out += c;
    }
    out += '"';
    return out;
}

void writeCsv(const Recordset& rs, std::ostream& out) {
    const auto& fields = rs.fieldDefs();
    std::string line;
    for (std::size_t f = 0; f < fields.size(); ++f) {
        if (f > 0)
            line += ',';
        line += csvField(fields[f].name);
    }
    line += '\n';
    out << line;
    for (std::size_t r = 0; r < rs.size(); ++r) {
        // A freshly fetched table has no pending deletions; should one appear,
        // it is not part of the table any more.
        if (rs.status(r) == RecordStatus::Deleted)
            continue;
        line.clear();
        for (std::size_t f = 0; f < fields.size(); ++f) {
            if (f > 0)
                line += ',';
            line += csvField(cellText(rs.cell(r, static_cast<int>(f))));
        }
        line += '\n';
        out << line;
    }
    out.flush();
}

}  // namespace kest::tool
