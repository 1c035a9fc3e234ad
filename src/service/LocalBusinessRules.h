#pragma once

#include <filesystem>
#include <memory>

#include "BusinessRules.h"
#include "ServiceCore.h"

namespace kest {

// The service object in process, on the data sources of one data folder.
// Tickets are kept in the TicketCache under "local:" + the data folder.
class LocalBusinessRules : public IBusinessRules {
public:
    explicit LocalBusinessRules(std::shared_ptr<ServiceCore> core);

    // The one ServiceCore of this process for a data folder, created on first use.
    static std::shared_ptr<ServiceCore> coreFor(const std::filesystem::path& dataDir);

    Result<RecordsetPtr> GetTable(std::string& dbUsed, const std::string& table) override;
    Result<int32_t> UpdateRS(std::string& dbUsed, RecordsetPtr& rs, std::string& table) override;
    Result<int32_t> GetUniqueID(std::string& dbUsed, const std::string& keyField) override;
    Result<int32_t> ValidateID(std::string& dbUsed, const std::string& keyField,
                               const std::string& table) override;
    Status Version(bool flag) override;
    Result<int32_t> ValidLogon(std::string& dbName, std::string& userName, std::string& password,
                               RecordsetPtr& userRecord) override;
    Result<int32_t> ChangePassword(std::string& dbName, RecordsetPtr& userRecord,
                                   std::string& oldPassword, std::string& newPassword) override;
    Result<double> PasswordCode(std::string& newPassword, double& moment) override;

private:
    std::string ticketFor(const std::string& dsn) const;
    std::shared_ptr<ServiceCore> core_;
    std::string serverKey_;
};

}  // namespace kest
