#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "Result.h"
#include "recordset/Recordset.h"

namespace kest {

struct LogonReply {
    int32_t result = 0;   // 0, -1, -2 or n > 0
    RecordsetPtr record;  // the user's record on a logon, else null
    std::string ticket;   // the session's ticket on a logon, else empty
};

struct ChangeReply {
    int32_t result = 0;   // -1, 0, -3 or -4
    RecordsetPtr record;  // the fresh record after a change, else null
    std::string ticket;   // a full session's ticket after a change, else empty
};

struct ServiceOptions {
    // A session ends after this long without a call.
    std::chrono::seconds sessionIdle{std::chrono::hours(8)};
    // Failed logons for one name before the answers start to slow down, and
    // the growth and the ceiling of that delay.
    int failuresBeforeDelay = 3;
    std::chrono::milliseconds delayStep{250};
    std::chrono::milliseconds delayMax{3000};
};

// The business-rules service proper: the rules, the sessions and the storage
// of every data source in one data folder. Both the in-process object and the
// network server call it. Thread-safe: calls on one data source are
// serialised; data sources are opened on first use.
//
// Tickets name their data source ("<dsn>/<random>"), so that operations that
// take no data-source argument (PasswordCode) find it, and so that any service
// instance on the same database accepts them. Every operation that takes a
// ticket checks it: no or an expired session is err::kNotLoggedOn, a session
// restricted after an expired password allows only changePassword
// (err::kPasswordChangeRequired), a user whose Security is not 8
// err::kAccessDenied.
class ServiceCore {
public:
    explicit ServiceCore(std::filesystem::path dataDir, ServiceOptions options = {});
    ~ServiceCore();
    ServiceCore(const ServiceCore&) = delete;
    ServiceCore& operator=(const ServiceCore&) = delete;

    const std::filesystem::path& dataDir() const { return dataDir_; }

    Result<RecordsetPtr> getTable(const std::string& ticket, const std::string& dsn,
                                  const std::string& table);
    // Applies the pending records of `rs` atomically; on success settles `rs`
    // in place and returns the number of records written.
    Result<int32_t> updateRS(const std::string& ticket, const std::string& dsn, Recordset& rs,
                             const std::string& table);
    Result<int32_t> getUniqueID(const std::string& ticket, const std::string& dsn,
                                const std::string& keyField);
    Result<int32_t> validateID(const std::string& ticket, const std::string& dsn,
                               const std::string& keyField, const std::string& table);
    Result<LogonReply> validLogon(const std::string& dsn, const std::string& userName,
                                  const std::string& password);
    Result<ChangeReply> changePassword(const std::string& ticket, const std::string& dsn,
                                       const Recordset& userRecord, const std::string& oldPassword,
                                       const std::string& newPassword);
    Result<double> passwordCode(const std::string& ticket, const std::string& password,
                                double moment);

    // For tests and tools: the data source's connection under its lock.
    class DataSource;

private:
    Result<DataSource*> open(const std::string& dsn);

    std::filesystem::path dataDir_;
    ServiceOptions options_;
    std::mutex mutex_;
    std::map<std::string, std::unique_ptr<DataSource>> sources_;  // by lower-case name
};

}  // namespace kest
