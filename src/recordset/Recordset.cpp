#include "recordset/Recordset.h"
#include "recordset/AsciiText.h"

#include <algorithm>
#include <charconv>
#include <cmath>

namespace kest {

namespace {

bool isBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

bool isNameChar(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
}

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

// A parsed "<field> = <value>" criteria.
struct Criteria {
    std::string field;
    Value value;
};

[[noreturn]] void malformed(std::string_view criteria, const char* why) {
    throw RecordsetError("Malformed Find criteria \"" + std::string(criteria) + "\": " + why);
}

Criteria parseCriteria(std::string_view text) {
    std::size_t i = 0;
    const std::size_t n = text.size();
    auto skipBlanks = [&] {
        while (i < n && isBlank(text[i]))
            ++i;
    };

    Criteria c;
    skipBlanks();
    if (i < n && text[i] == '[') {
        std::size_t close = text.find(']', i + 1);
        if (close == std::string_view::npos || close == i + 1) {
            malformed(text, "unclosed field name");
        }
        c.field = std::string(text.substr(i + 1, close - i - 1));
        i = close + 1;
    } else {
        std::size_t start = i;
        while (i < n && isNameChar(text[i]))
            ++i;
        if (i == start)
            malformed(text, "a field name is expected");
        c.field = std::string(text.substr(start, i - start));
    }
    skipBlanks();
    if (i >= n || text[i] != '=')
        malformed(text, "only \"=\" comparisons are supported");
    ++i;
    skipBlanks();
    if (i >= n)
        malformed(text, "a value is expected");

    char open = text[i];
    if (open == '\'' || open == '"' || open == '#') {
        std::string literal;
        ++i;
        bool closed = false;
        while (i < n) {
            char ch = text[i++];
            if (ch == open) {
                // A doubled quote stands for one quote; dates have no escapes.
                if (open != '#' && i < n && text[i] == open) {
                    literal += ch;
                    ++i;
                    continue;
                }
                closed = true;
                break;
            }
            literal += ch;
        }
        if (!closed)
            malformed(text, "unclosed quote");
        if (open == '#') {
            try {
                c.value = Value(parseDate(literal));
            } catch (const ConversionError&) {
                malformed(text, "not a date between # signs");
            }
        } else {
            c.value = Value(std::move(literal));
        }
    } else {
        std::size_t start = i;
        if (i < n && (text[i] == '-' || text[i] == '+'))
            ++i;
        std::size_t digitsStart = i;
        while (i < n && isDigit(text[i]))
            ++i;
        bool decimal = false;
        if (i < n && text[i] == '.') {
            decimal = true;
            ++i;
            while (i < n && isDigit(text[i]))
                ++i;
        }
        if (i == digitsStart || (decimal && i == digitsStart + 1)) {
            malformed(text, "a number or a quoted text is expected");
        }
        std::string_view token = text.substr(start, i - start);
        if (token.front() == '+')
            token.remove_prefix(1);
        double d = 0;
        auto [end, ec] = std::from_chars(token.data(), token.data() + token.size(), d);
        if (ec != std::errc() || end != token.data() + token.size() || !std::isfinite(d)) {
            malformed(text, "the number cannot be read");
        }
        if (!decimal && d >= -2147483648.0 && d <= 2147483647.0) {
            c.value = Value(static_cast<int32_t>(d));
        } else {
            c.value = Value(d);
        }
    }
    skipBlanks();
    if (i != n)
        malformed(text, "unexpected text after the value");
    return c;
}

// Whether a stored cell equals the criteria value, already of the field's type.
bool matches(const Value& cell, const Value& wanted, ValueType type) {
    if (cell.isNull() || cell.isEmpty())
        return false;
    try {
        switch (type) {
            case ValueType::Text:
                return equalsIgnoringCase(cell.toText(), wanted.asText());
            case ValueType::Boolean:
                return cell.toBool() == wanted.asBool();
            case ValueType::Date:
                return roundToSecond(cell.toDate()) == roundToSecond(wanted.asDate());
            case ValueType::Integer:
            case ValueType::Double:
                return cell.toDouble() == wanted.toDouble();
            case ValueType::Empty:
            case ValueType::Null:
                return false;
        }
    } catch (const ConversionError&) {
        // A cell of a foreign kind that cannot be compared is simply no match.
    }
    return false;
}

bool fieldTypeValid(ValueType t) {
    return t == ValueType::Boolean || t == ValueType::Integer || t == ValueType::Double ||
           t == ValueType::Date || t == ValueType::Text;
}

}  // namespace

// --- Field ---------------------------------------------------------------

const std::string& Field::Name() const {
    return rs_->fields_[static_cast<std::size_t>(index_)].name;
}

ValueType Field::Type() const {
    return rs_->fields_[static_cast<std::size_t>(index_)].type;
}

Value Field::Value() const {
    return rs_->cell(rs_->currentIndex(), index_);
}

void Field::SetValue(const kest::Value& v) {
    std::size_t record = rs_->currentIndex();
    if (rs_->status_[record] == RecordStatus::Deleted) {
        throw RecordsetError("Field \"" + Name() + "\": the current record has been deleted");
    }
    // Converted first: a failing conversion leaves the record as it was.
    kest::Value converted = v.isEmpty() ? kest::Value::null() : v.convertTo(Type());
    rs_->markModified(record);
    rs_->cellRef(record, index_) = std::move(converted);
}

kest::Value Field::OriginalValue() const {
    return rs_->original(rs_->currentIndex(), index_);
}

// --- Recordset -----------------------------------------------------------

Recordset::Recordset(std::vector<FieldDef> fields) : fields_(std::move(fields)) {
    for (std::size_t i = 0; i < fields_.size(); ++i) {
        if (!fieldTypeValid(fields_[i].type)) {
            throw RecordsetError("Field \"" + fields_[i].name + "\" has no storable type");
        }
        for (std::size_t j = 0; j < i; ++j) {
            if (equalsIgnoringCase(fields_[i].name, fields_[j].name)) {
                throw RecordsetError("Field \"" + fields_[i].name + "\" is defined twice");
            }
        }
    }
}

Field Recordset::Fields(std::string_view name) {
    int index = fieldIndex(name);
    if (index < 0) {
        throw RecordsetError("Item cannot be found: no field \"" + std::string(name) + "\"");
    }
    return Field(this, index);
}

Field Recordset::Fields(int index) {
    if (index < 0 || index >= FieldCount()) {
        throw RecordsetError("Item cannot be found: no field number " + std::to_string(index));
    }
    return Field(this, index);
}

int Recordset::FieldCount() const {
    return static_cast<int>(fields_.size());
}

void Recordset::AddNew() {
    appendRecord(RecordStatus::New);
    std::size_t record = size() - 1;
    for (int f = 0; f < FieldCount(); ++f)
        cellRef(record, f) = Value::null();
    current_ = static_cast<long>(record);
}

void Recordset::Update() {}

void Recordset::Delete() {
    std::size_t record = currentIndex();
    switch (status_[record]) {
        case RecordStatus::Deleted:
            return;
        case RecordStatus::New: {
            // Never stored, so nothing to send: it goes at once.
            const std::size_t width = fields_.size();
            auto first = cells_.begin() + static_cast<std::ptrdiff_t>(record * width);
            cells_.erase(first, first + static_cast<std::ptrdiff_t>(width));
            status_.erase(status_.begin() + static_cast<std::ptrdiff_t>(record));
            if (uint32_t slot = originalSlot_[record]; slot != 0)
                originals_[slot - 1].clear();
            originalSlot_.erase(originalSlot_.begin() + static_cast<std::ptrdiff_t>(record));
            std::size_t next = record;
            while (next < size() && !visible(next))
                ++next;
            current_ = static_cast<long>(next);
            return;
        }
        case RecordStatus::Modified:
        case RecordStatus::Unmodified:
            status_[record] = RecordStatus::Deleted;
            return;
    }
}

void Recordset::Find(std::string_view criteria) {
    Criteria c = parseCriteria(criteria);
    int field = fieldIndex(c.field);
    if (field < 0) {
        throw RecordsetError("Find criteria \"" + std::string(criteria) + "\": no field \"" +
                             c.field + "\"");
    }
    ValueType type = fields_[static_cast<std::size_t>(field)].type;
    Value wanted;
    try {
        wanted = c.value.convertTo(type);
    } catch (const ConversionError& e) {
        throw RecordsetError("Find criteria \"" + std::string(criteria) +
                             "\": the value does not fit the field (" + e.what() + ")");
    }
    if (current_ >= static_cast<long>(size()))
        return;
    std::size_t record = current_ < 0 ? 0 : static_cast<std::size_t>(current_);
    for (; record < size(); ++record) {
        if (visible(record) && matches(cell(record, field), wanted, type)) {
            current_ = static_cast<long>(record);
            return;
        }
    }
    current_ = static_cast<long>(size());
}

void Recordset::MoveFirst() {
    std::size_t record = 0;
    while (record < size() && !visible(record))
        ++record;
    current_ = static_cast<long>(record);
}

void Recordset::MoveNext() {
    if (current_ >= static_cast<long>(size())) {
        throw RecordsetError("Either BOF or EOF is True: no record to move from");
    }
    std::size_t record = current_ < 0 ? 0 : static_cast<std::size_t>(current_) + 1;
    while (record < size() && !visible(record))
        ++record;
    current_ = static_cast<long>(record);
}

bool Recordset::Eof() const {
    if (current_ >= static_cast<long>(size()))
        return true;
    return current_ < 0 && RecordCount() == 0;
}

bool Recordset::Bof() const {
    if (current_ < 0)
        return true;
    return current_ >= static_cast<long>(size()) && RecordCount() == 0;
}

int Recordset::AbsolutePosition() const {
    if (current_ < 0)
        return kPosBOF;
    if (current_ >= static_cast<long>(size()))
        return kPosEOF;
    if (filter_ == 0)
        return static_cast<int>(current_) + 1;
    int position = 0;
    for (std::size_t r = 0; r <= static_cast<std::size_t>(current_); ++r) {
        if (visible(r))
            ++position;
    }
    return position;
}

void Recordset::SetAbsolutePosition(int position) {
    if (position < 1 || position > RecordCount()) {
        throw RecordsetError("AbsolutePosition " + std::to_string(position) + " is outside 1.." +
                             std::to_string(RecordCount()));
    }
    if (filter_ == 0) {
        current_ = position - 1;
        return;
    }
    int seen = 0;
    for (std::size_t r = 0; r < size(); ++r) {
        if (visible(r) && ++seen == position) {
            current_ = static_cast<long>(r);
            return;
        }
    }
}

int Recordset::RecordCount() const {
    return static_cast<int>(filter_ == 0 ? size() : pendingCount());
}

int Recordset::Status() const {
    return static_cast<int>(status_[currentIndex()]);
}

int Recordset::Filter() const {
    return filter_;
}

void Recordset::SetFilter(int filter) {
    if (filter != 0 && filter != 1) {
        throw RecordsetError("Filter " + std::to_string(filter) +
                             " is not supported: 1 keeps pending records, 0 shows all");
    }
    filter_ = filter;
    MoveFirst();
}

// --- Service and wire side -----------------------------------------------

int Recordset::fieldIndex(std::string_view name) const {
    for (std::size_t i = 0; i < fields_.size(); ++i) {
        if (equalsIgnoringCase(fields_[i].name, name))
            return static_cast<int>(i);
    }
    return -1;
}

std::size_t Recordset::size() const {
    return status_.size();
}

void Recordset::reserve(std::size_t records) {
    cells_.reserve(records * fields_.size());
    status_.reserve(records);
    originalSlot_.reserve(records);
}

void Recordset::appendRecord(RecordStatus status) {
    cells_.resize(cells_.size() + fields_.size());
    status_.push_back(status);
    originalSlot_.push_back(0);
}

Value& Recordset::cellRef(std::size_t record, int field) {
    if (record >= size() || field < 0 || field >= FieldCount()) {
        throw RecordsetError("No cell at record " + std::to_string(record) + ", field " +
                             std::to_string(field));
    }
    return cells_[record * fields_.size() + static_cast<std::size_t>(field)];
}

const Value& Recordset::cell(std::size_t record, int field) const {
    if (record >= size() || field < 0 || field >= FieldCount()) {
        throw RecordsetError("No cell at record " + std::to_string(record) + ", field " +
                             std::to_string(field));
    }
    return cells_[record * fields_.size() + static_cast<std::size_t>(field)];
}

RecordStatus Recordset::status(std::size_t record) const {
    if (record >= size())
        throw RecordsetError("No record " + std::to_string(record));
    return status_[record];
}

const Value& Recordset::original(std::size_t record, int field) const {
    const Value& current = cell(record, field);
    uint32_t slot = originalSlot_[record];
    if (slot == 0)
        return current;
    return originals_[slot - 1][static_cast<std::size_t>(field)];
}

bool Recordset::hasOriginals(std::size_t record) const {
    if (record >= size())
        throw RecordsetError("No record " + std::to_string(record));
    return originalSlot_[record] != 0;
}

void Recordset::setOriginal(std::size_t record, int field, Value v) {
    cell(record, field);  // range check
    if (originalSlot_[record] == 0) {
        auto first = cells_.begin() + static_cast<std::ptrdiff_t>(record * fields_.size());
        originals_.emplace_back(first, first + static_cast<std::ptrdiff_t>(fields_.size()));
        originalSlot_[record] = static_cast<uint32_t>(originals_.size());
    }
    originals_[originalSlot_[record] - 1][static_cast<std::size_t>(field)] = std::move(v);
}

std::size_t Recordset::pendingCount() const {
    return static_cast<std::size_t>(
        std::count_if(status_.begin(), status_.end(),
                      [](RecordStatus s) { return s != RecordStatus::Unmodified; }));
}

void Recordset::settle() {
    const std::size_t width = fields_.size();
    std::size_t kept = 0;
    for (std::size_t r = 0; r < size(); ++r) {
        if (status_[r] == RecordStatus::Deleted)
            continue;
        if (kept != r) {
            std::move(cells_.begin() + static_cast<std::ptrdiff_t>(r * width),
                      cells_.begin() + static_cast<std::ptrdiff_t>((r + 1) * width),
                      cells_.begin() + static_cast<std::ptrdiff_t>(kept * width));
        }
        ++kept;
    }
    cells_.resize(kept * width);
    status_.assign(kept, RecordStatus::Unmodified);
    originalSlot_.assign(kept, 0);
    originals_.clear();
    MoveFirst();
}

void Recordset::mergeSettled(const Recordset& settled) {
    if (settled.fields_.size() != fields_.size()) {
        throw RecordsetError("The settled records have " + std::to_string(settled.fields_.size()) +
                             " fields, not " + std::to_string(fields_.size()));
    }
    for (std::size_t f = 0; f < fields_.size(); ++f) {
        if (!equalsIgnoringCase(settled.fields_[f].name, fields_[f].name) ||
            settled.fields_[f].type != fields_[f].type) {
            throw RecordsetError("The settled records' field " + std::to_string(f) + " is \"" +
                                 settled.fields_[f].name + "\", not \"" + fields_[f].name + "\"");
        }
    }
    std::vector<std::size_t> kept;     // New and Modified records
    std::vector<std::size_t> pending;  // every pending record, Deleted ones too
    for (std::size_t r = 0; r < size(); ++r) {
        if (status_[r] == RecordStatus::Unmodified)
            continue;
        pending.push_back(r);
        if (status_[r] != RecordStatus::Deleted)
            kept.push_back(r);
    }
    // The settled copy may or may not still hold the deleted records.
    const bool withDeleted = settled.size() != kept.size();
    if (withDeleted && settled.size() != pending.size()) {
        throw RecordsetError("The settled copy holds " + std::to_string(settled.size()) +
                             " records for " + std::to_string(kept.size()) + " pending ones");
    }
    const std::vector<std::size_t>& targets = withDeleted ? pending : kept;
    const std::size_t width = fields_.size();
    for (std::size_t i = 0; i < targets.size(); ++i) {
        std::size_t r = targets[i];
        if (status_[r] == RecordStatus::Deleted)
            continue;
        std::copy(settled.cells_.begin() + static_cast<std::ptrdiff_t>(i * width),
                  settled.cells_.begin() + static_cast<std::ptrdiff_t>((i + 1) * width),
                  cells_.begin() + static_cast<std::ptrdiff_t>(r * width));
    }
    settle();
}

std::size_t Recordset::currentIndex() const {
    if (current_ < 0 || current_ >= static_cast<long>(size())) {
        throw RecordsetError("Either BOF or EOF is True, or the current record has been deleted");
    }
    return static_cast<std::size_t>(current_);
}

void Recordset::markModified(std::size_t record) {
    if (status_[record] != RecordStatus::Unmodified)
        return;
    if (originalSlot_[record] == 0) {
        auto first = cells_.begin() + static_cast<std::ptrdiff_t>(record * fields_.size());
        originals_.emplace_back(first, first + static_cast<std::ptrdiff_t>(fields_.size()));
        originalSlot_[record] = static_cast<uint32_t>(originals_.size());
    }
    status_[record] = RecordStatus::Modified;
}

bool Recordset::visible(std::size_t record) const {
    return filter_ == 0 || status_[record] != RecordStatus::Unmodified;
}

}  // namespace kest
