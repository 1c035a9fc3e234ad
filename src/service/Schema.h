#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "Connection.h"
#include "Result.h"
#include "recordset/Recordset.h"

namespace kest {

// A table the service hands out. Field 0 is the record's key (a whole number).
// Every stored table also has a hidden "_rid" column that addresses rows even
// while their keys are null or duplicated; it never leaves the service.
struct TableDef {
    std::string name;
    std::vector<FieldDef> fields;
    const FieldDef& key() const { return fields.front(); }
    // The field of that name ignoring letter case, or nullptr.
    const FieldDef* field(std::string_view name) const;
};

constexpr int kSchemaVersion = 1;

// Every public table, in a stable order.
const std::vector<TableDef>& publicTables();
// The table of that name ignoring letter case, or nullptr: the one gate a
// table name passes before it reaches SQL.
const TableDef* findTable(std::string_view name);
// Tables that use a key field of that name (ignoring letter case).
std::vector<const TableDef*> tablesWithKey(std::string_view keyField);

// Quotes a name that has passed the schema check, for SQL.
std::string quoteIdent(std::string_view name);

// The service's own tables, never public and never reachable by findTable:
//   "_SchemaVersion" (Version INTEGER): one row, the stored schema version;
//   "_Keys" (KeyField TEXT PRIMARY KEY, Next INTEGER): per key field name, as
//       spelt in the schema ("UserID"), the next key to hand out;
//   "_Sessions" (Ticket TEXT PRIMARY KEY, UserID INTEGER, Restricted INTEGER,
//       LastUsed REAL).
// Every public table has "_rid" INTEGER PRIMARY KEY, a non-unique index on its
// key field, and "Users" a unique index on lower(Name).
constexpr std::string_view kRowIdColumn = "_rid";
constexpr std::string_view kKeysTable = "_Keys";
constexpr std::string_view kSessionsTable = "_Sessions";
constexpr std::string_view kSchemaVersionTable = "_SchemaVersion";

// Creates the schema in an empty database, or migrates an older one to
// kSchemaVersion inside one transaction. A database newer than this build is
// refused (err::kSchemaVersion).
Status migrate(Connection& db);
// The stored schema version (0 for an empty database).
Result<int> schemaVersion(Connection& db);

}  // namespace kest
