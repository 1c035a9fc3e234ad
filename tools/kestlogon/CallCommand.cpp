#include <iostream>
#include <map>

#include "ArgParser.h"
#include "Commands.h"
#include "Csv.h"
#include "remote/ObjectFactory.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/LocalBusinessRules.h"

namespace kest::tool {

namespace {

// Operations and the number of words each takes after its name.
const std::map<std::string, std::size_t>& operations() {
    static const std::map<std::string, std::size_t> ops = {
        {"GetTable", 1}, {"GetUniqueID", 1}, {"ValidateID", 2},
        {"Version", 0},  {"ValidLogon", 0},  {"ChangePassword", 0}};
    return ops;
}

int report(const Error& e) {
    return reportError(e.number, e.description);
}

}  // namespace

int runCall(const std::vector<std::string>& words) {
    ArgParser args({"server", "data-dir", "dsn", "user"}, {});
    std::string problem;
    if (!args.parse(words, problem))
        return usageError(problem);
    if (!args.value("dsn") || !args.value("user"))
        return usageError("call needs --dsn and --user");
    if (args.positional().empty())
        return usageError("call needs an operation");
    const std::string op = args.positional().front();
    const auto known = operations().find(op);
    if (known == operations().end())
        return usageError("unknown operation " + op);
    if (args.positional().size() - 1 != known->second)
        return usageError(op + " takes " + std::to_string(known->second) + " argument(s)");
    const std::vector<std::string> opArgs(args.positional().begin() + 1, args.positional().end());

    std::string password;
    if (!readSecretLine(password))
        return reportError(err::kBadArgument, "no password on standard input");
    std::string newPassword;
    if (op == "ChangePassword" && !readSecretLine(newPassword))
        return reportError(err::kBadArgument,
                           "ChangePassword reads the new password from the second line of "
                           "standard input, and there is none");

    BusinessObjectPtr bo;
    const std::string server = args.value("server").value_or("");
    if (server.empty()) {
        const std::filesystem::path dataDir = args.value("data-dir")
                                                  ? std::filesystem::path(*args.value("data-dir"))
                                                  : defaultDataDir();
        bo = std::make_shared<LocalBusinessRules>(LocalBusinessRules::coreFor(dataDir));
    } else {
        auto created = CreateObject(kBusinessRulesProgID, server);
        if (!created)
            return report(created.error());
        bo = created.value();
    }

    std::string dsn = *args.value("dsn");
    std::string user = *args.value("user");
    RecordsetPtr record;
    auto logon = bo->ValidLogon(dsn, user, password, record);
    if (!logon)
        return report(logon.error());
    if (logon.value() == 0) {
        std::cerr << "error: logon refused for user " << user << " on data source " << dsn
                  << " (unknown user, wrong password, inactive or expired account)" << std::endl;
        return kExitError;
    }
    if (logon.value() == -2 && op != "ChangePassword") {
        std::cerr << "error: the password of user " << user
                  << " has expired; change it first with the ChangePassword operation" << std::endl;
        return kExitError;
    }

    if (op == "ValidLogon") {
        std::cout << logon.value() << "\n";
    } else if (op == "Version") {
        const Status answered = bo->Version(false);
        if (!answered)
            return report(answered.error());
        std::cout << KEST_VERSION_MAJOR << "." << KEST_VERSION_MINOR << "." << KEST_VERSION_PATCH
                  << "\n";
    } else if (op == "GetTable") {
        auto table = bo->GetTable(dsn, opArgs[0]);
        if (!table)
            return report(table.error());
        if (!table.value())
            return reportError(err::kInternal, "the service returned no recordset");
        writeCsv(*table.value(), std::cout);
    } else if (op == "GetUniqueID") {
        auto id = bo->GetUniqueID(dsn, opArgs[0]);
        if (!id)
            return report(id.error());
        std::cout << id.value() << "\n";
    } else if (op == "ValidateID") {
        auto fixed = bo->ValidateID(dsn, opArgs[0], opArgs[1]);
        if (!fixed)
            return report(fixed.error());
        std::cout << fixed.value() << "\n";
    } else if (op == "ChangePassword") {
        if (!record)
            return reportError(err::kInternal, "the logon handed back no user record");
        auto changed = bo->ChangePassword(dsn, record, password, newPassword);
        if (!changed)
            return report(changed.error());
        std::cout << changed.value() << "\n";
        if (changed.value() != -1) {
            std::cerr << "error: the password was not changed (result " << changed.value() << ": "
                      << (changed.value() == -3   ? "invalid old password"
                          : changed.value() == -4 ? "password used before"
                                                  : "new password too short")
                      << ")" << std::endl;
            return kExitError;
        }
    }
    std::cout.flush();
    return std::cout ? kExitOk : kExitError;
}

}  // namespace kest::tool
