#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "service/BusinessRules.h"
#include "service/Result.h"

namespace grpc {
class Channel;
}

namespace kest {

namespace rpc {
class Request;
class Reply;
}  // namespace rpc

// The service object over the network: each operation is one call to a
// `kestlogon serve` on `server`. Every call has a deadline (30 s; GetTable and
// UpdateRS 120 s; $KESTLOGON_CALL_TIMEOUT seconds overrides both), so a lost
// server is an error (err::kUnreachable or err::kTimeout naming the server),
// never a hang. Sessions come from the TicketCache under the server name as
// given. Thread-safe as far as gRPC channels are.
class RemoteBusinessRules : public IBusinessRules {
public:
    // A channel to "host:port" (gRPC's form): TLS with the PEM roots named by
    // $KESTLOGON_TLS_CA when set, else unencrypted (loopback servers only
    // listen that way).
    static std::shared_ptr<grpc::Channel> makeChannel(const std::string& target);
    // Whether makeChannel makes TLS channels, for error descriptions.
    static bool tlsConfigured();

    RemoteBusinessRules(std::string server, std::shared_ptr<grpc::Channel> channel);
    ~RemoteBusinessRules() override;

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

    const std::string& server() const { return server_; }

private:
    // One round trip; an error reply or a failed transport is an Error.
    Result<rpc::Reply> call(const rpc::Request& request, std::chrono::milliseconds deadline);
    std::string ticketFor(const std::string& dsn) const;

    std::string server_;
    std::shared_ptr<grpc::Channel> channel_;
};

}  // namespace kest
