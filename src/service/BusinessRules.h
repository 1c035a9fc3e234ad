#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "Result.h"
#include "recordset/Recordset.h"

namespace kest {

constexpr const char* kBusinessRulesProgID = "KestlogonDBbusiness.BusinessRules";

// The business-rules service object as its callers see it: the eight
// operations, in their argument order, with the by-reference arguments as
// references. An error (Result::error) is a failed call; a result value is
// what the operation answers. Implemented in process (LocalBusinessRules) and
// over the network (RemoteBusinessRules); both take their session from the
// process's TicketCache, so an object created after the logon on the same
// server and data source works with the logon's session.
class IBusinessRules {
public:
    virtual ~IBusinessRules() = default;

    // The table's recordset.
    virtual Result<RecordsetPtr> GetTable(std::string& dbUsed, const std::string& table) = 0;
    // Sends the pending records of `rs` in one transaction. 0 or more: records
    // written, and `rs` settled (statuses unmodified, originals updated); the
    // pointer may be replaced. Below 0 (as an Error): nothing written, `rs` as
    // it was, the description naming the record and the reason.
    virtual Result<int32_t> UpdateRS(std::string& dbUsed, RecordsetPtr& rs, std::string& table) = 0;
    // A new key value for that key field, above every existing key.
    virtual Result<int32_t> GetUniqueID(std::string& dbUsed, const std::string& keyField) = 0;
    // Number of records whose key was corrected.
    virtual Result<int32_t> ValidateID(std::string& dbUsed, const std::string& keyField,
                                       const std::string& table) = 0;
    // Proves that the object answers.
    virtual Status Version(bool flag) = 0;
    // 0 rejected, -1 logged on, -2 logged on with the password expired,
    // n > 0 logged on after n failures. `userRecord` is replaced by the user's
    // record ("UserID", "Name", "Firstname", "Lastname", "Security",
    // "PasswordMinLength") on a logon.
    virtual Result<int32_t> ValidLogon(std::string& dbName, std::string& userName,
                                       std::string& password, RecordsetPtr& userRecord) = 0;
    // -1 changed, 0 too short, -3 invalid old password, -4 used before; the
    // fresh record replaces `userRecord` on success.
    virtual Result<int32_t> ChangePassword(std::string& dbName, RecordsetPtr& userRecord,
                                           std::string& oldPassword, std::string& newPassword) = 0;
    virtual Result<double> PasswordCode(std::string& newPassword, double& moment) = 0;
};

using BusinessObjectPtr = std::shared_ptr<IBusinessRules>;

}  // namespace kest
