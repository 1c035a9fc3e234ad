#include "service/ServiceCore.h"

#include <sodium.h>

#include <algorithm>
#include <cctype>
#include <climits>
#include <cmath>
#include <exception>
#include <optional>
#include <set>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "service/Connection.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Password.h"
#include "service/Schema.h"

namespace kest {

namespace {

constexpr std::string_view kRid = kRowIdColumn;

// A session's LastUsed is rewritten at most this often, so that a busy client
// does not cost a write per call.
constexpr double kLastUsedGranularity = 60.0;  // seconds

// Event codes, one per kind of event the service records.
constexpr int32_t kEventLogon = 1;
constexpr int32_t kEventLogonFailed = 2;
constexpr int32_t kEventPasswordChanged = 3;
constexpr int32_t kEventIdRepaired = 4;
constexpr int32_t kEventBatchUpdate = 5;

// Keys stay below this, so that the counter's next value still fits a 32-bit field.
constexpr int64_t kKeyLimit = INT32_MAX;

// Bounds the memory an attacker can make the failure map take by trying names.
constexpr std::size_t kMaxTrackedNames = 10000;

std::string lower(std::string_view s) {
    std::string out(s);
    for (char& c : out)
        c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return out;
}

std::string trim(std::string_view s) {
    auto blank = [](char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; };
    while (!s.empty() && blank(s.front()))
        s.remove_prefix(1);
    while (!s.empty() && blank(s.back()))
        s.remove_suffix(1);
    return std::string(s);
}

bool equalNoCase(std::string_view a, std::string_view b) {
    return lower(a) == lower(b);
}

// Characters, not bytes: a minimum length means what the user typed.
std::size_t utf8Length(std::string_view s) {
    std::size_t n = 0;
    for (char c : s) {
        if ((static_cast<unsigned char>(c) & 0xC0) != 0x80)
            ++n;
    }
    return n;
}

Error fail(int32_t number, const std::string& detail) {
    return Error{number, describeError(number) + ": " + detail};
}

// Prefixes a storage failure with what the service was doing.
Error storageFailure(const Error& e, const std::string& doing) {
    return Error{e.number, "while " + doing + ": " + e.description};
}

double unixNow() {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch())
        .count();
}

// Builds one statement: names pass through quoteIdent only after the schema
// check, every value becomes a parameter.
class Sql {
public:
    explicit Sql(Connection& db) : db_(db) {}
    Sql& operator<<(std::string_view text) {
        text_ += text;
        return *this;
    }
    Sql& name(std::string_view ident) {
        text_ += quoteIdent(ident);
        return *this;
    }
    Sql& value(Value v) {
        params_.push_back(std::move(v));
        text_ += db_.param(static_cast<int>(params_.size()));
        return *this;
    }
    // "a IS b" with nulls equal to each other, in the connection's dialect.
    Sql& nullSafeEquals(std::string_view column, Value v) {
        name(column);
        *this << (db_.dialect() == Dialect::PostgreSQL ? " IS NOT DISTINCT FROM " : " IS ");
        return value(std::move(v));
    }
    Status execute(int64_t* changed = nullptr) { return db_.execute(text_, params_, changed); }
    Status query(const std::function<void(const RowView&)>& onRow) {
        return db_.query(text_, params_, onRow);
    }

private:
    Connection& db_;
    std::string text_;
    std::vector<Value> params_;
};

// A stored cell in the form the schema gives its field.
Value readCell(const RowView& row, int column, ValueType type) {
    if (row.isNull(column))
        return Value::null();
    switch (type) {
        case ValueType::Boolean:
            return Value(row.getInt(column) != 0);
        case ValueType::Integer: {
            int64_t v = row.getInt(column);
            if (v < INT32_MIN || v > INT32_MAX)
                return Value(static_cast<double>(v));
            return Value(static_cast<int32_t>(v));
        }
        case ValueType::Double:
            return Value(row.getDouble(column));
        case ValueType::Date:
            return Value(Date{row.getDouble(column)});
        default:
            return Value(row.getText(column));
    }
}

// Row ids are bound as whole numbers while they fit the value type.
Value ridValue(int64_t rid) {
    if (rid >= INT32_MIN && rid <= INT32_MAX)
        return Value(static_cast<int32_t>(rid));
    return Value(static_cast<double>(rid));
}

std::optional<int64_t> readKey(const RowView& row, int column) {
    if (row.isNull(column))
        return std::nullopt;
    return row.getInt(column);
}

// Runs `body` inside one write transaction: committed when it succeeds, rolled
// back when it fails or throws.
template <class T, class F>
Result<T> inTransaction(Connection& db, F&& body) {
    KEST_TRY(db.begin());
    std::optional<Result<T>> result;
    try {
        result.emplace(body());
    } catch (const std::exception& e) {
        result.emplace(fail(err::kInternal, e.what()));
    }
    if (!result->ok()) {
        (void)db.rollback();
        return std::move(*result);
    }
    Status committed = db.commit();
    if (!committed.ok()) {
        (void)db.rollback();
        return committed.error();
    }
    return std::move(*result);
}

// Turns an escaping exception into an error: a bad argument must never end
// the server.
template <class T, class F>
Result<T> guarded(F&& body) {
    try {
        return body();
    } catch (const std::exception& e) {
        return fail(err::kInternal, e.what());
    }
}

const TableDef& usersTable() {
    static const TableDef* users = findTable("Users");
    return *users;
}

// The fields of a user that logon, password change and rights checks read.
struct UserRow {
    int64_t rid = 0;
    Value userId, name, firstname, lastname, security, minLength, password, changeDate, lifetime,
        remember, active, expiry, failCount;

    int32_t id() const { return userId.isNull() ? 0 : userId.toInt(); }
    std::string displayName() const { return name.isNull() ? std::string() : name.toText(); }
    int32_t intOr(const Value& v, int32_t fallback) const {
        return v.isNull() || v.isEmpty() ? fallback : v.toInt();
    }
    double passwordCodeStored() const {
        return password.isNull() || password.isEmpty() ? 0.0 : password.toDouble();
    }
    bool isActive() const { return !active.isNull() && !active.isEmpty() && active.toBool(); }
    // The account works through the whole of its expiry day, as the user
    // editor shows it: a date of yesterday is expired, today's is not.
    bool hasExpired(Date now) const {
        if (expiry.isNull() || expiry.isEmpty())
            return false;
        double day = expiry.toDate().days;
        return day > 0 && std::floor(day) < std::floor(now.days);
    }
};

constexpr const char* kUserColumns[] = {"UserID",           "Name",
                                        "Firstname",        "Lastname",
                                        "Security",         "PasswordMinLength",
                                        "Password",         "PasswordChangeDate",
                                        "PasswordLifetime", "PasswordRemember",
                                        "Active",           "ExpiryDate",
                                        "LogonFailCount"};

Sql& selectUsers(Sql& sql) {
    sql << "SELECT " << kRid;
    for (const char* c : kUserColumns)
        sql << ", " << quoteIdent(c);
    sql << " FROM " << quoteIdent("Users");
    return sql;
}

UserRow readUser(const RowView& row) {
    const TableDef& t = usersTable();
    auto cell = [&](int column) {
        return readCell(row, column, t.field(kUserColumns[column - 1])->type);
    };
    UserRow u;
    u.rid = row.getInt(0);
    u.userId = cell(1);
    u.name = cell(2);
    u.firstname = cell(3);
    u.lastname = cell(4);
    u.security = cell(5);
    u.minLength = cell(6);
    u.password = cell(7);
    u.changeDate = cell(8);
    u.lifetime = cell(9);
    u.remember = cell(10);
    u.active = cell(11);
    u.expiry = cell(12);
    u.failCount = cell(13);
    return u;
}

Result<std::optional<UserRow>> userById(Connection& db, int32_t userId) {
    std::optional<UserRow> found;
    Sql sql(db);
    selectUsers(sql) << " WHERE " << quoteIdent("UserID") << " = ";
    sql.value(Value(userId)) << " ORDER BY " << kRid;
    KEST_TRY(sql.query([&](const RowView& row) {
        if (!found)
            found = readUser(row);
    }));
    return found;
}

// Names compare trimmed and ignoring letter case; the first stored match wins.
Result<std::optional<UserRow>> userByName(Connection& db, std::string_view userName) {
    std::string wanted = lower(trim(userName));
    std::optional<UserRow> found;
    if (wanted.empty())
        return found;
    Sql sql(db);
    selectUsers(sql) << " ORDER BY " << kRid;
    KEST_TRY(sql.query([&](const RowView& row) {
        if (found || row.isNull(2))
            return;
        if (lower(trim(row.getText(2))) == wanted)
            found = readUser(row);
    }));
    return found;
}

// The record a logon or a password change hands back: never the password.
RecordsetPtr userRecord(const UserRow& u) {
    auto rs = std::make_shared<Recordset>(std::vector<FieldDef>{
        {"UserID", ValueType::Integer, false},
        {"Name", ValueType::Text, true},
        {"Firstname", ValueType::Text, true},
        {"Lastname", ValueType::Text, true},
        {"Security", ValueType::Integer, true},
        {"PasswordMinLength", ValueType::Integer, true},
    });
    rs->appendRecord();
    rs->cellRef(0, 0) = u.userId;
    rs->cellRef(0, 1) = u.name;
    rs->cellRef(0, 2) = u.firstname;
    rs->cellRef(0, 3) = u.lastname;
    rs->cellRef(0, 4) = u.security;
    rs->cellRef(0, 5) = u.minLength;
    rs->MoveFirst();
    return rs;
}

std::string toHex(const unsigned char* bytes, std::size_t n) {
    static const char digits[] = "0123456789abcdef";
    std::string out;
    out.reserve(n * 2);
    for (std::size_t i = 0; i < n; ++i) {
        out += digits[bytes[i] >> 4];
        out += digits[bytes[i] & 0x0F];
    }
    return out;
}

void initSodium() {
    static const bool ready = sodium_init() >= 0;
    if (!ready)
        throw std::runtime_error("the cryptographic library could not be initialised");
}

std::string newTicket(const std::string& dsn) {
    initSodium();
    unsigned char random[32];
    randombytes_buf(random, sizeof random);
    return dsn + "/" + toHex(random, sizeof random);
}

// Only a hash of the ticket is stored, so a copy of the database opens no session.
std::string ticketHash(const std::string& ticket) {
    initSodium();
    unsigned char digest[crypto_generichash_BYTES];
    crypto_generichash(digest, sizeof digest, reinterpret_cast<const unsigned char*>(ticket.data()),
                       ticket.size(), nullptr, 0);
    return toHex(digest, sizeof digest);
}

// The data source a ticket names, or "" for something that is no ticket.
std::string ticketDsn(const std::string& ticket) {
    auto slash = ticket.rfind('/');
    if (slash == std::string::npos || slash == 0)
        return {};
    return ticket.substr(0, slash);
}

}  // namespace

class ServiceCore::DataSource {
public:
    std::string name;  // as the data-sources file spells it
    std::mutex mutex;  // serialises every call on this data source
    std::unique_ptr<Connection> db;
    KeyMaterial key;
    std::unordered_map<std::string, int> failures;  // consecutive failed logons by lower-case name
};

namespace {

using DataSource = ServiceCore::DataSource;

struct Session {
    std::string hash;
    int32_t userId = 0;
    bool restricted = false;
};

// --- Keys ---------------------------------------------------------------

Result<int64_t> storedCounter(Connection& db, const std::string& keyField) {
    int64_t counter = 0;
    Sql sql(db);
    sql << "SELECT " << quoteIdent("Next") << " FROM " << quoteIdent(kKeysTable) << " WHERE "
        << quoteIdent("KeyField") << " = ";
    sql.value(Value(keyField));
    KEST_TRY(sql.query([&](const RowView& row) {
        if (!row.isNull(0))
            counter = row.getInt(0);
    }));
    return counter;
}

Status storeCounter(Connection& db, const std::string& keyField, int64_t next) {
    int64_t changed = 0;
    Value stored(static_cast<int32_t>(std::min(next, kKeyLimit)));
    {
        Sql sql(db);
        sql << "UPDATE " << quoteIdent(kKeysTable) << " SET " << quoteIdent("Next") << " = ";
        sql.value(stored) << " WHERE " << quoteIdent("KeyField") << " = ";
        sql.value(Value(keyField));
        KEST_TRY(sql.execute(&changed));
    }
    if (changed > 0)
        return okStatus();
    Sql sql(db);
    sql << "INSERT INTO " << quoteIdent(kKeysTable) << " (" << quoteIdent("KeyField") << ", "
        << quoteIdent("Next") << ") VALUES (";
    sql.value(Value(keyField)) << ", ";
    sql.value(stored) << ")";
    return sql.execute();
}

// The largest key of every table that uses that key field (0 when none).
Result<int64_t> largestKey(Connection& db, std::string_view keyField) {
    int64_t largest = 0;
    for (const TableDef* t : tablesWithKey(keyField)) {
        Sql sql(db);
        sql << "SELECT MAX(" << quoteIdent(t->key().name) << ") FROM " << quoteIdent(t->name);
        KEST_TRY(sql.query([&](const RowView& row) {
            if (!row.isNull(0))
                largest = std::max(largest, row.getInt(0));
        }));
    }
    return largest;
}

// Reserves `count` consecutive keys and returns the first. Call inside a
// transaction: the counter and the tables are read and the counter written
// under the same write lock.
Result<int32_t> takeKeys(Connection& db, const std::string& keyField, int64_t count = 1) {
    auto counter = storedCounter(db, keyField);
    if (!counter.ok())
        return counter.error();
    auto largest = largestKey(db, keyField);
    if (!largest.ok())
        return largest.error();
    int64_t next = std::max({counter.value(), largest.value() + 1, int64_t{1}});
    if (next + count >= kKeyLimit)
        return fail(err::kStorage, "the identifiers of " + keyField +
                                       " are exhausted (the next would pass " +
                                       std::to_string(kKeyLimit - 1) + ")");
    KEST_TRY(storeCounter(db, keyField, next + count));
    return static_cast<int32_t>(next);
}

// Keeps the counter above a key written by other means than takeKeys.
Status keepCounterAbove(Connection& db, const std::string& keyField, int64_t key) {
    auto counter = storedCounter(db, keyField);
    if (!counter.ok())
        return counter.error();
    if (counter.value() > key)
        return okStatus();
    return storeCounter(db, keyField, key + 1);
}

// --- Events -------------------------------------------------------------

Status addEvent(Connection& db, std::string_view type, int32_t code, const std::string& text) {
    auto key = takeKeys(db, "EventID");
    if (!key.ok())
        return key.error();
    Sql sql(db);
    sql << "INSERT INTO " << quoteIdent("Events") << " (" << quoteIdent("EventID") << ", "
        << quoteIdent("Type") << ", " << quoteIdent("Date") << ", " << quoteIdent("Code") << ", "
        << quoteIdent("Text") << ") VALUES (";
    sql.value(Value(key.value())) << ", ";
    sql.value(Value(type)) << ", ";
    sql.value(Value(nowDate())) << ", ";
    sql.value(Value(code)) << ", ";
    sql.value(Value(text)) << ")";
    return sql.execute();
}

// --- Sessions -----------------------------------------------------------

Result<std::string> openSession(Connection& db, const std::string& dsn, int32_t userId,
                                bool restricted) {
    std::string ticket = newTicket(dsn);
    Sql sql(db);
    sql << "INSERT INTO " << quoteIdent(kSessionsTable) << " (" << quoteIdent("Ticket") << ", "
        << quoteIdent("UserID") << ", " << quoteIdent("Restricted") << ", "
        << quoteIdent("LastUsed") << ") VALUES (";
    sql.value(Value(ticketHash(ticket))) << ", ";
    sql.value(Value(userId)) << ", ";
    sql.value(Value(int32_t{restricted ? 1 : 0})) << ", ";
    sql.value(Value(unixNow())) << ")";
    KEST_TRY(sql.execute());
    return ticket;
}

Status purgeSessions(Connection& db, std::chrono::seconds idle) {
    Sql sql(db);
    sql << "DELETE FROM " << quoteIdent(kSessionsTable) << " WHERE " << quoteIdent("LastUsed")
        << " < ";
    sql.value(Value(unixNow() - static_cast<double>(idle.count())));
    return sql.execute();
}

Status dropSession(Connection& db, const std::string& hash) {
    Sql sql(db);
    sql << "DELETE FROM " << quoteIdent(kSessionsTable) << " WHERE " << quoteIdent("Ticket")
        << " = ";
    sql.value(Value(hash));
    return sql.execute();
}

// The live session of a ticket, or nothing. A ticket of another data source,
// an unknown one and an expired one are all no session.
Result<std::optional<Session>> findSession(DataSource& ds, const std::string& ticket,
                                           std::chrono::seconds idle) {
    std::optional<Session> none;
    if (ticket.empty() || !equalNoCase(ticketDsn(ticket), ds.name))
        return none;
    Session s;
    s.hash = ticketHash(ticket);
    std::optional<double> lastUsed;
    Sql sql(*ds.db);
    sql << "SELECT " << quoteIdent("UserID") << ", " << quoteIdent("Restricted") << ", "
        << quoteIdent("LastUsed") << " FROM " << quoteIdent(kSessionsTable) << " WHERE "
        << quoteIdent("Ticket") << " = ";
    sql.value(Value(s.hash));
    KEST_TRY(sql.query([&](const RowView& row) {
        s.userId = row.isNull(0) ? 0 : static_cast<int32_t>(row.getInt(0));
        s.restricted = !row.isNull(1) && row.getInt(1) != 0;
        lastUsed = row.isNull(2) ? 0.0 : row.getDouble(2);
    }));
    if (!lastUsed)
        return none;
    double now = unixNow();
    if (now - *lastUsed > static_cast<double>(idle.count())) {
        KEST_TRY(dropSession(*ds.db, s.hash));
        return none;
    }
    if (now - *lastUsed >= kLastUsedGranularity) {
        Sql touch(*ds.db);
        touch << "UPDATE " << quoteIdent(kSessionsTable) << " SET " << quoteIdent("LastUsed")
              << " = ";
        touch.value(Value(now)) << " WHERE " << quoteIdent("Ticket") << " = ";
        touch.value(Value(s.hash));
        KEST_TRY(touch.execute());
    }
    return std::optional<Session>(std::move(s));
}

// A ticket names its data source; a call that names another one is refused
// rather than quietly served with the wrong user's rights.
Status checkTicketDsn(const std::string& ticket, const std::string& dsn) {
    if (ticket.empty())
        return fail(err::kNotLoggedOn, "no session; log on to data source " + dsn + " first");
    std::string own = ticketDsn(ticket);
    if (!equalNoCase(own, dsn))
        return fail(err::kNotLoggedOn, "the session belongs to data source " +
                                           (own.empty() ? std::string("(none)") : own) +
                                           ", not to " + dsn);
    return okStatus();
}

// The session of a user who may use the administrative operations: a full
// session, a current Security of 8, an account that is active and not expired.
Result<UserRow> requireAdministrator(DataSource& ds, const std::string& ticket,
                                     std::chrono::seconds idle) {
    KEST_TRY(checkTicketDsn(ticket, ds.name));
    auto session = findSession(ds, ticket, idle);
    if (!session.ok())
        return session.error();
    if (!session.value())
        return fail(err::kNotLoggedOn,
                    "the session is unknown or has expired; log on to " + ds.name + " again");
    const Session& s = *session.value();
    if (s.restricted)
        return fail(err::kPasswordChangeRequired,
                    "this session allows only a change of the expired password");
    auto user = userById(*ds.db, s.userId);
    if (!user.ok())
        return user.error();
    if (!user.value()) {
        KEST_TRY(dropSession(*ds.db, s.hash));
        return fail(err::kNotLoggedOn, "the session's user no longer exists");
    }
    const UserRow& u = *user.value();
    if (!u.isActive() || u.hasExpired(nowDate()))
        return fail(err::kAccessDenied,
                    "the account of user " + u.displayName() + " is no longer active");
    int32_t security = u.intOr(u.security, 0);
    if (security != 8)
        return fail(err::kAccessDenied, "user " + u.displayName() + " has security level " +
                                            std::to_string(security) +
                                            "; this operation needs level 8");
    return u;
}

// --- Passwords ----------------------------------------------------------

Result<bool> passwordMatches(const KeyMaterial& key, const UserRow& u, const std::string& typed) {
    std::string normal = normalisePassword(typed);
    double stored = u.passwordCodeStored();
    if (stored == 0.0)
        return normal.empty();
    Date changed =
        u.changeDate.isNull() || u.changeDate.isEmpty() ? Date{0.0} : u.changeDate.toDate();
    auto code = passwordCode(key, normal, changed);
    if (!code.ok())
        return code.error();
    return code.value() == stored;
}

std::string describeRecord(const TableDef& t, const Value& key, std::size_t ordinal) {
    if (key.isNull() || key.isEmpty())
        return "new record " + std::to_string(ordinal) + " of the batch in " + t.name;
    return "record " + t.key().name + " = " + key.toText() + " in " + t.name;
}

}  // namespace

// --- ServiceCore --------------------------------------------------------------

ServiceCore::ServiceCore(std::filesystem::path dataDir, ServiceOptions options)
    : dataDir_(std::move(dataDir)), options_(options) {}

ServiceCore::~ServiceCore() = default;

Result<ServiceCore::DataSource*> ServiceCore::open(const std::string& dsn) {
    std::lock_guard lock(mutex_);
    std::string id = lower(dsn);
    if (auto it = sources_.find(id); it != sources_.end())
        return it->second.get();
    auto config = findDataSource(dataDir_, dsn);
    if (!config.ok())
        return config.error();
    const DataSourceConfig& c = config.value();
    if (c.driver != "sqlite")
        return fail(err::kUnknownDataSource, "data source " + c.name + " uses the driver '" +
                                                 c.driver + "', which this service lacks");
    auto db = openSqlite(resolvePath(dataDir_, c.database), false);
    if (!db.ok())
        return storageFailure(db.error(), "opening data source " + c.name);
    KEST_TRY(migrate(*db.value()));
    auto key = loadKeyFile(resolvePath(dataDir_, c.keyFile));
    if (!key.ok())
        return key.error();
    auto ds = std::make_unique<DataSource>();
    ds->name = c.name;
    ds->db = std::move(db.value());
    ds->key = key.value();
    DataSource* raw = ds.get();
    sources_.emplace(id, std::move(ds));
    return raw;
}

Result<RecordsetPtr> ServiceCore::getTable(const std::string& ticket, const std::string& dsn,
                                           const std::string& table) {
    return guarded<RecordsetPtr>([&]() -> Result<RecordsetPtr> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        auto admin = requireAdministrator(ds, ticket, options_.sessionIdle);
        if (!admin.ok())
            return admin.error();
        const TableDef* t = findTable(table);
        if (t == nullptr)
            return fail(err::kUnknownTable, "'" + table + "' is not a table of " + ds.name);

        Connection& db = *ds.db;
        int64_t rows = 0;
        {
            Sql count(db);
            count << "SELECT COUNT(*) FROM " << quoteIdent(t->name);
            KEST_TRY(count.query([&](const RowView& row) { rows = row.getInt(0); }));
        }
        auto rs = std::make_shared<Recordset>(t->fields);
        rs->reserve(static_cast<std::size_t>(rows));
        std::vector<ValueType> types;
        Sql sql(db);
        sql << "SELECT ";
        for (std::size_t i = 0; i < t->fields.size(); ++i) {
            sql << (i == 0 ? "" : ", ");
            sql.name(t->fields[i].name);
            types.push_back(t->fields[i].type);
        }
        sql << " FROM " << quoteIdent(t->name) << " ORDER BY " << kRid;
        const int columns = static_cast<int>(types.size());
        std::size_t record = 0;
        KEST_TRY(sql.query([&](const RowView& row) {
            rs->appendRecord();
            for (int c = 0; c < columns; ++c)
                rs->cellRef(record, c) = readCell(row, c, types[static_cast<std::size_t>(c)]);
            ++record;
        }));
        rs->MoveFirst();
        return rs;
    });
}

Result<int32_t> ServiceCore::getUniqueID(const std::string& ticket, const std::string& dsn,
                                         const std::string& keyField) {
    return guarded<int32_t>([&]() -> Result<int32_t> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        auto admin = requireAdministrator(ds, ticket, options_.sessionIdle);
        if (!admin.ok())
            return admin.error();
        auto tables = tablesWithKey(keyField);
        if (tables.empty())
            return fail(err::kUnknownField,
                        "'" + keyField + "' is not the key field of any table of " + ds.name);
        const std::string canonical = tables.front()->key().name;
        return inTransaction<int32_t>(*ds.db, [&] { return takeKeys(*ds.db, canonical); });
    });
}

Result<int32_t> ServiceCore::validateID(const std::string& ticket, const std::string& dsn,
                                        const std::string& keyField, const std::string& table) {
    return guarded<int32_t>([&]() -> Result<int32_t> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        auto admin = requireAdministrator(ds, ticket, options_.sessionIdle);
        if (!admin.ok())
            return admin.error();
        const TableDef* t = findTable(table);
        if (t == nullptr)
            return fail(err::kUnknownTable, "'" + table + "' is not a table of " + ds.name);
        if (!equalNoCase(keyField, t->key().name))
            return fail(err::kUnknownField, "'" + keyField + "' is not the key field of " +
                                                t->name + " (that is " + t->key().name + ")");
        Connection& db = *ds.db;
        const std::string& key = t->key().name;

        return inTransaction<int32_t>(db, [&]() -> Result<int32_t> {
            struct Broken {
                int64_t rid;
                std::optional<int64_t> oldKey;
            };
            std::vector<Broken> broken;
            std::set<int64_t> seen;
            {
                Sql sql(db);
                sql << "SELECT " << kRid << ", " << quoteIdent(key) << " FROM "
                    << quoteIdent(t->name) << " ORDER BY " << kRid;
                KEST_TRY(sql.query([&](const RowView& row) {
                    auto k = readKey(row, 1);
                    if (!k || *k <= 0 || !seen.insert(*k).second)
                        broken.push_back({row.getInt(0), k});
                }));
            }
            if (broken.empty())
                return 0;
            auto first = takeKeys(db, key, static_cast<int64_t>(broken.size()));
            if (!first.ok())
                return first.error();
            int32_t next = first.value();
            for (const Broken& b : broken) {
                Sql sql(db);
                sql << "UPDATE " << quoteIdent(t->name) << " SET " << quoteIdent(key) << " = ";
                sql.value(Value(next)) << " WHERE " << kRid << " = ";
                sql.value(ridValue(b.rid));
                KEST_TRY(sql.execute());
                std::string was = b.oldKey ? std::to_string(*b.oldKey) : std::string("empty");
                KEST_TRY(addEvent(db, "Identifier repaired", kEventIdRepaired,
                                  t->name + ": the record in row " + std::to_string(b.rid) +
                                      " had " + key + " " + was + ", now " + std::to_string(next)));
                ++next;
            }
            return static_cast<int32_t>(broken.size());
        });
    });
}

Result<LogonReply> ServiceCore::validLogon(const std::string& dsn, const std::string& userName,
                                           const std::string& password) {
    std::chrono::milliseconds delay{0};
    auto reply = guarded<LogonReply>([&]() -> Result<LogonReply> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        Connection& db = *ds.db;
        const std::string typedName = trim(userName);

        auto answer = [&]() -> Result<LogonReply> {
            auto found = userByName(db, typedName);
            if (!found.ok())
                return found.error();
            const Date now = nowDate();
            if (!found.value()) {
                // The same work as for a known user, so that timing does not
                // tell which names exist.
                (void)kest::passwordCode(ds.key, normalisePassword(password), now);
                KEST_TRY(inTransaction<Unit>(db, [&] {
                    return addEvent(db, "Logon failed", kEventLogonFailed,
                                    "Logon failed for unknown user " + typedName);
                }));
                return LogonReply{};
            }
            const UserRow& u = *found.value();
            auto matches = passwordMatches(ds.key, u, password);
            if (!matches.ok())
                return matches.error();
            const int32_t failures = u.intOr(u.failCount, 0);
            if (!matches.value()) {
                Status counted = inTransaction<Unit>(db, [&]() -> Status {
                    Sql sql(db);
                    sql << "UPDATE " << quoteIdent("Users") << " SET "
                        << quoteIdent("LogonFailCount") << " = ";
                    sql.value(Value(failures + 1)) << ", " << quoteIdent("LogonFailDate") << " = ";
                    sql.value(Value(now)) << " WHERE " << kRid << " = ";
                    sql.value(ridValue(u.rid));
                    KEST_TRY(sql.execute());
                    return addEvent(
                        db, "Logon failed", kEventLogonFailed,
                        "Logon failed for user " + u.displayName() + ": wrong password");
                });
                if (!counted.ok())
                    return counted.error();
                return LogonReply{};
            }
            if (!u.isActive() || u.hasExpired(now)) {
                std::string why =
                    u.isActive() ? "the account has expired" : "the account is inactive";
                KEST_TRY(inTransaction<Unit>(db, [&] {
                    return addEvent(db, "Logon failed", kEventLogonFailed,
                                    "Logon failed for user " + u.displayName() + ": " + why);
                }));
                return LogonReply{};
            }

            const int32_t lifetime = u.intOr(u.lifetime, 0);
            const bool blank = u.passwordCodeStored() == 0.0;
            bool tooOld = false;
            if (lifetime > 0) {
                double changed = u.changeDate.isNull() || u.changeDate.isEmpty()
                                     ? 0.0
                                     : u.changeDate.toDate().days;
                tooOld = now.days - changed > static_cast<double>(lifetime);
            }
            LogonReply r;
            r.result = (blank || tooOld) ? -2 : (failures > 0 ? failures : -1);
            const bool restricted = r.result == -2;
            std::string text = "User " + u.displayName() + " logged on";
            if (restricted)
                text +=
                    blank ? "; the blank password must be replaced" : "; the password has expired";
            else if (failures > 0)
                text += " after " + std::to_string(failures) + " failed attempts";

            auto ticket = inTransaction<std::string>(db, [&]() -> Result<std::string> {
                // The failure count goes back to 0 on every successful logon,
                // also when the password must still be changed: the failures
                // it counted have been reported with this answer or the last.
                Sql sql(db);
                sql << "UPDATE " << quoteIdent("Users") << " SET " << quoteIdent("LogonLastDate")
                    << " = ";
                sql.value(Value(now)) << ", " << quoteIdent("LogonFailCount") << " = ";
                sql.value(Value(int32_t{0})) << " WHERE " << kRid << " = ";
                sql.value(ridValue(u.rid));
                KEST_TRY(sql.execute());
                KEST_TRY(purgeSessions(db, options_.sessionIdle));
                auto t = openSession(db, ds.name, u.id(), restricted);
                if (!t.ok())
                    return t.error();
                KEST_TRY(addEvent(db, "Logon", kEventLogon, text));
                return t;
            });
            if (!ticket.ok())
                return ticket.error();
            r.ticket = std::move(ticket.value());
            r.record = userRecord(u);
            return r;
        }();

        if (answer.ok()) {
            const std::string who = lower(typedName);
            if (answer.value().result != 0) {
                ds.failures.erase(who);
            } else {
                if (ds.failures.size() >= kMaxTrackedNames && !ds.failures.contains(who))
                    ds.failures.clear();
                int n = ++ds.failures[who];
                if (n > options_.failuresBeforeDelay)
                    delay = std::min(options_.delayStep * (n - options_.failuresBeforeDelay),
                                     options_.delayMax);
            }
        }
        return answer;
    });
    // Sleeping outside the data source's lock slows this caller only.
    if (delay.count() > 0)
        std::this_thread::sleep_for(delay);
    return reply;
}

Result<ChangeReply> ServiceCore::changePassword(const std::string& ticket, const std::string& dsn,
                                                const Recordset& record,
                                                const std::string& oldPassword,
                                                const std::string& newPassword) {
    std::chrono::milliseconds delay{0};
    auto reply = guarded<ChangeReply>([&]() -> Result<ChangeReply> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        Connection& db = *ds.db;

        // Whose password: the record's UserID, or its Name when it has none.
        if (record.size() == 0)
            return fail(err::kBadArgument, "the user record holds no record");
        std::optional<UserRow> user;
        int idField = record.fieldIndex("UserID");
        int nameField = record.fieldIndex("Name");
        if (idField >= 0 && !record.cell(0, idField).isNull() &&
            !record.cell(0, idField).isEmpty()) {
            int32_t id = 0;
            try {
                id = record.cell(0, idField).toInt();
            } catch (const ConversionError&) {
                return fail(err::kWrongType, "the record's UserID is not a whole number");
            }
            auto found = userById(db, id);
            if (!found.ok())
                return found.error();
            user = std::move(found.value());
        } else if (nameField >= 0 && !record.cell(0, nameField).isNull()) {
            auto found = userByName(db, record.cell(0, nameField).toText());
            if (!found.ok())
                return found.error();
            user = std::move(found.value());
        } else {
            return fail(err::kBadArgument, "the user record carries neither UserID nor Name");
        }
        if (!user)
            return fail(err::kBadArgument, "the user record names no existing user");
        const UserRow& u = *user;

        // A session of this same user carries over; one of somebody else is
        // no proof here, the old password is.
        std::optional<Session> session;
        if (!ticket.empty()) {
            auto found = findSession(ds, ticket, options_.sessionIdle);
            if (!found.ok())
                return found.error();
            if (found.value() && found.value()->userId == u.id())
                session = found.value();
        }

        auto matches = passwordMatches(ds.key, u, oldPassword);
        if (!matches.ok())
            return matches.error();
        const Date now = roundToSecond(nowDate());
        if (!matches.value()) {
            KEST_TRY(inTransaction<Unit>(db, [&] {
                return addEvent(
                    db, "Logon failed", kEventLogonFailed,
                    "Password change refused for user " + u.displayName() + ": wrong old password");
            }));
            if (ds.failures.size() >= kMaxTrackedNames)
                ds.failures.clear();
            int n = ++ds.failures[lower(trim(u.displayName()))];
            if (n > options_.failuresBeforeDelay)
                delay = std::min(options_.delayStep * (n - options_.failuresBeforeDelay),
                                 options_.delayMax);
            return ChangeReply{-3, nullptr, {}};
        }
        if (!u.isActive() || u.hasExpired(now))
            return ChangeReply{0, nullptr, {}};

        const std::string fresh = normalisePassword(newPassword);
        if (utf8Length(fresh) < static_cast<std::size_t>(std::max(0, u.intOr(u.minLength, 0))))
            return ChangeReply{0, nullptr, {}};

        // Used before: the current password and the newest remembered ones,
        // each coded with its own change moment.
        const int32_t remember = std::max(0, u.intOr(u.remember, 0));
        if (remember > 0) {
            std::vector<std::pair<double, Date>> earlier;
            Date currentDate =
                u.changeDate.isNull() || u.changeDate.isEmpty() ? Date{0.0} : u.changeDate.toDate();
            earlier.emplace_back(u.passwordCodeStored(), currentDate);
            Sql sql(db);
            sql << "SELECT " << quoteIdent("Password") << ", " << quoteIdent("PasswordChangeDate")
                << " FROM " << quoteIdent("PasswordHistory") << " WHERE " << quoteIdent("UserID")
                << " = ";
            sql.value(Value(u.id()))
                << " ORDER BY " << quoteIdent("PasswordChangeDate") << " DESC, " << kRid << " DESC";
            int taken = 0;
            KEST_TRY(sql.query([&](const RowView& row) {
                if (taken >= remember)
                    return;
                ++taken;
                double code = row.isNull(0) ? 0.0 : row.getDouble(0);
                Date when{row.isNull(1) ? 0.0 : row.getDouble(1)};
                if (code == earlier.front().first && when == earlier.front().second)
                    return;
                earlier.emplace_back(code, when);
            }));
            for (const auto& [code, when] : earlier) {
                if (code == 0.0) {
                    if (fresh.empty())
                        return ChangeReply{-4, nullptr, {}};
                    continue;
                }
                auto again = kest::passwordCode(ds.key, fresh, when);
                if (!again.ok())
                    return again.error();
                if (again.value() == code)
                    return ChangeReply{-4, nullptr, {}};
            }
        }

        auto code = kest::passwordCode(ds.key, fresh, now);
        if (!code.ok())
            return code.error();

        auto ticketAfter = inTransaction<std::string>(db, [&]() -> Result<std::string> {
            {
                Sql sql(db);
                sql << "UPDATE " << quoteIdent("Users") << " SET " << quoteIdent("Password")
                    << " = ";
                sql.value(Value(code.value())) << ", " << quoteIdent("PasswordChangeDate") << " = ";
                sql.value(Value(now)) << " WHERE " << kRid << " = ";
                sql.value(ridValue(u.rid));
                KEST_TRY(sql.execute());
            }
            auto historyId = takeKeys(db, "PasswordID");
            if (!historyId.ok())
                return historyId.error();
            {
                Sql sql(db);
                sql << "INSERT INTO " << quoteIdent("PasswordHistory") << " ("
                    << quoteIdent("PasswordID") << ", " << quoteIdent("UserID") << ", "
                    << quoteIdent("Password") << ", " << quoteIdent("PasswordChangeDate")
                    << ") VALUES (";
                sql.value(Value(historyId.value())) << ", ";
                sql.value(Value(u.id())) << ", ";
                sql.value(Value(code.value())) << ", ";
                sql.value(Value(now)) << ")";
                KEST_TRY(sql.execute());
            }
            // Keep the newest `remember` rows, and at least the one just added.
            std::vector<int64_t> surplus;
            {
                Sql sql(db);
                sql << "SELECT " << kRid << " FROM " << quoteIdent("PasswordHistory") << " WHERE "
                    << quoteIdent("UserID") << " = ";
                sql.value(Value(u.id())) << " ORDER BY " << quoteIdent("PasswordChangeDate")
                                         << " DESC, " << kRid << " DESC";
                int kept = 0;
                const int keep = std::max(1, remember);
                KEST_TRY(sql.query([&](const RowView& row) {
                    if (kept < keep)
                        ++kept;
                    else
                        surplus.push_back(row.getInt(0));
                }));
            }
            for (int64_t rid : surplus) {
                Sql sql(db);
                sql << "DELETE FROM " << quoteIdent("PasswordHistory") << " WHERE " << kRid
                    << " = ";
                sql.value(ridValue(rid));
                KEST_TRY(sql.execute());
            }
            {
                Sql sql(db);
                sql << "UPDATE " << quoteIdent(kSessionsTable) << " SET "
                    << quoteIdent("Restricted") << " = ";
                sql.value(Value(int32_t{0})) << " WHERE " << quoteIdent("UserID") << " = ";
                sql.value(Value(u.id()));
                KEST_TRY(sql.execute());
            }
            std::string kept = session ? ticket : std::string();
            if (!session) {
                auto opened2 = openSession(db, ds.name, u.id(), false);
                if (!opened2.ok())
                    return opened2.error();
                kept = std::move(opened2.value());
            }
            KEST_TRY(addEvent(db, "Password changed", kEventPasswordChanged,
                              "User " + u.displayName() + " changed the password"));
            return kept;
        });
        if (!ticketAfter.ok())
            return ticketAfter.error();
        ds.failures.erase(lower(trim(u.displayName())));

        auto refreshed = userById(db, u.id());
        if (!refreshed.ok())
            return refreshed.error();
        ChangeReply r;
        r.result = -1;
        r.ticket = std::move(ticketAfter.value());
        r.record = userRecord(refreshed.value() ? *refreshed.value() : u);
        return r;
    });
    if (delay.count() > 0)
        std::this_thread::sleep_for(delay);
    return reply;
}

namespace {

// One pending record of a batch, its cells converted to the schema's types.
struct PendingRecord {
    std::size_t index = 0;    // in the recordset
    std::size_t ordinal = 0;  // 1-based among the pending records
    RecordStatus status = RecordStatus::Unmodified;
    std::vector<Value> values;
    std::vector<Value> originals;
};

Value normalised(const Value& v) {
    return v.isEmpty() ? Value::null() : v;
}

// The Users rule that the schema's index alone would report badly: a logon
// name must differ from every other user's, trimmed and ignoring letter case.
Status checkUserName(Connection& db, const Value& name, const std::optional<int64_t>& ownKey,
                     const std::string& record) {
    if (name.isNull())
        return okStatus();
    const std::string wanted = lower(trim(name.toText()));
    std::optional<std::pair<int64_t, std::string>> clash;
    Sql sql(db);
    sql << "SELECT " << quoteIdent("UserID") << ", " << quoteIdent("Name") << " FROM "
        << quoteIdent("Users");
    KEST_TRY(sql.query([&](const RowView& row) {
        if (clash || row.isNull(1))
            return;
        auto key = readKey(row, 0);
        if (ownKey && key == ownKey)
            return;
        if (lower(trim(row.getText(1))) == wanted)
            clash.emplace(key.value_or(0), std::string(row.getText(1)));
    }));
    if (clash)
        return fail(err::kDuplicateUserName,
                    record + ": the name '" + name.toText() + "' is already used by user " +
                        std::to_string(clash->first) + " ('" + clash->second + "')");
    return okStatus();
}

Result<int64_t> countWithKey(Connection& db, const TableDef& t, const Value& key) {
    int64_t n = 0;
    Sql sql(db);
    sql << "SELECT COUNT(*) FROM " << quoteIdent(t.name) << " WHERE " << quoteIdent(t.key().name)
        << " = ";
    sql.value(key);
    KEST_TRY(sql.query([&](const RowView& row) { n = row.getInt(0); }));
    return n;
}

// After a write that touched no row: the record is gone, or it changed.
Error notApplied(Connection& db, const TableDef& t, const Value& key, const std::string& record) {
    auto n = countWithKey(db, t, key);
    if (!n.ok())
        return n.error();
    if (n.value() == 0)
        return fail(err::kRecordGone, record + " no longer exists");
    return fail(err::kConflict, record + " was changed by someone else");
}

Status checkKeyValue(const Value& key, const std::string& record) {
    if (key.asInt() <= 0)
        return fail(err::kBadArgument, record + ": a key must be a whole number above 0");
    return okStatus();
}

}  // namespace

Result<int32_t> ServiceCore::updateRS(const std::string& ticket, const std::string& dsn,
                                      Recordset& rs, const std::string& table) {
    return guarded<int32_t>([&]() -> Result<int32_t> {
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        std::lock_guard lock(ds.mutex);
        auto admin = requireAdministrator(ds, ticket, options_.sessionIdle);
        if (!admin.ok())
            return admin.error();
        const TableDef* tp = findTable(table);
        if (tp == nullptr)
            return fail(err::kUnknownTable, "'" + table + "' is not a table of " + ds.name);
        const TableDef& t = *tp;
        const bool users = t.name == "Users";

        // Every field of the recordset must be one of the table's.
        const auto& defs = rs.fieldDefs();
        const std::size_t columns = defs.size();
        std::vector<const FieldDef*> target(columns, nullptr);
        int keyColumn = -1;
        int nameColumn = -1;
        for (std::size_t c = 0; c < columns; ++c) {
            const FieldDef* f = t.field(defs[c].name);
            if (f == nullptr)
                return fail(err::kUnknownField,
                            "'" + defs[c].name + "' is not a field of " + t.name);
            for (std::size_t d = 0; d < c; ++d) {
                if (target[d] == f)
                    return fail(err::kBadArgument,
                                "the field " + f->name + " appears twice in the recordset");
            }
            target[c] = f;
            if (f == &t.key())
                keyColumn = static_cast<int>(c);
            if (users && f->name == "Name")
                nameColumn = static_cast<int>(c);
        }
        if (keyColumn < 0)
            return fail(err::kBadArgument,
                        "the recordset lacks " + t.name + "'s key field " + t.key().name);
        const std::size_t kc = static_cast<std::size_t>(keyColumn);

        // Convert every pending cell first: a wrong type fails the batch
        // before anything is written.
        std::vector<PendingRecord> pending;
        for (std::size_t r = 0; r < rs.size(); ++r) {
            RecordStatus st = rs.status(r);
            if (st == RecordStatus::Unmodified)
                continue;
            PendingRecord p;
            p.index = r;
            p.ordinal = pending.size() + 1;
            p.status = st;
            Value shownKey = normalised(rs.original(r, keyColumn));
            for (std::size_t c = 0; c < columns; ++c) {
                const int ci = static_cast<int>(c);
                try {
                    p.values.push_back(normalised(rs.cell(r, ci)).convertTo(target[c]->type));
                    p.originals.push_back(
                        normalised(rs.original(r, ci)).convertTo(target[c]->type));
                } catch (const ConversionError& e) {
                    return fail(err::kWrongType, describeRecord(t, shownKey, p.ordinal) +
                                                     ": the value of " + target[c]->name +
                                                     " does not fit its type (" + e.what() + ")");
                }
            }
            pending.push_back(std::move(p));
        }
        if (pending.empty())
            return 0;

        Connection& db = *ds.db;
        const std::string& keyName = t.key().name;
        std::vector<std::pair<std::size_t, int32_t>> freshKeys;  // record index, key
        int inserted = 0;
        int updated = 0;
        int deleted = 0;
        auto written = inTransaction<int32_t>(db, [&]() -> Result<int32_t> {
            int64_t largestWritten = 0;
            for (PendingRecord& p : pending) {
                const Value& origKey = p.originals[kc];
                if (p.status == RecordStatus::New) {
                    Value& key = p.values[kc];
                    if (key.isNull()) {
                        auto taken = takeKeys(db, keyName);
                        if (!taken.ok())
                            return taken.error();
                        key = Value(taken.value());
                        freshKeys.emplace_back(p.index, taken.value());
                    } else {
                        const std::string rec = describeRecord(t, key, p.ordinal);
                        KEST_TRY(checkKeyValue(key, rec));
                        auto n = countWithKey(db, t, key);
                        if (!n.ok())
                            return n.error();
                        if (n.value() > 0)
                            return fail(err::kDuplicateKey,
                                        rec + ": another record already has that key");
                    }
                    const std::string rec = describeRecord(t, key, p.ordinal);
                    if (nameColumn >= 0)
                        KEST_TRY(checkUserName(db, p.values[static_cast<std::size_t>(nameColumn)],
                                               std::nullopt, rec));
                    Sql sql(db);
                    sql << "INSERT INTO " << quoteIdent(t.name) << " (";
                    for (std::size_t c = 0; c < columns; ++c) {
                        sql << (c == 0 ? "" : ", ");
                        sql.name(target[c]->name);
                    }
                    sql << ") VALUES (";
                    for (std::size_t c = 0; c < columns; ++c) {
                        sql << (c == 0 ? "" : ", ");
                        sql.value(p.values[c]);
                    }
                    sql << ")";
                    Status done = sql.execute();
                    if (!done.ok())
                        return storageFailure(done.error(), "inserting " + rec);
                    largestWritten = std::max<int64_t>(largestWritten, key.asInt());
                    ++inserted;
                    continue;
                }

                const std::string rec = describeRecord(t, origKey, p.ordinal);
                if (origKey.isNull())
                    return fail(err::kBadArgument,
                                rec + " has no key; repair the table's identifiers first");
                if (p.status == RecordStatus::Deleted) {
                    if (users && origKey.asInt() == 1)
                        return fail(err::kAccessDenied,
                                    "user 1 is the administrator's account and cannot be deleted");
                    if (users) {
                        // What belongs to the user goes with it.
                        for (std::string_view owned :
                             {std::string_view("PasswordHistory"), kSessionsTable}) {
                            Sql sql(db);
                            sql << "DELETE FROM " << quoteIdent(owned) << " WHERE "
                                << quoteIdent("UserID") << " = ";
                            sql.value(origKey);
                            KEST_TRY(sql.execute());
                        }
                    }
                    Sql sql(db);
                    sql << "DELETE FROM " << quoteIdent(t.name) << " WHERE " << quoteIdent(keyName)
                        << " = ";
                    sql.value(origKey);
                    int64_t changed = 0;
                    Status done = sql.execute(&changed);
                    if (!done.ok())
                        return storageFailure(done.error(), "deleting " + rec);
                    if (changed == 0)
                        return fail(err::kRecordGone, rec + " no longer exists");
                    if (changed > 1)
                        return fail(err::kConflict,
                                    rec + ": more than one stored record has that key");
                    ++deleted;
                    continue;
                }

                // Modified: only the fields that changed, and only while each
                // still holds the value this recordset was read with.
                std::vector<std::size_t> changedColumns;
                for (std::size_t c = 0; c < columns; ++c) {
                    if (!(p.values[c] == p.originals[c]))
                        changedColumns.push_back(c);
                }
                if (changedColumns.empty())
                    continue;
                const Value& newKey = p.values[kc];
                if (!(newKey == origKey)) {
                    if (newKey.isNull())
                        return fail(err::kBadArgument, rec + ": the key cannot be emptied");
                    KEST_TRY(checkKeyValue(newKey, rec));
                    auto n = countWithKey(db, t, newKey);
                    if (!n.ok())
                        return n.error();
                    if (n.value() > 0)
                        return fail(err::kDuplicateKey, rec + ": the new key " + newKey.toText() +
                                                            " is used by another record");
                    largestWritten = std::max<int64_t>(largestWritten, newKey.asInt());
                }
                if (nameColumn >= 0 &&
                    std::find(changedColumns.begin(), changedColumns.end(),
                              static_cast<std::size_t>(nameColumn)) != changedColumns.end())
                    KEST_TRY(checkUserName(db, p.values[static_cast<std::size_t>(nameColumn)],
                                           static_cast<int64_t>(origKey.asInt()), rec));
                Sql sql(db);
                sql << "UPDATE " << quoteIdent(t.name) << " SET ";
                for (std::size_t i = 0; i < changedColumns.size(); ++i) {
                    sql << (i == 0 ? "" : ", ");
                    sql.name(target[changedColumns[i]]->name) << " = ";
                    sql.value(p.values[changedColumns[i]]);
                }
                sql << " WHERE " << quoteIdent(keyName) << " = ";
                sql.value(origKey);
                for (std::size_t c : changedColumns) {
                    sql << " AND ";
                    sql.nullSafeEquals(target[c]->name, p.originals[c]);
                }
                int64_t changed = 0;
                Status done = sql.execute(&changed);
                if (!done.ok())
                    return storageFailure(done.error(), "updating " + rec);
                if (changed == 0)
                    return notApplied(db, t, origKey, rec);
                if (changed > 1)
                    return fail(err::kConflict, rec + ": more than one stored record has that key");
                ++updated;
            }
            if (largestWritten > 0)
                KEST_TRY(keepCounterAbove(db, keyName, largestWritten));
            KEST_TRY(addEvent(db, "Batch update", kEventBatchUpdate,
                              t.name + ": " + std::to_string(inserted) + " inserted, " +
                                  std::to_string(updated) + " updated, " + std::to_string(deleted) +
                                  " deleted by " + admin.value().displayName()));
            return inserted + updated + deleted;
        });
        if (!written.ok())
            return written.error();

        // Only now, with the batch stored, does the recordset learn its new keys.
        for (const auto& [index, key] : freshKeys)
            rs.cellRef(index, keyColumn) = Value(key).convertTo(defs[kc].type);
        rs.settle();
        return written.value();
    });
}

Result<double> ServiceCore::passwordCode(const std::string& ticket, const std::string& password,
                                         double moment) {
    return guarded<double>([&]() -> Result<double> {
        const std::string dsn = ticketDsn(ticket);
        if (dsn.empty())
            return fail(err::kNotLoggedOn, "no session; log on first");
        auto opened = open(dsn);
        if (!opened.ok())
            return opened.error();
        DataSource& ds = *opened.value();
        KeyMaterial key;
        {
            std::lock_guard lock(ds.mutex);
            auto admin = requireAdministrator(ds, ticket, options_.sessionIdle);
            if (!admin.ok())
                return admin.error();
            key = ds.key;
        }
        // The hash is the slow part; it needs no lock.
        return kest::passwordCode(key, normalisePassword(password), roundToSecond(Date{moment}));
    });
}

}  // namespace kest
