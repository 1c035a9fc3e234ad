#pragma once

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "Result.h"
#include "recordset/Value.h"

namespace kest {

enum class Dialect { SQLite, PostgreSQL };

// One row of a query result, valid only inside the callback.
class RowView {
public:
    virtual ~RowView() = default;
    virtual int columnCount() const = 0;
    virtual bool isNull(int column) const = 0;
    virtual int64_t getInt(int column) const = 0;
    virtual double getDouble(int column) const = 0;
    virtual std::string_view getText(int column) const = 0;
};

// The storage behind the service: one database connection. SQL is built by
// the service from names checked against the schema; every value is bound as
// a parameter (Boolean as -1/0, Integer as integer, Double and Date as real,
// Text as text, Null and Empty as NULL). Not safe for use from two threads at
// once; the caller serialises.
class Connection {
public:
    virtual ~Connection() = default;
    virtual Dialect dialect() const = 0;
    // The placeholder of the n-th parameter (1-based): "?" or "$n".
    virtual std::string param(int n) const = 0;
    // Runs one statement; `changed` receives the number of rows it changed.
    virtual Status execute(std::string_view sql, std::span<const Value> params = {},
                           int64_t* changed = nullptr) = 0;
    virtual Status query(std::string_view sql, std::span<const Value> params,
                         const std::function<void(const RowView&)>& onRow) = 0;
    virtual Status begin() = 0;  // an immediate (write-locking) transaction
    virtual Status commit() = 0;
    virtual Status rollback() = 0;
};

// Opens (and creates when `create`) an SQLite database in WAL mode with a busy
// timeout and foreign keys on. Without `create` a missing file is an error.
Result<std::unique_ptr<Connection>> openSqlite(const std::filesystem::path& file, bool create);

}  // namespace kest
