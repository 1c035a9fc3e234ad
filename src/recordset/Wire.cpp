#include "recordset/Wire.h"
#include "recordset/AsciiText.h"

#include <climits>
#include <cmath>
#include <unordered_set>

#include "recordset.pb.h"

namespace kest {

namespace {

constexpr int kMaxFields = 1000;
constexpr std::size_t kMaxFieldName = 255;
constexpr double kMinDay = -657434.0;
constexpr double kMaxDayEnd = 2958466.0;

[[noreturn]] void bad(const std::string& why) {
    throw WireError("Malformed recordset message: " + why);
}

std::string columnName(const FieldDef& f) {
    return "column \"" + f.name + "\"";
}

// --- Encoding ------------------------------------------------------------

// Writes one column of `count` rows; cellAt(i) gives the i-th row's cell.
template <typename CellAt>
void encodeColumn(wire::Column& col, const FieldDef& field, std::size_t count, CellAt cellAt) {
    std::string& kinds = *col.mutable_kinds();
    kinds.assign(count, static_cast<char>(wire::CELL_VALUE));
    bool allValues = true;
    const ValueType type = field.type;
    const bool numeric = type == ValueType::Boolean || type == ValueType::Integer;
    const bool floating = type == ValueType::Double || type == ValueType::Date;
    if (numeric)
        col.mutable_ints()->Reserve(static_cast<int>(count));
    if (floating)
        col.mutable_doubles()->Reserve(static_cast<int>(count));
    if (type == ValueType::Text) {
        col.mutable_text_lengths()->Reserve(static_cast<int>(count));
        // One allocation for the whole buffer instead of doubling through it.
        std::size_t bytes = 0;
        for (std::size_t i = 0; i < count; ++i) {
            const Value& v = cellAt(i);
            if (v.type() == ValueType::Text)
                bytes += v.asText().size();
        }
        col.mutable_text()->reserve(bytes);
    }

    for (std::size_t i = 0; i < count; ++i) {
        const Value& stored = cellAt(i);
        if (stored.isNull() || stored.isEmpty()) {
            kinds[i] = static_cast<char>(stored.isNull() ? wire::CELL_NULL : wire::CELL_EMPTY);
            allValues = false;
            continue;
        }
        // A cell filled with another kind than its field's is sent as the field's.
        Value converted;
        const Value* v = &stored;
        if (stored.type() != type) {
            try {
                converted = stored.convertTo(type);
            } catch (const ConversionError& e) {
                throw WireError("Cannot encode row " + std::to_string(i) + " of " +
                                columnName(field) + ": " + e.what());
            }
            v = &converted;
        }
        switch (type) {
            case ValueType::Boolean:
                col.add_ints(v->asBool() ? -1 : 0);
                break;
            case ValueType::Integer:
                col.add_ints(v->asInt());
                break;
            case ValueType::Double:
                col.add_doubles(v->asDouble());
                break;
            case ValueType::Date:
                col.add_doubles(v->asDate().days);
                break;
            case ValueType::Text:
                col.mutable_text()->append(v->asText());
                col.add_text_lengths(static_cast<uint32_t>(v->asText().size()));
                break;
            case ValueType::Empty:
            case ValueType::Null:
                break;
        }
    }
    if (allValues)
        kinds.clear();
}

// --- Decoding ------------------------------------------------------------

// Checks a column against its field and row count before anything is
// allocated from it: every count must agree with the bytes that came.
void validateColumn(const wire::Column& col, const FieldDef& field, std::size_t rows) {
    const std::string& kinds = col.kinds();
    std::size_t values = rows;
    if (!kinds.empty()) {
        if (kinds.size() != rows) {
            bad(columnName(field) + " has " + std::to_string(kinds.size()) + " kinds for " +
                std::to_string(rows) + " rows");
        }
        values = 0;
        for (char k : kinds) {
            auto kind = static_cast<unsigned char>(k);
            if (kind == wire::CELL_VALUE) {
                ++values;
            } else if (kind != wire::CELL_NULL && kind != wire::CELL_EMPTY) {
                bad(columnName(field) + " has an unknown cell kind " + std::to_string(kind));
            }
        }
    }
    const auto ints = static_cast<std::size_t>(col.ints_size());
    const auto doubles = static_cast<std::size_t>(col.doubles_size());
    const auto lengths = static_cast<std::size_t>(col.text_lengths_size());
    const ValueType type = field.type;
    const bool intTyped = type == ValueType::Boolean || type == ValueType::Integer;
    const bool doubleTyped = type == ValueType::Double || type == ValueType::Date;
    const bool textTyped = type == ValueType::Text;
    if (ints != (intTyped ? values : 0) || doubles != (doubleTyped ? values : 0) ||
        lengths != (textTyped ? values : 0) || (!textTyped && !col.text().empty())) {
        bad(columnName(field) + " holds values that do not fit its " + std::to_string(values) +
            " value cells of its type");
    }
    if (type == ValueType::Boolean) {
        for (int32_t b : col.ints()) {
            if (b != 0 && b != -1)
                bad(columnName(field) + " has a boolean other than -1 or 0");
        }
    } else if (type == ValueType::Date) {
        for (double d : col.doubles()) {
            if (!std::isfinite(d) || d < kMinDay || d >= kMaxDayEnd) {
                bad(columnName(field) + " has a date outside the range of dates");
            }
        }
    } else if (textTyped) {
        uint64_t total = 0;
        const uint64_t available = col.text().size();
        for (uint32_t len : col.text_lengths()) {
            total += len;
            if (total > available)
                bad(columnName(field) + " has text lengths beyond its text");
        }
        if (total != available)
            bad(columnName(field) + " has text that no length accounts for");
    }
}

// Fills a validated column; put(i, value) stores the i-th row's cell.
template <typename Put>
void decodeColumn(const wire::Column& col, ValueType type, std::size_t rows, Put put) {
    const std::string& kinds = col.kinds();
    int next = 0;             // the next value in the typed array
    std::size_t textPos = 0;  // where the next text begins in the buffer
    const std::string_view text = col.text();
    for (std::size_t i = 0; i < rows; ++i) {
        if (!kinds.empty()) {
            auto kind = static_cast<unsigned char>(kinds[i]);
            if (kind == wire::CELL_NULL) {
                put(i, Value::null());
                continue;
            }
            if (kind == wire::CELL_EMPTY) {
                put(i, Value());
                continue;
            }
        }
        switch (type) {
            case ValueType::Boolean:
                put(i, Value(col.ints(next++) != 0));
                break;
            case ValueType::Integer:
                put(i, Value(static_cast<int32_t>(col.ints(next++))));
                break;
            case ValueType::Double:
                put(i, Value(col.doubles(next++)));
                break;
            case ValueType::Date:
                put(i, Value(Date{col.doubles(next++)}));
                break;
            case ValueType::Text: {
                std::size_t len = col.text_lengths(next++);
                put(i, Value(text.substr(textPos, len)));
                textPos += len;
                break;
            }
            case ValueType::Empty:
            case ValueType::Null:
                break;
        }
    }
}

std::vector<FieldDef> decodeFields(const wire::Recordset& msg) {
    if (msg.fields_size() > kMaxFields) {
        bad(std::to_string(msg.fields_size()) + " fields, more than " + std::to_string(kMaxFields));
    }
    std::vector<FieldDef> fields;
    fields.reserve(static_cast<std::size_t>(msg.fields_size()));
    std::unordered_set<std::string> seen;
    for (const wire::FieldDef& f : msg.fields()) {
        const std::string& name = f.name();
        if (name.empty() || name.size() > kMaxFieldName) {
            bad("a field name is empty or longer than " + std::to_string(kMaxFieldName));
        }
        for (char c : name) {
            if (static_cast<unsigned char>(c) < 0x20)
                bad("a field name holds a control character");
        }
        if (!seen.insert(asciiLower(name)).second)
            bad("field \"" + name + "\" is defined twice");
        ValueType type{};
        switch (f.type()) {
            case wire::FIELD_TYPE_BOOLEAN:
                type = ValueType::Boolean;
                break;
            case wire::FIELD_TYPE_INTEGER:
                type = ValueType::Integer;
                break;
            case wire::FIELD_TYPE_DOUBLE:
                type = ValueType::Double;
                break;
            case wire::FIELD_TYPE_DATE:
                type = ValueType::Date;
                break;
            case wire::FIELD_TYPE_TEXT:
                type = ValueType::Text;
                break;
            default:
                bad("field \"" + name + "\" has an unknown type " + std::to_string(f.type()));
        }
        fields.push_back(FieldDef{name, type, f.nullable()});
    }
    return fields;
}

bool validStatus(uint32_t s) {
    return s == static_cast<uint32_t>(RecordStatus::New) ||
           s == static_cast<uint32_t>(RecordStatus::Modified) ||
           s == static_cast<uint32_t>(RecordStatus::Deleted) ||
           s == static_cast<uint32_t>(RecordStatus::Unmodified);
}

}  // namespace

std::string encodeRecordset(const Recordset& rs, EncodeScope scope) {
    // The records to send, as indexes into rs.
    std::vector<std::size_t> rows;
    const bool all = scope == EncodeScope::All;
    if (!all) {
        rows.reserve(rs.pendingCount());
        for (std::size_t r = 0; r < rs.size(); ++r) {
            if (rs.status(r) != RecordStatus::Unmodified)
                rows.push_back(r);
        }
    }
    const std::size_t count = all ? rs.size() : rows.size();
    if (count > static_cast<std::size_t>(INT_MAX))
        throw WireError("Too many records to encode");
    auto recordAt = [&](std::size_t i) { return all ? i : rows[i]; };

    wire::Recordset msg;
    const std::vector<FieldDef>& defs = rs.fieldDefs();
    for (const FieldDef& f : defs) {
        wire::FieldDef* out = msg.add_fields();
        out->set_name(f.name);
        out->set_type(static_cast<wire::FieldType>(static_cast<int>(f.type)));
        out->set_nullable(f.nullable);
    }
    msg.set_row_count(static_cast<uint32_t>(count));
    msg.mutable_status()->Reserve(static_cast<int>(count));
    std::vector<uint32_t> withOriginals;
    for (std::size_t i = 0; i < count; ++i) {
        std::size_t r = recordAt(i);
        msg.add_status(static_cast<uint32_t>(rs.status(r)));
        if (rs.hasOriginals(r))
            withOriginals.push_back(static_cast<uint32_t>(i));
    }
    for (std::size_t f = 0; f < defs.size(); ++f) {
        const int field = static_cast<int>(f);
        encodeColumn(*msg.add_columns(), defs[f], count,
                     [&](std::size_t i) -> const Value& { return rs.cell(recordAt(i), field); });
    }
    if (!withOriginals.empty()) {
        msg.mutable_original_rows()->Add(withOriginals.begin(), withOriginals.end());
        for (std::size_t f = 0; f < defs.size(); ++f) {
            const int field = static_cast<int>(f);
            encodeColumn(*msg.add_original_columns(), defs[f], withOriginals.size(),
                         [&](std::size_t i) -> const Value& {
                             return rs.original(recordAt(withOriginals[i]), field);
                         });
        }
    }
    if (msg.ByteSizeLong() > static_cast<std::size_t>(INT_MAX)) {
        throw WireError("The recordset is too large for one message");
    }
    std::string out;
    if (!msg.SerializeToString(&out))
        throw WireError("The recordset could not be encoded");
    return out;
}

RecordsetPtr decodeRecordset(std::string_view bytes) {
    if (bytes.size() > static_cast<std::size_t>(INT_MAX))
        bad("larger than 2 GB");
    wire::Recordset msg;
    if (!msg.ParseFromArray(bytes.data(), static_cast<int>(bytes.size()))) {
        bad("the bytes are not a recordset");
    }
    std::vector<FieldDef> fields = decodeFields(msg);

    // Every count is checked against what the message really holds before
    // anything is sized from it.
    const std::size_t rows = msg.row_count();
    if (static_cast<std::size_t>(msg.status_size()) != rows) {
        bad(std::to_string(msg.status_size()) + " statuses for " + std::to_string(rows) + " rows");
    }
    for (uint32_t s : msg.status()) {
        if (!validStatus(s))
            bad("unknown record status " + std::to_string(s));
    }
    if (static_cast<std::size_t>(msg.columns_size()) != fields.size()) {
        bad(std::to_string(msg.columns_size()) + " columns for " + std::to_string(fields.size()) +
            " fields");
    }
    for (std::size_t f = 0; f < fields.size(); ++f) {
        validateColumn(msg.columns(static_cast<int>(f)), fields[f], rows);
    }
    const std::size_t originalRows = static_cast<std::size_t>(msg.original_rows_size());
    if (originalRows > 0) {
        if (static_cast<std::size_t>(msg.original_columns_size()) != fields.size()) {
            bad(std::to_string(msg.original_columns_size()) + " original columns for " +
                std::to_string(fields.size()) + " fields");
        }
        uint64_t previous = 0;
        bool first = true;
        for (uint32_t r : msg.original_rows()) {
            if (r >= rows || (!first && r <= previous)) {
                bad("original values for row " + std::to_string(r) + " out of order or range");
            }
            auto s = static_cast<RecordStatus>(msg.status(static_cast<int>(r)));
            if (s != RecordStatus::Modified && s != RecordStatus::Deleted) {
                bad("original values for row " + std::to_string(r) +
                    ", which is neither modified nor deleted");
            }
            previous = r;
            first = false;
        }
        for (std::size_t f = 0; f < fields.size(); ++f) {
            validateColumn(msg.original_columns(static_cast<int>(f)), fields[f], originalRows);
        }
    } else if (msg.original_columns_size() != 0) {
        bad("original columns without original rows");
    }

    auto rs = std::make_shared<Recordset>(std::move(fields));
    rs->reserve(rows);
    for (uint32_t s : msg.status())
        rs->appendRecord(static_cast<RecordStatus>(s));
    const std::vector<FieldDef>& defs = rs->fieldDefs();
    for (std::size_t f = 0; f < defs.size(); ++f) {
        const int field = static_cast<int>(f);
        decodeColumn(msg.columns(field), defs[f].type, rows,
                     [&](std::size_t i, Value v) { rs->cellRef(i, field) = std::move(v); });
    }
    for (std::size_t f = 0; f < defs.size() && originalRows > 0; ++f) {
        const int field = static_cast<int>(f);
        decodeColumn(
            msg.original_columns(field), defs[f].type, originalRows, [&](std::size_t i, Value v) {
                rs->setOriginal(msg.original_rows(static_cast<int>(i)), field, std::move(v));
            });
    }
    rs->MoveFirst();
    return rs;
}

}  // namespace kest
