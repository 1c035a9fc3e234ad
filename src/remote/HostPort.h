#pragma once

#include <string>
#include <string_view>

#include "service/Result.h"

namespace kest::remote {

// A server's or a listening address's host and port.
struct HostPort {
    std::string host;  // a name, an IPv4 address or an IPv6 address (no brackets)
    int port = 0;

    // The form gRPC takes: "host:port", "[v6]:port".
    std::string target() const;
};

// Parses "host", "host:port", "[v6]" or "[v6]:port"; a missing port is
// `defaultPort`. Malformed text (no host, a port that is not a number in
// range, blanks or other characters a host name cannot hold) is
// err::kBadArgument. Port 0 is accepted only with `allowPortZero`.
Result<HostPort> parseHostPort(std::string_view text, int defaultPort, bool allowPortZero);

// localhost, 127.0.0.0/8 or ::1.
bool isLoopbackHost(std::string_view host);

}  // namespace kest::remote
