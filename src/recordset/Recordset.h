#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "Value.h"

namespace kest {

// Per-record change state, with the platform's numbers.
enum class RecordStatus : int { New = 1, Modified = 2, Deleted = 4, Unmodified = 8 };

struct FieldDef {
    std::string name;
    ValueType type = ValueType::Text;  // Boolean, Integer, Double, Date or Text
    bool nullable = true;
    friend bool operator==(const FieldDef&, const FieldDef&) = default;
};

// A misuse of the recordset: an unknown field name, no current record, a
// position out of range, a malformed Find criteria.
class RecordsetError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

class Recordset;

// A field of the current record, as the platform's Fields(name) gives it.
// Reading or writing with no current record throws RecordsetError.
class Field {
public:
    const std::string& Name() const;
    ValueType Type() const;
    kest::Value Value() const;
    // Converts the value to the field's type (ConversionError when it cannot:
    // "" or "abc" into a number or a date field). Marks an unmodified record
    // modified, keeping its original values.
    void SetValue(const kest::Value& v);
    // The value as it was when the record was fetched or last settled.
    kest::Value OriginalValue() const;

private:
    friend class Recordset;
    Field(Recordset* rs, int index) : rs_(rs), index_(index) {}
    Recordset* rs_;
    int index_;
};

// A disconnected recordset: typed fields (field 0 is the record's key) and
// records, each with a change state and, once modified, its original values.
// It stands in for the platform's recordsets and offers their operations with
// the same meanings; the lower-case members are for the service and the wire.
class Recordset {
public:
    static constexpr int kPosBOF = -2;
    static constexpr int kPosEOF = -3;

    explicit Recordset(std::vector<FieldDef> fields);

    // --- The platform's operations ---------------------------------------
    Field Fields(std::string_view name);  // ignoring letter case; unknown: RecordsetError
    Field Fields(int index);              // 0-based
    int FieldCount() const;

    void AddNew();  // appends a New record (every field Null) and makes it current
    void Update();  // completes the current record's edit; a no-op otherwise
    // Marks the current record Deleted; it stays, with Status 4, until a batch
    // update settles it. A New record that is deleted is dropped at once and
    // never sent; the current position then moves to the next record.
    void Delete();
    // Searches forward from the current record (inclusive) for the first
    // record matching "<field> = <value>" (a number, or text in single quotes
    // with '' for a quote; text compares ignoring letter case). Without a
    // match the position is EOF (AbsolutePosition not above 0).
    void Find(std::string_view criteria);
    void MoveFirst();
    void MoveNext();
    bool Eof() const;
    bool Bof() const;
    int AbsolutePosition() const;            // 1-based among visible records; kPosBOF/kPosEOF
    void SetAbsolutePosition(int position);  // outside 1..RecordCount: RecordsetError
    int RecordCount() const;                 // visible records, with Deleted ones included
    int Status() const;                      // of the current record
    int Filter() const;
    void SetFilter(int filter);  // 1: only records with pending changes; 0: all

    // --- Service and wire side -------------------------------------------
    const std::vector<FieldDef>& fieldDefs() const { return fields_; }
    int fieldIndex(std::string_view name) const;  // ignoring letter case; -1 when unknown
    std::size_t size() const;                     // stored records, ignoring the filter
    void reserve(std::size_t records);
    // Appends a record with every cell Empty and the given state; the cells are
    // filled with cellRef. Originals, for Modified records, with setOriginal.
    void appendRecord(RecordStatus status = RecordStatus::Unmodified);
    Value& cellRef(std::size_t record, int field);
    const Value& cell(std::size_t record, int field) const;
    RecordStatus status(std::size_t record) const;
    // The original value of a cell: the stored original of a Modified or
    // Deleted record that was modified first, the cell itself otherwise.
    const Value& original(std::size_t record, int field) const;
    bool hasOriginals(std::size_t record) const;
    void setOriginal(std::size_t record, int field, Value v);
    std::size_t pendingCount() const;
    // Accepts every pending change: Deleted records are removed, the others
    // become Unmodified with their originals set to their values. The current
    // position goes to the first record.
    void settle();
    // Copies the cell values of `settled`, whose records correspond one to one,
    // in order, to this recordset's pending records (New and Modified ones;
    // Deleted ones are skipped on both sides when absent there), then settles.
    void mergeSettled(const Recordset& settled);

private:
    friend class Field;
    std::size_t currentIndex() const;  // RecordsetError when there is no current record
    void markModified(std::size_t record);
    bool visible(std::size_t record) const;

    std::vector<FieldDef> fields_;
    std::vector<Value> cells_;  // record-major, fields_.size() cells per record
    std::vector<RecordStatus> status_;
    // Original values of modified records only: index into originals_ plus one, 0 for none.
    std::vector<uint32_t> originalSlot_;
    std::vector<std::vector<Value>> originals_;
    long current_ = -1;  // stored index of the current record; -1 BOF, size() EOF
    int filter_ = 0;
};

using RecordsetPtr = std::shared_ptr<Recordset>;

}  // namespace kest
