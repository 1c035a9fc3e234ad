#include "remote/HostPort.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <algorithm>
#include <cctype>
#include <cstring>

#include "service/Errors.h"

namespace kest::remote {

namespace {

Error malformed(std::string_view text, const std::string& why) {
    return Error{err::kBadArgument,
                 "Malformed server address \"" + std::string(text) + "\": " + why};
}

bool hostNameChar(char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '.' || c == '-' || c == '_';
}

bool validIPv6(const std::string& host) {
    in6_addr addr{};
    return inet_pton(AF_INET6, host.c_str(), &addr) == 1;
}

}  // namespace

std::string HostPort::target() const {
    if (host.find(':') != std::string::npos)
        return "[" + host + "]:" + std::to_string(port);
    return host + ":" + std::to_string(port);
}

Result<HostPort> parseHostPort(std::string_view text, int defaultPort, bool allowPortZero) {
    HostPort out;
    std::string_view portText;
    bool hasPort = false;
    if (!text.empty() && text.front() == '[') {
        const auto close = text.find(']');
        if (close == std::string_view::npos)
            return malformed(text, "missing ']'");
        out.host = std::string(text.substr(1, close - 1));
        if (!validIPv6(out.host))
            return malformed(text, "not an IPv6 address in brackets");
        const std::string_view rest = text.substr(close + 1);
        if (!rest.empty()) {
            if (rest.front() != ':')
                return malformed(text, "unexpected text after ']'");
            portText = rest.substr(1);
            hasPort = true;
        }
    } else {
        const auto colon = text.find(':');
        if (colon != std::string_view::npos && text.find(':', colon + 1) != std::string_view::npos)
            return malformed(text, "an IPv6 address needs brackets, as in [::1]:50551");
        out.host = std::string(text.substr(0, colon));
        if (colon != std::string_view::npos) {
            portText = text.substr(colon + 1);
            hasPort = true;
        }
        if (out.host.empty())
            return malformed(text, "no host name");
        if (out.host.size() > 253 || !std::all_of(out.host.begin(), out.host.end(), hostNameChar))
            return malformed(text, "the host name holds characters a host name cannot hold");
    }
    if (!hasPort) {
        out.port = defaultPort;
        return out;
    }
    if (portText.empty() || portText.size() > 5 ||
        !std::all_of(portText.begin(), portText.end(), [](char c) { return c >= '0' && c <= '9'; }))
        return malformed(text, "the port is not a number");
    out.port = std::stoi(std::string(portText));
    if (out.port > 65535 || (out.port == 0 && !allowPortZero))
        return malformed(text, "the port is out of range");
    return out;
}

bool isLoopbackHost(std::string_view host) {
    std::string lower(host);
    std::transform(lower.begin(), lower.end(), lower.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    if (lower == "localhost")
        return true;
    in_addr v4{};
    if (inet_pton(AF_INET, lower.c_str(), &v4) == 1)
        return (ntohl(v4.s_addr) >> 24) == 127;
    in6_addr v6{};
    if (inet_pton(AF_INET6, lower.c_str(), &v6) == 1)
        return std::memcmp(&v6, &in6addr_loopback, sizeof v6) == 0;
    return false;
}

}  // namespace kest::remote
