#include "service/SqliteConnection.h"

#include <sqlite3.h>

#include <system_error>
#include <utility>

#include "service/Errors.h"

namespace kest {

namespace {

Error storageError(std::string text) {
    return Error{err::kStorage, std::move(text)};
}

// Column access for one row; the statement is borrowed, nothing is copied.
class SqliteRow final : public RowView {
public:
    explicit SqliteRow(sqlite3_stmt* stmt) : stmt_(stmt), columns_(sqlite3_column_count(stmt)) {}
    int columnCount() const override { return columns_; }
    bool isNull(int column) const override {
        return sqlite3_column_type(stmt_, column) == SQLITE_NULL;
    }
    int64_t getInt(int column) const override { return sqlite3_column_int64(stmt_, column); }
    double getDouble(int column) const override { return sqlite3_column_double(stmt_, column); }
    std::string_view getText(int column) const override {
        const unsigned char* text = sqlite3_column_text(stmt_, column);
        if (text == nullptr)
            return {};
        return {reinterpret_cast<const char*>(text),
                static_cast<std::size_t>(sqlite3_column_bytes(stmt_, column))};
    }

private:
    sqlite3_stmt* stmt_;
    int columns_;
};

bool onlyBlanks(const char* text) {
    for (; *text != '\0'; ++text) {
        if (*text != ' ' && *text != '\t' && *text != '\n' && *text != '\r' && *text != ';')
            return false;
    }
    return true;
}

}  // namespace

// A statement borrowed for one call: taken from the cache, or prepared for
// this call alone when the cached one is busy. Giving it back resets it and
// drops its bindings, so no bound text outlives the call.
class SqliteConnection::Lease {
public:
    Lease(sqlite3_stmt* stmt, Cached* cached) : stmt_(stmt), cached_(cached) {}
    Lease(const Lease&) = delete;
    Lease& operator=(const Lease&) = delete;
    ~Lease() {
        if (stmt_ == nullptr)
            return;
        if (cached_ != nullptr) {
            sqlite3_reset(stmt_);
            sqlite3_clear_bindings(stmt_);
            cached_->inUse = false;
        } else {
            sqlite3_finalize(stmt_);
        }
    }
    sqlite3_stmt* get() const { return stmt_; }

private:
    sqlite3_stmt* stmt_;
    Cached* cached_;
};

SqliteConnection::SqliteConnection(sqlite3* db) : db_(db) {}

SqliteConnection::~SqliteConnection() {
    for (auto& entry : cache_)
        sqlite3_finalize(entry.second.stmt);
    sqlite3_close_v2(db_);
}

std::string SqliteConnection::param(int n) const {
    (void)n;
    return "?";
}

Error SqliteConnection::failure(std::string_view what) const {
    std::string text(what);
    text += ": ";
    text += sqlite3_errmsg(db_);
    return storageError(std::move(text));
}

Result<sqlite3_stmt*> SqliteConnection::prepare(std::string_view sql) {
    sqlite3_stmt* stmt = nullptr;
    const char* tail = nullptr;
    int rc = sqlite3_prepare_v3(db_, sql.data(), static_cast<int>(sql.size()),
                                SQLITE_PREPARE_PERSISTENT, &stmt, &tail);
    if (rc != SQLITE_OK) {
        sqlite3_finalize(stmt);
        return failure("cannot prepare a statement");
    }
    if (stmt == nullptr)
        return storageError("cannot prepare a statement: the SQL text is empty");
    // One call runs exactly one statement, whatever follows a semicolon.
    std::string rest(tail, static_cast<std::size_t>(sql.data() + sql.size() - tail));
    if (!onlyBlanks(rest.c_str())) {
        sqlite3_finalize(stmt);
        return storageError("cannot prepare a statement: the SQL text holds more than one");
    }
    return stmt;
}

Status SqliteConnection::bindAll(sqlite3_stmt* stmt, std::span<const Value> params) {
    int expected = sqlite3_bind_parameter_count(stmt);
    if (static_cast<std::size_t>(expected) != params.size()) {
        return storageError("the statement takes " + std::to_string(expected) + " parameters, " +
                            std::to_string(params.size()) + " were given");
    }
    for (std::size_t i = 0; i < params.size(); ++i) {
        const Value& v = params[i];
        int index = static_cast<int>(i) + 1;
        int rc = SQLITE_OK;
        switch (v.type()) {
            case ValueType::Empty:
            case ValueType::Null:
                rc = sqlite3_bind_null(stmt, index);
                break;
            case ValueType::Boolean:
                rc = sqlite3_bind_int(stmt, index, v.asBool() ? -1 : 0);
                break;
            case ValueType::Integer:
                rc = sqlite3_bind_int(stmt, index, v.asInt());
                break;
            case ValueType::Double:
                rc = sqlite3_bind_double(stmt, index, v.asDouble());
                break;
            case ValueType::Date:
                rc = sqlite3_bind_double(stmt, index, v.asDate().days);
                break;
            case ValueType::Text: {
                const std::string& text = v.asText();
                // The lease outlives the step, so SQLite need not copy the text.
                rc = sqlite3_bind_text64(stmt, index, text.data(), text.size(), SQLITE_STATIC,
                                         SQLITE_UTF8);
                break;
            }
        }
        if (rc != SQLITE_OK)
            return failure("cannot bind parameter " + std::to_string(index));
    }
    return okStatus();
}

Status SqliteConnection::execute(std::string_view sql, std::span<const Value> params,
                                 int64_t* changed) {
    KEST_TRY(query(sql, params, nullptr));
    if (changed != nullptr)
        *changed = sqlite3_changes64(db_);
    return okStatus();
}

Status SqliteConnection::query(std::string_view sql, std::span<const Value> params,
                               const std::function<void(const RowView&)>& onRow) {
    sqlite3_stmt* stmt = nullptr;
    Cached* cached = nullptr;
    auto found = cache_.find(sql);
    if (found != cache_.end() && !found->second.inUse) {
        stmt = found->second.stmt;
        cached = &found->second;
    } else {
        auto prepared = prepare(sql);
        if (!prepared.ok())
            return prepared.error();
        stmt = prepared.value();
        if (found == cache_.end()) {
            if (cache_.size() >= kStatementCacheSize) {
                auto oldest = cache_.end();
                for (auto it = cache_.begin(); it != cache_.end(); ++it) {
                    if (!it->second.inUse &&
                        (oldest == cache_.end() || it->second.lastUse < oldest->second.lastUse))
                        oldest = it;
                }
                if (oldest != cache_.end()) {
                    sqlite3_finalize(oldest->second.stmt);
                    cache_.erase(oldest);
                }
            }
            if (cache_.size() < kStatementCacheSize) {
                auto inserted = cache_.emplace(std::string(sql), Cached{stmt, 0, false});
                cached = &inserted.first->second;
            }
        }
    }
    if (cached != nullptr) {
        cached->inUse = true;
        cached->lastUse = ++useClock_;
    }
    Lease lease(stmt, cached);
    KEST_TRY(bindAll(stmt, params));

    SqliteRow row(stmt);
    for (;;) {
        int rc = sqlite3_step(stmt);
        if (rc == SQLITE_ROW) {
            if (onRow)
                onRow(row);
            continue;
        }
        if (rc == SQLITE_DONE)
            return okStatus();
        return failure("the statement failed");
    }
}

Status SqliteConnection::begin() {
    return execute("BEGIN IMMEDIATE");
}
Status SqliteConnection::commit() {
    return execute("COMMIT");
}

Status SqliteConnection::rollback() {
    // After some failures SQLite has already rolled back on its own.
    if (!inTransaction())
        return okStatus();
    return execute("ROLLBACK");
}

bool SqliteConnection::inTransaction() const {
    return sqlite3_get_autocommit(db_) == 0;
}

Result<std::unique_ptr<Connection>> openSqlite(const std::filesystem::path& file, bool create) {
    std::error_code ec;
    bool exists = std::filesystem::exists(file, ec);
    if (!create && !exists)
        return storageError("the database file " + file.string() + " does not exist");
    if (exists && !std::filesystem::is_regular_file(file, ec))
        return storageError("the database path " + file.string() + " is not a file");

    int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE;
    if (create)
        flags |= SQLITE_OPEN_CREATE;
    sqlite3* raw = nullptr;
    int rc = sqlite3_open_v2(file.c_str(), &raw, flags, nullptr);
    if (rc != SQLITE_OK) {
        std::string text = "cannot open the database " + file.string() + ": " +
                           (raw != nullptr ? sqlite3_errmsg(raw) : sqlite3_errstr(rc));
        sqlite3_close_v2(raw);
        return storageError(std::move(text));
    }
    auto db = std::make_unique<SqliteConnection>(raw);
    sqlite3_busy_timeout(raw, SqliteConnection::kBusyTimeoutMs);
    // journal_mode answers with a row, so it goes through query().
    std::string mode;
    KEST_TRY(db->query("PRAGMA journal_mode=WAL", {},
                       [&](const RowView& r) { mode = std::string(r.getText(0)); }));
    if (mode != "wal")
        return storageError("cannot switch the database " + file.string() + " to WAL mode");
    // In WAL mode NORMAL keeps every commit atomic; a crash can lose only the
    // last commits, never leave half of one.
    KEST_TRY(db->execute("PRAGMA synchronous=NORMAL"));
    KEST_TRY(db->execute("PRAGMA foreign_keys=ON"));
    // A file that is not a database shows itself at the first read.
    KEST_TRY(db->query("SELECT count(*) FROM sqlite_master", {}, nullptr));
    return std::unique_ptr<Connection>(std::move(db));
}

}  // namespace kest
