#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>

#include "Connection.h"

struct sqlite3;
struct sqlite3_stmt;

namespace kest {

// The SQLite driver behind Connection. Prepared statements are kept by their
// SQL text, so the service's few fixed statements are compiled once; a
// statement that is still stepping (a query run from inside another query's
// callback) is never handed out twice.
class SqliteConnection : public Connection {
public:
    static constexpr std::size_t kStatementCacheSize = 64;
    static constexpr int kBusyTimeoutMs = 5000;

    // Use openSqlite(); the handle is owned from here on.
    explicit SqliteConnection(sqlite3* db);
    ~SqliteConnection() override;
    SqliteConnection(const SqliteConnection&) = delete;
    SqliteConnection& operator=(const SqliteConnection&) = delete;

    Dialect dialect() const override { return Dialect::SQLite; }
    std::string param(int n) const override;
    Status execute(std::string_view sql, std::span<const Value> params = {},
                   int64_t* changed = nullptr) override;
    Status query(std::string_view sql, std::span<const Value> params,
                 const std::function<void(const RowView&)>& onRow) override;
    Status begin() override;
    Status commit() override;
    Status rollback() override;

    // The raw handle, for benchmarks that compare against the C API.
    sqlite3* handle() const { return db_; }
    // True while a transaction is open.
    bool inTransaction() const;

private:
    struct Cached {
        sqlite3_stmt* stmt = nullptr;
        uint64_t lastUse = 0;
        bool inUse = false;
    };
    struct Hash {
        using is_transparent = void;
        std::size_t operator()(std::string_view s) const noexcept {
            return std::hash<std::string_view>{}(s);
        }
    };
    class Lease;

    Result<sqlite3_stmt*> prepare(std::string_view sql);
    Status bindAll(sqlite3_stmt* stmt, std::span<const Value> params);
    Error failure(std::string_view what) const;

    sqlite3* db_;
    std::unordered_map<std::string, Cached, Hash, std::equal_to<>> cache_;
    uint64_t useClock_ = 0;
};

}  // namespace kest
