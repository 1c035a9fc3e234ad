#include "service/LocalBusinessRules.h"

#include <map>
#include <mutex>
#include <system_error>
#include <utility>

#include "service/Errors.h"
#include "service/TicketCache.h"

namespace kest {

LocalBusinessRules::LocalBusinessRules(std::shared_ptr<ServiceCore> core)
    : core_(std::move(core)), serverKey_("local:" + core_->dataDir().string()) {}

std::shared_ptr<ServiceCore> LocalBusinessRules::coreFor(const std::filesystem::path& dataDir) {
    // One core per folder, so that every object of this process shares its
    // data sources' locks; it goes when the last object using it goes.
    static std::mutex mutex;
    static std::map<std::string, std::weak_ptr<ServiceCore>> cores;
    std::error_code ec;
    std::filesystem::path canonical = std::filesystem::weakly_canonical(dataDir, ec);
    if (ec)
        canonical = std::filesystem::absolute(dataDir, ec).lexically_normal();
    std::lock_guard lock(mutex);
    std::weak_ptr<ServiceCore>& slot = cores[canonical.string()];
    if (auto core = slot.lock())
        return core;
    auto core = std::make_shared<ServiceCore>(canonical);
    slot = core;
    return core;
}

std::string LocalBusinessRules::ticketFor(const std::string& dsn) const {
    return TicketCache::instance().get(serverKey_, dsn).value_or(std::string());
}

Result<RecordsetPtr> LocalBusinessRules::GetTable(std::string& dbUsed, const std::string& table) {
    return core_->getTable(ticketFor(dbUsed), dbUsed, table);
}

Result<int32_t> LocalBusinessRules::UpdateRS(std::string& dbUsed, RecordsetPtr& rs,
                                             std::string& table) {
    if (!rs)
        return Error{err::kBadArgument, describeError(err::kBadArgument) + ": no recordset"};
    return core_->updateRS(ticketFor(dbUsed), dbUsed, *rs, table);
}

Result<int32_t> LocalBusinessRules::GetUniqueID(std::string& dbUsed, const std::string& keyField) {
    return core_->getUniqueID(ticketFor(dbUsed), dbUsed, keyField);
}

Result<int32_t> LocalBusinessRules::ValidateID(std::string& dbUsed, const std::string& keyField,
                                               const std::string& table) {
    return core_->validateID(ticketFor(dbUsed), dbUsed, keyField, table);
}

Status LocalBusinessRules::Version(bool) {
    return okStatus();
}

Result<int32_t> LocalBusinessRules::ValidLogon(std::string& dbName, std::string& userName,
                                               std::string& password, RecordsetPtr& userRecord) {
    auto reply = core_->validLogon(dbName, userName, password);
    if (!reply.ok())
        return reply.error();
    LogonReply& r = reply.value();
    if (!r.ticket.empty())
        TicketCache::instance().put(serverKey_, dbName, r.ticket);
    if (r.record)
        userRecord = std::move(r.record);
    return r.result;
}

Result<int32_t> LocalBusinessRules::ChangePassword(std::string& dbName, RecordsetPtr& userRecord,
                                                   std::string& oldPassword,
                                                   std::string& newPassword) {
    if (!userRecord)
        return Error{err::kBadArgument, describeError(err::kBadArgument) + ": no user record"};
    auto reply =
        core_->changePassword(ticketFor(dbName), dbName, *userRecord, oldPassword, newPassword);
    if (!reply.ok())
        return reply.error();
    ChangeReply& r = reply.value();
    if (!r.ticket.empty())
        TicketCache::instance().put(serverKey_, dbName, r.ticket);
    if (r.record)
        userRecord = std::move(r.record);
    return r.result;
}

Result<double> LocalBusinessRules::PasswordCode(std::string& newPassword, double& moment) {
    std::string ticket = TicketCache::instance().latest(serverKey_).value_or(std::string());
    return core_->passwordCode(ticket, newPassword, moment);
}

}  // namespace kest
