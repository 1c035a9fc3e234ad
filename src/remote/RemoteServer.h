#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include "service/Result.h"
#include "service/ServiceCore.h"

namespace kest {

struct ServerOptions {
    std::string listen = "127.0.0.1:0";  // host:port; port 0 picks a free one
    std::string tlsCertFile;             // PEM; with tlsKeyFile, serve over TLS
    std::string tlsKeyFile;
    // A request larger than this, all frames together, is refused with
    // err::kBadMessage before it is parsed.
    std::size_t maxRequestBytes = std::size_t{1} << 30;
};

// The service over the network (gRPC). Large tables travel in chunks, so no
// message limit caps a table's size. Without TLS it listens on loopback
// addresses only and refuses any other (err::kTls).
class RemoteServer {
public:
    static Result<std::unique_ptr<RemoteServer>> start(std::shared_ptr<ServiceCore> core,
                                                       const ServerOptions& options);
    virtual ~RemoteServer() = default;
    virtual int port() const = 0;  // the port actually bound
    virtual void wait() = 0;       // until shutdown()
    virtual void shutdown() = 0;   // stops accepting, ends calls in flight
};

}  // namespace kest
