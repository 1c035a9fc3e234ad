#include "service/Errors.h"

namespace kest {

std::string describeError(int32_t number) {
    switch (number) {
        case err::kUnknownDataSource:
            return "Unknown data source: no data source of that name is configured on the server";
        case err::kAccessDenied:
            return "Access denied: the user's security level does not allow this operation";
        case err::kNotLoggedOn:
            return "Not logged on: there is no valid session, or it has expired";
        case err::kPasswordChangeRequired:
            return "Password change required: the password has expired and must be changed first";
        case err::kUnknownTable:
            return "Unknown table: the name is not a table of the database";
        case err::kUnknownField:
            return "Unknown field: the name is not a field of the table";
        case err::kWrongType:
            return "Wrong type: a value does not fit the type of its field";
        case err::kConflict:
            return "Conflict: the record was changed by someone else since it was read";
        case err::kRecordGone:
            return "Record gone: the record was deleted by someone else since it was read";
        case err::kDuplicateUserName:
            return "Duplicate user name: another user already has that name";
        case err::kDuplicateKey:
            return "Duplicate key: another record already has that identifier";
        case err::kStorage:
            return "Storage error: the database reported a failure";
        case err::kBadArgument:
            return "Bad argument: an argument of the call is missing or invalid";
        case err::kBadMessage:
            return "Bad message: a message could not be decoded";
        case err::kKeyFile:
            return "Key file error: the service's key file is missing, unreadable or malformed";
        case err::kUnreachable:
            return "Server unreachable: the connection to the server failed or was lost";
        case err::kTimeout:
            return "Timeout: the server did not answer in time";
        case err::kUnknownProgID:
            return "Unknown ProgID: no object of that class can be created";
        case err::kInternal:
            return "Internal error: the service failed unexpectedly";
        case err::kTls:
            return "TLS error: the secure connection could not be set up";
        case err::kSchemaVersion:
            return "Schema version: the database was made by a newer version of the service";
        default:
            return "Unknown error " + std::to_string(number);
    }
}

}  // namespace kest
