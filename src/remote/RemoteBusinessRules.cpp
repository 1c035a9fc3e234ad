#include "remote/RemoteBusinessRules.h"

#include <grpcpp/grpcpp.h>

#include <cmath>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include "kestlogon.grpc.pb.h"
#include "recordset/Wire.h"
#include "remote/Framing.h"
#include "service/Errors.h"
#include "service/TicketCache.h"

namespace kest {

namespace {

using std::chrono::milliseconds;

constexpr milliseconds kCallDeadline{30'000};
constexpr milliseconds kTableDeadline{120'000};

milliseconds deadlineFor(milliseconds fallback) {
    if (const char* text = std::getenv("KESTLOGON_CALL_TIMEOUT")) {
        char* end = nullptr;
        const double seconds = std::strtod(text, &end);
        if (end != text && std::isfinite(seconds) && seconds > 0 && seconds < 1e6)
            return milliseconds(static_cast<long long>(seconds * 1000.0));
    }
    return fallback;
}

std::string secondsText(milliseconds d) {
    std::ostringstream out;
    out << static_cast<double>(d.count()) / 1000.0 << " s";
    return out.str();
}

Error decodeFailure(const std::string& server, const std::string& what) {
    return Error{err::kBadMessage, "Bad message: the reply of the service on " + server +
                                       " could not be decoded (" + what + ")"};
}

}  // namespace

bool RemoteBusinessRules::tlsConfigured() {
    const char* ca = std::getenv("KESTLOGON_TLS_CA");
    return ca != nullptr && *ca != '\0';
}

std::shared_ptr<grpc::Channel> RemoteBusinessRules::makeChannel(const std::string& target) {
    grpc::ChannelArguments args;
    args.SetMaxReceiveMessageSize(remote::kMaxGrpcMessage);
    args.SetMaxSendMessageSize(remote::kMaxGrpcMessage);
    std::shared_ptr<grpc::ChannelCredentials> credentials;
    if (tlsConfigured()) {
        grpc::SslCredentialsOptions ssl;
        std::ifstream in(std::getenv("KESTLOGON_TLS_CA"), std::ios::binary);
        std::ostringstream pem;
        pem << in.rdbuf();
        // An unreadable file leaves no roots: the handshake then fails and the
        // caller hears about TLS, instead of silently falling back to the
        // system's roots.
        ssl.pem_root_certs = pem.str().empty() ? std::string("-") : pem.str();
        credentials = grpc::SslCredentials(ssl);
    } else {
        credentials = grpc::InsecureChannelCredentials();
    }
    return grpc::CreateCustomChannel(target, credentials, args);
}

RemoteBusinessRules::RemoteBusinessRules(std::string server, std::shared_ptr<grpc::Channel> channel)
    : server_(std::move(server)), channel_(std::move(channel)) {}

RemoteBusinessRules::~RemoteBusinessRules() = default;

std::string RemoteBusinessRules::ticketFor(const std::string& dsn) const {
    return TicketCache::instance().get(server_, dsn).value_or(std::string());
}

Result<rpc::Reply> RemoteBusinessRules::call(const rpc::Request& request, milliseconds deadline) {
    std::string bytes;
    if (!request.SerializeToString(&bytes))
        return Error{err::kBadArgument, "The request is too large to be sent"};

    grpc::ClientContext context;
    context.set_deadline(std::chrono::system_clock::now() + deadline);
    auto stub = rpc::Kestlogon::NewStub(channel_);
    auto stream = stub->Call(&context);
    std::string answer;
    if (remote::writeFrames(*stream, bytes)) {
        stream->WritesDone();
        bytes.clear();
        bytes.shrink_to_fit();
        if (remote::readFrames(*stream, answer, remote::kMaxReplyBytes) ==
            remote::ReadOutcome::TooLarge) {
            context.TryCancel();
            stream->Finish().ok();
            return decodeFailure(server_, "the reply is too large");
        }
    }
    const grpc::Status status = stream->Finish();
    if (!status.ok()) {
        const std::string detail =
            status.error_message().empty() ? std::string() : ": " + status.error_message();
        switch (status.error_code()) {
            case grpc::StatusCode::DEADLINE_EXCEEDED:
                return Error{err::kTimeout, "Timeout: the service on " + server_ +
                                                " did not answer within " + secondsText(deadline)};
            case grpc::StatusCode::UNAVAILABLE:
                return Error{err::kUnreachable, "Server unreachable: cannot reach the service on " +
                                                    server_ + (tlsConfigured() ? " over TLS" : "") +
                                                    detail};
            default:
                return Error{err::kUnreachable, "Server unreachable: the call to the service on " +
                                                    server_ + " failed" + detail};
        }
    }
    rpc::Reply reply;
    if (!reply.ParseFromString(answer))
        return decodeFailure(server_, "malformed or incomplete");
    if (reply.error_number() != 0)
        return Error{reply.error_number(), reply.error_description()};
    return reply;
}

Result<RecordsetPtr> RemoteBusinessRules::GetTable(std::string& dbUsed, const std::string& table) {
    rpc::Request request;
    request.set_ticket(ticketFor(dbUsed));
    auto* a = request.mutable_get_table();
    a->set_dsn(dbUsed);
    a->set_table(table);
    auto reply = call(request, deadlineFor(kTableDeadline));
    if (!reply)
        return reply.error();
    try {
        return decodeRecordset(reply.value().recordset());
    } catch (const WireError& e) {
        return decodeFailure(server_, e.what());
    }
}

Result<int32_t> RemoteBusinessRules::UpdateRS(std::string& dbUsed, RecordsetPtr& rs,
                                              std::string& table) {
    if (!rs)
        return Error{err::kBadArgument, "UpdateRS needs a recordset"};
    rpc::Request request;
    request.set_ticket(ticketFor(dbUsed));
    auto* a = request.mutable_update_rs();
    a->set_dsn(dbUsed);
    a->set_table(table);
    a->set_recordset(encodeRecordset(*rs, EncodeScope::Pending));
    auto reply = call(request, deadlineFor(kTableDeadline));
    if (!reply)
        return reply.error();
    try {
        RecordsetPtr settled = decodeRecordset(reply.value().recordset());
        rs->mergeSettled(*settled);
    } catch (const std::exception& e) {
        // The batch is stored but its keys could not be taken over: the caller
        // must fetch the table again rather than trust the recordset.
        return Error{err::kBadMessage, "Bad message: the batch was written on " + server_ +
                                           " but its settled records could not be read back (" +
                                           e.what() + "); fetch the table again"};
    }
    return reply.value().result();
}

Result<int32_t> RemoteBusinessRules::GetUniqueID(std::string& dbUsed, const std::string& keyField) {
    rpc::Request request;
    request.set_ticket(ticketFor(dbUsed));
    auto* a = request.mutable_get_unique_id();
    a->set_dsn(dbUsed);
    a->set_key_field(keyField);
    auto reply = call(request, deadlineFor(kCallDeadline));
    if (!reply)
        return reply.error();
    return reply.value().result();
}

Result<int32_t> RemoteBusinessRules::ValidateID(std::string& dbUsed, const std::string& keyField,
                                                const std::string& table) {
    rpc::Request request;
    request.set_ticket(ticketFor(dbUsed));
    auto* a = request.mutable_validate_id();
    a->set_dsn(dbUsed);
    a->set_key_field(keyField);
    a->set_table(table);
    auto reply = call(request, deadlineFor(kTableDeadline));
    if (!reply)
        return reply.error();
    return reply.value().result();
}

Status RemoteBusinessRules::Version(bool flag) {
    rpc::Request request;
    request.mutable_version()->set_flag(flag);
    auto reply = call(request, deadlineFor(kCallDeadline));
    if (!reply)
        return reply.error();
    return okStatus();
}

Result<int32_t> RemoteBusinessRules::ValidLogon(std::string& dbName, std::string& userName,
                                                std::string& password, RecordsetPtr& userRecord) {
    rpc::Request request;
    auto* a = request.mutable_valid_logon();
    a->set_dsn(dbName);
    a->set_user_name(userName);
    a->set_password(password);
    auto reply = call(request, deadlineFor(kCallDeadline));
    if (!reply)
        return reply.error();
    try {
        if (reply.value().has_recordset())
            userRecord = decodeRecordset(reply.value().recordset());
    } catch (const WireError& e) {
        return decodeFailure(server_, e.what());
    }
    if (!reply.value().ticket().empty())
        TicketCache::instance().put(server_, dbName, reply.value().ticket());
    return reply.value().result();
}

Result<int32_t> RemoteBusinessRules::ChangePassword(std::string& dbName, RecordsetPtr& userRecord,
                                                    std::string& oldPassword,
                                                    std::string& newPassword) {
    if (!userRecord)
        return Error{err::kBadArgument, "ChangePassword needs the user's record"};
    rpc::Request request;
    request.set_ticket(ticketFor(dbName));
    auto* a = request.mutable_change_password();
    a->set_dsn(dbName);
    a->set_user_record(encodeRecordset(*userRecord, EncodeScope::All));
    a->set_old_password(oldPassword);
    a->set_new_password(newPassword);
    auto reply = call(request, deadlineFor(kCallDeadline));
    if (!reply)
        return reply.error();
    try {
        if (reply.value().has_recordset())
            userRecord = decodeRecordset(reply.value().recordset());
    } catch (const WireError& e) {
        return decodeFailure(server_, e.what());
    }
    if (!reply.value().ticket().empty())
        TicketCache::instance().put(server_, dbName, reply.value().ticket());
    return reply.value().result();
}

Result<double> RemoteBusinessRules::PasswordCode(std::string& newPassword, double& moment) {
    rpc::Request request;
    request.set_ticket(TicketCache::instance().latest(server_).value_or(std::string()));
    auto* a = request.mutable_password_code();
    a->set_password(newPassword);
    a->set_moment(moment);
    auto reply = call(request, deadlineFor(kCallDeadline));
    if (!reply)
        return reply.error();
    return reply.value().code();
}

}  // namespace kest
