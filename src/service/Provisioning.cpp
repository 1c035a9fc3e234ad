#include "service/Provisioning.h"
#include "recordset/AsciiText.h"

#include <cmath>
#include <random>
#include <span>
#include <system_error>
#include <utility>
#include <vector>

#include "recordset/Value.h"
#include "service/Connection.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Password.h"
#include "service/Schema.h"

namespace kest {

namespace {

constexpr const char* kCreator = "kestlogon";

Error badArgument(std::string why) {
    return Error{err::kBadArgument, std::move(why)};
}

// Inserts one row; `values` follow the table's fields in order, and missing
// trailing values are stored as NULL.
Status insertRow(Connection& db, const TableDef& table, std::vector<Value> values) {
    values.resize(table.fields.size(), Value::null());
    std::string sql = "INSERT INTO " + quoteIdent(table.name) + " (";
    std::string marks;
    for (std::size_t i = 0; i < table.fields.size(); ++i) {
        if (i > 0) {
            sql += ", ";
            marks += ", ";
        }
        sql += quoteIdent(table.fields[i].name);
        marks += db.param(static_cast<int>(i) + 1);
    }
    sql += ") VALUES (" + marks + ")";
    return db.execute(sql, values);
}

const TableDef& tableNamed(std::string_view name) {
    return *findTable(name);
}

Value days(double d) {
    return Value(Date{d});
}
Value integer(int32_t i) {
    return Value(i);
}

struct ListSpec {
    const char* table;
    bool canAddNew, canChangeID, canDelete;
    const char* description;
    std::vector<const char*> items;  // a leading '-' marks an inactive item
};

const std::vector<ListSpec>& lookupLists() {
    static const std::vector<ListSpec> lists{
        {"ListGroups",
         true,
         true,
         true,
         "Working groups that projects and users belong to",
         {"Engineering", "Finance", "Marketing", "Operations", "Research", "-Legacy Systems",
          "Sales", "Quality"}},
        {"ListUnits",
         true,
         true,
         false,
         "Organisational units responsible for projects",
         {"Head Office", "North Region", "South Region", "-East Region", "Central Services",
          "Field Support"}},
        {"ListPhases",
         true,
         true,
         false,
         "Phases a project passes through",
         {"Initiation", "Planning", "Design", "Build", "Test", "Rollout", "Closure",
          "-Feasibility"}},
        {"ListStatus",
         false,
         true,
         false,
         "Status values of projects",
         {"Proposed", "Approved", "Active", "On hold", "Completed", "Cancelled", "-Archived"}},
        {"ListComplexity",
         false,
         true,
         false,
         "Complexity grades used for estimates",
         {"Trivial", "Low", "Medium", "High", "Very high", "-Unknown"}},
        {"ListDocumentStatus",
         true,
         true,
         false,
         "Review status of project documents",
         {"Draft", "In review", "Approved", "Released", "Superseded", "-Withdrawn"}},
        {"ListDocumentTypes",
         true,
         true,
         true,
         "Kinds of documents kept for projects",
         {"Requirements", "Plan", "Report", "Contract", "Minutes", "Drawing", "Invoice",
          "Presentation", "Manual", "-Fax"}},
        {"ListMinuteType",
         true,
         true,
         false,
         "Kinds of meeting minutes",
         {"Kick-off", "Progress meeting", "Steering committee", "Review", "Workshop",
          "-Telephone conference"}},
        {"ListProgrammes",
         true,
         false,
         false,
         "Programmes that group related projects",
         {"Digital Workplace", "Customer Experience", "Infrastructure Renewal", "Compliance",
          "Growth", "-Year 2000"}},
    };
    return lists;
}

Status insertAdministerTables(Connection& db) {
    const TableDef& admin = tableNamed("AdministerTables");
    int32_t id = 0;
    for (const ListSpec& list : lookupLists()) {
        KEST_TRY(
            insertRow(db, admin,
                      {integer(++id), Value(list.table), Value(list.canAddNew),
                       Value(list.canChangeID), Value(list.canDelete), Value(list.description)}));
    }
    return okStatus();
}

Status insertAdmin(Connection& db, const InitOptions& options, double code, Date now) {
    const TableDef& users = tableNamed("Users");
    std::vector<Value> row(users.fields.size(), Value::null());
    auto set = [&](std::string_view field, Value v) {
        row[static_cast<std::size_t>(users.field(field) - users.fields.data())] = std::move(v);
    };
    set("UserID", integer(1));
    set("Name", Value(options.adminName));
    set("Firstname", Value(""));
    set("Lastname", Value(options.adminName));
    set("Description", Value("Administrator"));
    set("Security", integer(8));
    set("Active", Value(true));
    set("ExpiryDate", Value(Date{0}));
    set("Password", Value(code));
    set("PasswordChangeDate", Value(now));
    set("PasswordLifetime", integer(0));
    set("PasswordMinLength", integer(0));
    set("PasswordRemember", integer(0));
    set("LogonFailCount", integer(0));
    set("CreatedBy", Value(kCreator));
    set("CreatedDate", Value(now));
    set("UpdatedBy", Value(kCreator));
    set("UpdatedDate", Value(now));
    return insertRow(db, users, std::move(row));
}

// ---- Demo data ----------------------------------------------------------

const char* const kFirstNames[] = {
    "Anna",    "Brian",  "Carla",  "David",   "Elena",   "Frank",  "Grace",  "Henry",
    "Irene",   "James",  "Karen",  "Lars",    "Maria",   "Niall",  "Olivia", "Peter",
    "Quentin", "Rachel", "Samuel", "Tara",    "Ursula",  "Victor", "Wendy",  "Xavier",
    "Yvonne",  "Zoltan", "Agnes",  "Bernard", "Chloe",   "Dmitri", "Esther", "Felix",
    "Gemma",   "Hugo",   "Ingrid", "Jonas",   "Kirsten", "Liam",   "Miriam", "Oscar"};
const char* const kLastNames[] = {
    "Andersen",  "Brooks", "Castillo", "Dunmore",   "Eriksson", "Fischer",  "Garvey",   "Hollis",
    "Iversen",   "Jansen", "Kowalski", "Lindqvist", "Moreau",   "Nakamura", "O'Brien",  "Petrov",
    "Quinlan",   "Rossi",  "Santos",   "Thornton",  "Ulrich",   "Varga",    "Whitaker", "Xu",
    "Young",     "Zimmer", "Abbott",   "Bauer",     "Clarke",   "Delgado",  "Ellison",  "Fontaine",
    "Gallagher", "Hughes", "Ito",      "Jovanovic", "Keller",   "Larsen",   "Meyer",    "Novak"};
const char* const kCompanies[] = {"Northwind Consulting", "Harbour Engineering",
                                  "Bluefield Partners", ""};
const char* const kDescriptions[] = {"Project manager", "Analyst",   "Developer", "Controller",
                                     "Team lead",       "Assistant", "Auditor",   "Architect"};

struct DemoUser {
    std::string name;
    bool lifetimeExpired;
};

Status insertDemoUsers(Connection& db, const InitOptions& options, Date now, double nowCode,
                       double oldCode, Date oldChange, int32_t& nextUserId) {
    const TableDef& users = tableNamed("Users");
    std::string adminLower = asciiLower(options.adminName);
    constexpr int32_t kLevels[] = {0, 1, 2, 4, 8};
    int count = static_cast<int>(std::size(kFirstNames));
    for (int i = 0; i < count; ++i) {
        std::string first = kFirstNames[i];
        std::string last = kLastNames[i];
        std::string logon = asciiLower(first.substr(0, 1) + last);
        std::erase(logon, '\'');
        if (logon == adminLower)
            continue;
        bool inactive = i % 7 == 3;
        bool expired = i % 9 == 4;
        bool failing = i % 5 == 2;
        bool lifetimeExpired = i % 8 == 6;
        std::vector<Value> row(users.fields.size(), Value::null());
        auto set = [&](std::string_view field, Value v) {
            row[static_cast<std::size_t>(users.field(field) - users.fields.data())] = std::move(v);
        };
        int32_t id = nextUserId++;
        set("UserID", integer(id));
        set("Name", Value(logon));
        set("Firstname", Value(first));
        set("Lastname", Value(last));
        set("Address", Value(std::to_string(10 + i * 7) + " Market Street\nSpringfield"));
        set("Description", Value(kDescriptions[i % std::size(kDescriptions)]));
        set("Company", Value(kCompanies[i % std::size(kCompanies)]));
        set("Email", Value(logon + "@example.com"));
        set("Phone", Value("+44 20 7946 " + std::to_string(1000 + i * 37)));
        set("Fax", i % 4 == 0 ? Value("+44 20 7946 " + std::to_string(5000 + i)) : Value(""));
        set("Security", integer(kLevels[i % 5]));
        set("Active", Value(!inactive));
        double expiry = 0;
        if (expired)
            expiry = now.days - 10 - i;
        else if (i % 6 == 1)
            expiry = std::floor(now.days) + 120 + i;
        set("ExpiryDate", days(expiry));
        set("Password", Value(lifetimeExpired ? oldCode : nowCode));
        set("PasswordChangeDate", Value(lifetimeExpired ? oldChange : now));
        set("PasswordLifetime", integer(lifetimeExpired ? 90 : (i % 3 == 0 ? 365 : 0)));
        set("PasswordMinLength", integer(i % 4 == 1 ? 6 : 0));
        set("PasswordRemember", integer(i % 5 == 0 ? 3 : 0));
        set("LogonLastDate", i % 10 == 9 ? Value::null() : days(now.days - (i % 30) - 0.25));
        set("LogonFailDate", failing ? days(now.days - (i % 4) - 0.1) : Value::null());
        set("LogonFailCount", integer(failing ? 1 + i % 4 : 0));
        set("CreatedBy", Value(kCreator));
        set("CreatedDate", days(now.days - 400 + i));
        set("UpdatedBy", Value(kCreator));
        set("UpdatedDate", days(now.days - 20 + (i % 20)));
        KEST_TRY(insertRow(db, users, std::move(row)));
    }
    return okStatus();
}

Status insertDemoOptions(Connection& db) {
    struct Opt {
        const char *category, *item, *value;
    };
    static const Opt opts[] = {
        {"General", "CompanyName", "Northwind Consulting"},
        {"General", "Currency", "EUR"},
        {"General", "FiscalYearStart", "01-04"},
        {"General", "Motto", ""},
        {"Logon", "PasswordLifetimeDefault", "90"},
        {"Logon", "PasswordMinLengthDefault", "6"},
        {"Logon", "WelcomeText", "Welcome to the project database"},
        {"Logon", "Banner", ""},
        {"Projects", "DefaultPhase", "Initiation"},
        {"Projects", "NumberFormat", "P-0000"},
        {"Projects", "ArchiveAfterDays", "365"},
        {"Mail", "SmtpServer", "mail.example.com"},
        {"Mail", "Sender", "projects@example.com"},
        {"Reports", "Logo", "logo.png"},
        {"Reports", "PageSize", "A4"},
    };
    const TableDef& options = tableNamed("Options");
    int32_t id = 0;
    for (const Opt& o : opts)
        KEST_TRY(insertRow(db, options,
                           {integer(++id), Value(o.item), Value(o.category), Value(o.value)}));
    return okStatus();
}

Status insertDemoEvents(Connection& db, Date now, const std::vector<std::string>& names) {
    static const char* const kTypes[] = {"Logon", "Logon failed", "Password changed",
                                         "Identifier repaired", "Batch update"};
    static const char* const kTables[] = {"Users", "Options", "Events", "ListGroups",
                                          "ListDocumentTypes"};
    const TableDef& events = tableNamed("Events");
    std::mt19937 rng(20240611);
    constexpr int kCount = 1000;
    constexpr double kSpanDays = 180;
    for (int i = 0; i < kCount; ++i) {
        // Mostly logons, as in a real log.
        int r = static_cast<int>(rng() % 100);
        int type = r < 60 ? 0 : r < 75 ? 1 : r < 85 ? 2 : r < 88 ? 3 : 4;
        const std::string& user = names[rng() % names.size()];
        double when = now.days - kSpanDays + kSpanDays * i / kCount +
                      static_cast<double>(rng() % 3600) / 86400.0;
        std::string text;
        switch (type) {
            case 0:
                text = "User " + user + " logged on";
                break;
            case 1:
                text = "Wrong password for user " + user;
                break;
            case 2:
                text = "User " + user + " changed the password";
                break;
            case 3:
                text = "Gave record " + std::to_string(rng() % 50 + 1) + " of " +
                       kTables[rng() % std::size(kTables)] + " a new identifier";
                break;
            default:
                text = std::string("Batch update of ") + kTables[rng() % std::size(kTables)] +
                       " by " + user + ": " + std::to_string(rng() % 5) + " added, " +
                       std::to_string(rng() % 5 + 1) + " changed, " + std::to_string(rng() % 3) +
                       " deleted";
                break;
        }
        KEST_TRY(insertRow(db, events,
                           {integer(i + 1), Value(kTypes[type]),
                            days(roundToSecond(Date{when}).days), integer(type + 1), Value(text)}));
    }
    return okStatus();
}

Status insertDemoLists(Connection& db) {
    for (const ListSpec& list : lookupLists()) {
        const TableDef& def = tableNamed(list.table);
        int32_t id = 0;
        for (const char* item : list.items) {
            bool active = item[0] != '-';
            KEST_TRY(insertRow(db, def,
                               {integer(++id), Value(active ? item : item + 1), Value(active)}));
        }
    }
    return okStatus();
}

Status insertDemoProjects(Connection& db, Date now) {
    static const char* const kProjects[] = {"Intranet relaunch", "Warehouse automation",
                                            "Customer portal",   "Data centre move",
                                            "Annual audit 2023", "Mobile sales app"};
    const TableDef& projects = tableNamed("Projects");
    const TableDef& documents = tableNamed("Documents");
    const TableDef& milestones = tableNamed("Milestones");
    const TableDef& minutes = tableNamed("Minutes");
    const TableDef& history = tableNamed("History");
    int32_t project = 0, document = 0, milestone = 0, minute = 0, entry = 0;
    for (const char* name : kProjects) {
        ++project;
        KEST_TRY(insertRow(db, projects,
                           {integer(project), Value(name),
                            Value(std::string("The ") + name + " project"), Value(project != 5)}));
        double start = std::floor(now.days) - 200 + project * 15;
        for (int d = 0; d < 3; ++d) {
            KEST_TRY(insertRow(db, documents,
                               {integer(++document), integer(project),
                                Value(std::string(name) + (d == 0   ? " - requirements"
                                                           : d == 1 ? " - plan"
                                                                    : " - status report")),
                                integer(d == 0   ? 1
                                        : d == 1 ? 2
                                                 : 3),
                                integer(1 + (d + project) % 5)}));
        }
        for (int m = 0; m < 2; ++m) {
            KEST_TRY(insertRow(
                db, milestones,
                {integer(++milestone), integer(project),
                 Value(m == 0 ? "Design approved" : "Go live"), days(start + 60 + 90 * m)}));
        }
        KEST_TRY(insertRow(db, minutes,
                           {integer(++minute), integer(project), days(start + 1.4), integer(1),
                            Value("Kick-off: scope, team and schedule agreed")}));
        KEST_TRY(insertRow(db, minutes,
                           {integer(++minute), integer(project), days(start + 30.6), integer(2),
                            Value("Progress: on schedule, two risks noted")}));
        KEST_TRY(
            insertRow(db, history,
                      {integer(++entry), integer(project), days(start), Value("Project created")}));
        KEST_TRY(insertRow(db, history,
                           {integer(++entry), integer(project), days(start + 5.5),
                            Value("Phase changed to Planning")}));
    }
    return okStatus();
}

// Each key counter starts past the largest key its tables hold.
Status setKeyCounters(Connection& db) {
    for (const TableDef& def : publicTables()) {
        std::string sql = "INSERT INTO " + quoteIdent(kKeysTable) + " (" + quoteIdent("KeyField") +
                          ", " + quoteIdent("Next") + ") SELECT " + db.param(1) +
                          ", COALESCE(MAX(" + quoteIdent(def.key().name) + "), 0) + 1 FROM " +
                          quoteIdent(def.name);
        Value field(def.key().name);
        KEST_TRY(db.execute(sql, std::span<const Value>(&field, 1)));
    }
    return okStatus();
}

Status populate(Connection& db, const InitOptions& options, const KeyMaterial& key) {
    Date now = nowDate();
    auto code = passwordCode(key, options.password, now);
    if (!code.ok())
        return code.error();
    KEST_TRY(insertAdministerTables(db));
    KEST_TRY(insertAdmin(db, options, code.value(), now));
    if (options.demo) {
        // Only two change moments, so that only two codes need the slow hash.
        Date oldChange = roundToSecond(Date{now.days - 200.25});
        auto oldCode = passwordCode(key, options.password, oldChange);
        if (!oldCode.ok())
            return oldCode.error();
        int32_t nextUser = 2;
        KEST_TRY(
            insertDemoUsers(db, options, now, code.value(), oldCode.value(), oldChange, nextUser));
        KEST_TRY(insertDemoOptions(db));
        std::vector<std::string> names{options.adminName};
        for (std::size_t i = 0; i < 12; ++i)
            names.push_back(asciiLower(std::string(1, kFirstNames[i][0]) + kLastNames[i]));
        KEST_TRY(insertDemoEvents(db, now, names));
        KEST_TRY(insertDemoLists(db));
        KEST_TRY(insertDemoProjects(db, now));
    }
    return setKeyCounters(db);
}

void removeQuietly(const std::filesystem::path& p) {
    std::error_code ignored;
    std::filesystem::remove(p, ignored);
}

}  // namespace

Status initDataSource(const InitOptions& options) {
    if (!validDataSourceName(options.dsn))
        return badArgument("\"" + options.dsn +
                           "\" is not a valid data-source name (letters, digits, '_', '-', '.' "
                           "and blanks, 1 to 64 characters)");
    if (normalisePassword(options.adminName).empty())
        return badArgument("the administrator needs a name");
    if (options.adminName.size() > 255)
        return badArgument("the administrator's name is too long");
    if (normalisePassword(options.password).empty())
        return badArgument("the administrator's password must not be blank");
    if (options.dataDir.empty())
        return badArgument("no data folder was given");

    std::error_code ec;
    std::filesystem::create_directories(options.dataDir, ec);
    if (ec)
        return Error{err::kStorage, "cannot create the data folder " + options.dataDir.string() +
                                        ": " + ec.message()};
    auto known = loadDataSources(options.dataDir);
    if (!known.ok())
        return known.error();
    for (const DataSourceConfig& c : known.value()) {
        if (asciiLower(c.name) == asciiLower(options.dsn))
            return badArgument("the data source " + c.name + " already exists");
    }

    std::string stem = asciiLower(options.dsn);
    DataSourceConfig config{options.dsn, "sqlite", stem + ".db", stem + ".key"};
    std::filesystem::path dbFile = resolvePath(options.dataDir, config.database);
    std::filesystem::path keyFile = resolvePath(options.dataDir, config.keyFile);
    for (const auto& p : {dbFile, std::filesystem::path(dbFile.string() + "-wal"), keyFile}) {
        if (std::filesystem::exists(p, ec))
            return badArgument("the file " + p.string() +
                               " already exists; remove it or choose another name");
    }

    auto key = createKeyFile(keyFile);
    if (!key.ok())
        return key.error();
    auto cleanUp = [&] {
        removeQuietly(dbFile);
        removeQuietly(dbFile.string() + "-wal");
        removeQuietly(dbFile.string() + "-shm");
        removeQuietly(keyFile);
    };
    Status filled = [&]() -> Status {
        auto db = openSqlite(dbFile, true);
        if (!db.ok())
            return db.error();
        Connection& conn = *db.value();
        KEST_TRY(migrate(conn));
        KEST_TRY(conn.begin());
        Status s = populate(conn, options, key.value());
        if (!s.ok()) {
            (void)conn.rollback();
            return s;
        }
        return conn.commit();
    }();
    if (filled.ok())
        filled = saveDataSource(options.dataDir, config);
    if (!filled.ok()) {
        cleanUp();
        return filled;
    }
    return okStatus();
}

}  // namespace kest
