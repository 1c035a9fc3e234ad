#include "remote/RemoteServer.h"

#include <grpcpp/grpcpp.h>
#include <grpcpp/security/server_credentials.h>

#include <chrono>
#include <exception>
#include <fstream>
#include <mutex>
#include <sstream>

#include "kestlogon.grpc.pb.h"
#include "recordset/Wire.h"
#include "remote/Framing.h"
#include "remote/HostPort.h"
#include "service/Errors.h"

namespace kest {

namespace {

Result<std::string> readPemFile(const std::string& file, const char* what) {
    std::ifstream in(file, std::ios::binary);
    if (!in)
        return Error{err::kTls, "Cannot read the TLS " + std::string(what) + " file " + file};
    std::ostringstream text;
    text << in.rdbuf();
    if (text.str().empty())
        return Error{err::kTls, "The TLS " + std::string(what) + " file " + file + " is empty"};
    return text.str();
}

void setError(rpc::Reply& reply, const Error& e) {
    reply.set_error_number(e.number);
    reply.set_error_description(e.description);
}

// Serves one call: joins the request's frames, runs the operation on the core
// and answers. Anything malformed is answered with err::kBadMessage; nothing a
// client sends ends the server.
class KestlogonService final : public rpc::Kestlogon::Service {
public:
    KestlogonService(std::shared_ptr<ServiceCore> core, std::size_t maxRequestBytes)
        : core_(std::move(core)), maxRequestBytes_(maxRequestBytes) {}

    grpc::Status Call(grpc::ServerContext* /*context*/,
                      grpc::ServerReaderWriter<rpc::Frame, rpc::Frame>* stream) override {
        rpc::Reply reply;
        std::string bytes;
        switch (remote::readFrames(*stream, bytes, maxRequestBytes_)) {
            case remote::ReadOutcome::Complete:
                answer(bytes, reply);
                break;
            case remote::ReadOutcome::Truncated:
                setError(reply, {err::kBadMessage,
                                 "Bad message: the request ended before its last frame"});
                break;
            case remote::ReadOutcome::TooLarge:
                setError(reply,
                         {err::kBadMessage, "Bad message: the request is larger than " +
                                                std::to_string(maxRequestBytes_) + " bytes"});
                break;
        }
        bytes.clear();
        bytes.shrink_to_fit();
        std::string out;
        if (!reply.SerializeToString(&out)) {
            rpc::Reply failed;
            setError(failed, {err::kInternal, "The reply could not be encoded"});
            out = failed.SerializeAsString();
        }
        remote::writeFrames(*stream, out);
        return grpc::Status::OK;
    }

private:
    void answer(const std::string& bytes, rpc::Reply& reply) {
        rpc::Request request;
        if (!request.ParseFromString(bytes)) {
            setError(reply, {err::kBadMessage, "Bad message: the request could not be decoded"});
            return;
        }
        try {
            dispatch(request, reply);
        } catch (const WireError& e) {
            reply.Clear();
            setError(reply,
                     {err::kBadMessage,
                      std::string("Bad message: a recordset could not be decoded: ") + e.what()});
        } catch (const std::exception& e) {
            reply.Clear();
            setError(reply, {err::kInternal, std::string("Internal error: ") + e.what()});
        }
    }

    template <class T>
    static bool failed(const Result<T>& r, rpc::Reply& reply) {
        if (r.ok())
            return false;
        setError(reply, r.error());
        return true;
    }

    void dispatch(const rpc::Request& request, rpc::Reply& reply) {
        const std::string& ticket = request.ticket();
        switch (request.op_case()) {
            case rpc::Request::kGetTable: {
                const auto& a = request.get_table();
                auto r = core_->getTable(ticket, a.dsn(), a.table());
                if (!failed(r, reply) && r.value())
                    reply.set_recordset(encodeRecordset(*r.value(), EncodeScope::All));
                return;
            }
            case rpc::Request::kUpdateRs: {
                const auto& a = request.update_rs();
                RecordsetPtr rs = decodeRecordset(a.recordset());
                auto r = core_->updateRS(ticket, a.dsn(), *rs, a.table());
                if (failed(r, reply))
                    return;
                reply.set_result(r.value());
                reply.set_recordset(encodeRecordset(*rs, EncodeScope::All));
                return;
            }
            case rpc::Request::kGetUniqueId: {
                const auto& a = request.get_unique_id();
                auto r = core_->getUniqueID(ticket, a.dsn(), a.key_field());
                if (!failed(r, reply))
                    reply.set_result(r.value());
                return;
            }
            case rpc::Request::kValidateId: {
                const auto& a = request.validate_id();
                auto r = core_->validateID(ticket, a.dsn(), a.key_field(), a.table());
                if (!failed(r, reply))
                    reply.set_result(r.value());
                return;
            }
            case rpc::Request::kVersion:
                return;
            case rpc::Request::kValidLogon: {
                const auto& a = request.valid_logon();
                auto r = core_->validLogon(a.dsn(), a.user_name(), a.password());
                if (failed(r, reply))
                    return;
                reply.set_result(r.value().result);
                reply.set_ticket(r.value().ticket);
                if (r.value().record)
                    reply.set_recordset(encodeRecordset(*r.value().record, EncodeScope::All));
                return;
            }
            case rpc::Request::kChangePassword: {
                const auto& a = request.change_password();
                RecordsetPtr record = decodeRecordset(a.user_record());
                auto r = core_->changePassword(ticket, a.dsn(), *record, a.old_password(),
                                               a.new_password());
                if (failed(r, reply))
                    return;
                reply.set_result(r.value().result);
                reply.set_ticket(r.value().ticket);
                if (r.value().record)
                    reply.set_recordset(encodeRecordset(*r.value().record, EncodeScope::All));
                return;
            }
            case rpc::Request::kPasswordCode: {
                const auto& a = request.password_code();
                auto r = core_->passwordCode(ticket, a.password(), a.moment());
                if (!failed(r, reply))
                    reply.set_code(r.value());
                return;
            }
            case rpc::Request::OP_NOT_SET:
                break;
        }
        setError(reply, {err::kBadMessage, "Bad message: the request names no operation"});
    }

    std::shared_ptr<ServiceCore> core_;
    std::size_t maxRequestBytes_;
};

class GrpcRemoteServer final : public RemoteServer {
public:
    GrpcRemoteServer(std::shared_ptr<ServiceCore> core, std::size_t maxRequestBytes)
        : service_(std::move(core), maxRequestBytes) {}
    ~GrpcRemoteServer() override { shutdown(); }

    Status build(const ServerOptions& options, const remote::HostPort& address) {
        std::shared_ptr<grpc::ServerCredentials> credentials;
        if (options.tlsCertFile.empty()) {
            credentials = grpc::InsecureServerCredentials();
        } else {
            auto cert = readPemFile(options.tlsCertFile, "certificate");
            if (!cert)
                return cert.error();
            auto key = readPemFile(options.tlsKeyFile, "key");
            if (!key)
                return key.error();
            grpc::SslServerCredentialsOptions ssl;
            ssl.pem_key_cert_pairs.push_back({key.value(), cert.value()});
            credentials = grpc::SslServerCredentials(ssl);
        }
        grpc::ServerBuilder builder;
        builder.AddListeningPort(address.target(), credentials, &port_);
        builder.RegisterService(&service_);
        builder.SetMaxReceiveMessageSize(remote::kMaxGrpcMessage);
        builder.SetMaxSendMessageSize(remote::kMaxGrpcMessage);
        server_ = builder.BuildAndStart();
        if (!server_ || port_ == 0) {
            server_.reset();
            return Error{err::kBadArgument,
                         "Cannot listen on " + options.listen +
                             ": the address is in use, not local to this machine, or invalid"};
        }
        return okStatus();
    }

    int port() const override { return port_; }
    void wait() override {
        if (server_)
            server_->Wait();
    }
    void shutdown() override {
        std::lock_guard lock(mutex_);
        if (!server_ || stopped_)
            return;
        stopped_ = true;
        // Calls still running after the grace period are cancelled, so that a
        // stop never waits on a client that has gone quiet.
        server_->Shutdown(std::chrono::system_clock::now() + std::chrono::milliseconds(500));
    }

private:
    KestlogonService service_;
    std::unique_ptr<grpc::Server> server_;
    int port_ = 0;
    std::mutex mutex_;
    bool stopped_ = false;
};

}  // namespace

Result<std::unique_ptr<RemoteServer>> RemoteServer::start(std::shared_ptr<ServiceCore> core,
                                                          const ServerOptions& options) {
    if (!core)
        return Error{err::kBadArgument, "No service to serve"};
    auto address = remote::parseHostPort(options.listen, 0, true);
    if (!address)
        return address.error();
    const bool tls = !options.tlsCertFile.empty() || !options.tlsKeyFile.empty();
    if (tls && (options.tlsCertFile.empty() || options.tlsKeyFile.empty()))
        return Error{err::kTls, "TLS needs both a certificate file and a key file"};
    if (!tls && !remote::isLoopbackHost(address.value().host))
        return Error{err::kTls, "Refusing to listen on " + options.listen +
                                    " without TLS: only loopback addresses (127.0.0.0/8, ::1, "
                                    "localhost) may be served unencrypted; give a certificate "
                                    "and a key"};
    auto server = std::make_unique<GrpcRemoteServer>(std::move(core), options.maxRequestBytes);
    KEST_TRY(server->build(options, address.value()));
    return std::unique_ptr<RemoteServer>(std::move(server));
}

}  // namespace kest
