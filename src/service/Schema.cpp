#include "service/Schema.h"
#include "recordset/AsciiText.h"

#include <cstddef>
#include <functional>
#include <utility>

#include "service/Errors.h"

namespace kest {

namespace {

constexpr ValueType B = ValueType::Boolean;
constexpr ValueType I = ValueType::Integer;
constexpr ValueType F = ValueType::Double;
constexpr ValueType D = ValueType::Date;
constexpr ValueType T = ValueType::Text;

// The key comes first and is required for new records; the stored column
// itself stays nullable, because legacy rows with null keys must survive
// until they are repaired.
TableDef table(std::string name, std::string key,
               std::vector<std::pair<std::string, ValueType>> rest) {
    TableDef def;
    def.name = std::move(name);
    def.fields.push_back(FieldDef{std::move(key), I, false});
    for (auto& [field, type] : rest)
        def.fields.push_back(FieldDef{std::move(field), type, true});
    return def;
}

TableDef lookupList(std::string name, std::string key) {
    return table(std::move(name), std::move(key), {{"Name", T}, {"Active", B}});
}

std::vector<TableDef> buildTables() {
    std::vector<TableDef> t;
    t.push_back(table("Users", "UserID",
                      {{"Name", T},
                       {"Firstname", T},
                       {"Lastname", T},
                       {"Address", T},
                       {"Description", T},
                       {"Company", T},
                       {"Email", T},
                       {"Phone", T},
                       {"Fax", T},
                       {"Security", I},
                       {"Active", B},
                       {"ExpiryDate", D},
                       {"Password", F},
                       {"PasswordChangeDate", D},
                       {"PasswordLifetime", I},
                       {"PasswordMinLength", I},
                       {"PasswordRemember", I},
                       {"LogonLastDate", D},
                       {"LogonFailDate", D},
                       {"LogonFailCount", I},
                       {"CreatedBy", T},
                       {"CreatedDate", D},
                       {"UpdatedBy", T},
                       {"UpdatedDate", D}}));
    t.push_back(table("Options", "OptionID", {{"Item", T}, {"Category", T}, {"Value", T}}));
    t.push_back(table("Events", "EventID", {{"Type", T}, {"Date", D}, {"Code", I}, {"Text", T}}));
    t.push_back(table(
        "AdministerTables", "ListID",
        {{"Name", T}, {"CanAddNew", B}, {"CanChangeID", B}, {"CanDelete", B}, {"Description", T}}));
    t.push_back(lookupList("ListGroups", "GroupID"));
    t.push_back(lookupList("ListUnits", "UnitID"));
    t.push_back(lookupList("ListPhases", "PhaseID"));
    t.push_back(lookupList("ListStatus", "StatusID"));
    t.push_back(lookupList("ListComplexity", "ComplexityID"));
    t.push_back(lookupList("ListDocumentStatus", "DocumentStatusID"));
    t.push_back(lookupList("ListDocumentTypes", "DocTypeID"));
    t.push_back(lookupList("ListMinuteType", "MinuteStatusID"));
    t.push_back(lookupList("ListProgrammes", "ProgrammeID"));
    t.push_back(table("PasswordHistory", "PasswordID",
                      {{"UserID", I}, {"Password", F}, {"PasswordChangeDate", D}}));
    t.push_back(table("Documents", "DocumentID",
                      {{"ProjectID", I}, {"Name", T}, {"DocTypeID", I}, {"DocumentStatusID", I}}));
    t.push_back(table("History", "HistoryID", {{"ProjectID", I}, {"Date", D}, {"Text", T}}));
    t.push_back(
        table("Milestones", "MilestoneID", {{"ProjectID", I}, {"Name", T}, {"DueDate", D}}));
    t.push_back(table("Minutes", "MinuteID",
                      {{"ProjectID", I}, {"Date", D}, {"MinuteStatusID", I}, {"Text", T}}));
    t.push_back(table("Projects", "ProjectID", {{"Name", T}, {"Description", T}, {"Active", B}}));
    return t;
}

std::string columnType(Dialect dialect, ValueType type) {
    switch (type) {
        case ValueType::Boolean:
        case ValueType::Integer:
            return "INTEGER";
        case ValueType::Double:
        case ValueType::Date:
            // PostgreSQL's REAL has only single precision.
            return dialect == Dialect::PostgreSQL ? "DOUBLE PRECISION" : "REAL";
        default:
            return "TEXT";
    }
}

std::string rowIdColumn(Dialect dialect) {
    return quoteIdent(kRowIdColumn) +
           (dialect == Dialect::PostgreSQL ? " BIGSERIAL PRIMARY KEY" : " INTEGER PRIMARY KEY");
}

// Version 1: every public table, its indexes, and the service's own tables.
Status createVersion1(Connection& db) {
    Dialect dialect = db.dialect();
    for (const TableDef& def : publicTables()) {
        std::string sql = "CREATE TABLE " + quoteIdent(def.name) + " (" + rowIdColumn(dialect);
        for (const FieldDef& f : def.fields)
            sql += ", " + quoteIdent(f.name) + " " + columnType(dialect, f.type);
        sql += ")";
        KEST_TRY(db.execute(sql));
        KEST_TRY(db.execute("CREATE INDEX " + quoteIdent("ix_" + def.name + "_" + def.key().name) +
                            " ON " + quoteIdent(def.name) + " (" + quoteIdent(def.key().name) +
                            ")"));
    }
    KEST_TRY(db.execute("CREATE UNIQUE INDEX " + quoteIdent("ux_Users_Name") + " ON " +
                        quoteIdent("Users") + " (lower(" + quoteIdent("Name") + "))"));
    KEST_TRY(db.execute("CREATE INDEX " + quoteIdent("ix_PasswordHistory_UserID") + " ON " +
                        quoteIdent("PasswordHistory") + " (" + quoteIdent("UserID") + ")"));
    KEST_TRY(db.execute("CREATE TABLE " + quoteIdent(kSchemaVersionTable) + " (" +
                        quoteIdent("Version") + " INTEGER NOT NULL)"));
    KEST_TRY(db.execute("CREATE TABLE " + quoteIdent(kKeysTable) + " (" + quoteIdent("KeyField") +
                        " TEXT PRIMARY KEY, " + quoteIdent("Next") + " INTEGER NOT NULL)"));
    KEST_TRY(db.execute("CREATE TABLE " + quoteIdent(kSessionsTable) + " (" + quoteIdent("Ticket") +
                        " TEXT PRIMARY KEY, " + quoteIdent("UserID") + " INTEGER, " +
                        quoteIdent("Restricted") + " INTEGER, " + quoteIdent("LastUsed") + " " +
                        columnType(dialect, ValueType::Date) + ")"));
    Value zero(int32_t{0});
    return db.execute(
        "INSERT INTO " + quoteIdent(kSchemaVersionTable) + " VALUES (" + db.param(1) + ")",
        std::span<const Value>(&zero, 1));
}

struct MigrationStep {
    int version;  // the version the database has once the step ran
    std::function<Status(Connection&)> apply;
};

// Later versions append their steps; a step never changes once released.
const std::vector<MigrationStep>& migrationSteps() {
    static const std::vector<MigrationStep> steps{{1, createVersion1}};
    return steps;
}

Result<bool> hasVersionTable(Connection& db) {
    std::string sql;
    if (db.dialect() == Dialect::PostgreSQL)
        sql =
            "SELECT 1 FROM information_schema.tables WHERE table_schema = current_schema() "
            "AND table_name = " +
            db.param(1);
    else
        sql = "SELECT 1 FROM sqlite_master WHERE type = 'table' AND name = " + db.param(1);
    Value name{std::string(kSchemaVersionTable)};
    bool found = false;
    KEST_TRY(
        db.query(sql, std::span<const Value>(&name, 1), [&](const RowView&) { found = true; }));
    return found;
}

}  // namespace

const FieldDef* TableDef::field(std::string_view fieldName) const {
    for (const FieldDef& f : fields) {
        if (equalsIgnoringCase(f.name, fieldName))
            return &f;
    }
    return nullptr;
}

const std::vector<TableDef>& publicTables() {
    static const std::vector<TableDef> tables = buildTables();
    return tables;
}

const TableDef* findTable(std::string_view name) {
    for (const TableDef& def : publicTables()) {
        if (equalsIgnoringCase(def.name, name))
            return &def;
    }
    return nullptr;
}

std::vector<const TableDef*> tablesWithKey(std::string_view keyField) {
    std::vector<const TableDef*> found;
    for (const TableDef& def : publicTables()) {
        if (equalsIgnoringCase(def.key().name, keyField))
            found.push_back(&def);
    }
    return found;
}

std::string quoteIdent(std::string_view name) {
    std::string quoted;
    quoted.reserve(name.size() + 2);
    quoted += '"';
    for (char c : name) {
        if (c == '"')
            quoted += '"';
        quoted += c;
    }
    quoted += '"';
    return quoted;
}

Result<int> schemaVersion(Connection& db) {
    auto exists = hasVersionTable(db);
    if (!exists.ok())
        return exists.error();
    if (!exists.value())
        return 0;
    int version = -1;
    int rows = 0;
    KEST_TRY(
        db.query("SELECT " + quoteIdent("Version") + " FROM " + quoteIdent(kSchemaVersionTable), {},
                 [&](const RowView& row) {
                     ++rows;
                     version = row.isNull(0) ? -1 : static_cast<int>(row.getInt(0));
                 }));
    if (rows != 1 || version < 0)
        return Error{err::kSchemaVersion, "the database's schema version record is damaged"};
    return version;
}

Status migrate(Connection& db) {
    // Reading the version inside the write transaction keeps two services
    // that open a fresh database at once from both creating it.
    KEST_TRY(db.begin());
    auto run = [&]() -> Status {
        auto stored = schemaVersion(db);
        if (!stored.ok())
            return stored.error();
        int version = stored.value();
        if (version > kSchemaVersion) {
            return Error{err::kSchemaVersion, "the database has schema version " +
                                                  std::to_string(version) +
                                                  ", this service knows versions up to " +
                                                  std::to_string(kSchemaVersion)};
        }
        for (const MigrationStep& step : migrationSteps()) {
            if (step.version <= version || step.version > kSchemaVersion)
                continue;
            KEST_TRY(step.apply(db));
            Value v(int32_t{step.version});
            KEST_TRY(db.execute("UPDATE " + quoteIdent(kSchemaVersionTable) + " SET " +
                                    quoteIdent("Version") + " = " + db.param(1),
                                std::span<const Value>(&v, 1)));
            version = step.version;
        }
        return okStatus();
    };
    Status result = run();
    if (!result.ok()) {
        (void)db.rollback();
        return result;
    }
    return db.commit();
}

}  // namespace kest
