#include "remote/ObjectFactory.h"

#include <grpcpp/grpcpp.h>

#include <algorithm>
#include <cctype>
#include <chrono>

#include "remote/HostPort.h"
#include "remote/RemoteBusinessRules.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/LocalBusinessRules.h"

namespace kest {

namespace {

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(), [](char x, char y) {
        return std::tolower(static_cast<unsigned char>(x)) ==
               std::tolower(static_cast<unsigned char>(y));
    });
}

// How long CreateObject waits for a server to answer before calling it
// unreachable.
constexpr std::chrono::seconds kConnectWait{5};

}  // namespace

Result<BusinessObjectPtr> CreateObject(const std::string& progId, const std::string& server) {
    if (!equalsIgnoringCase(progId, kBusinessRulesProgID))
        return Error{err::kUnknownProgID, "Unknown ProgID: no object of class \"" + progId +
                                              "\" can be created (only " + kBusinessRulesProgID +
                                              ")"};
    if (server.empty())
        return BusinessObjectPtr(
            std::make_shared<LocalBusinessRules>(LocalBusinessRules::coreFor(defaultDataDir())));

    auto address = remote::parseHostPort(server, kDefaultPort, false);
    if (!address)
        return address.error();
    auto channel = RemoteBusinessRules::makeChannel(address.value().target());
    if (!channel->WaitForConnected(std::chrono::system_clock::now() + kConnectWait))
        return Error{err::kUnreachable,
                     "Server unreachable: cannot reach the service on " + server +
                         (RemoteBusinessRules::tlsConfigured()
                              ? " (over TLS: the server may be down, not serve TLS, or present a "
                                "certificate that $KESTLOGON_TLS_CA does not vouch for)"
                              : " (is `kestlogon serve` running there?)")};
    return BusinessObjectPtr(std::make_shared<RemoteBusinessRules>(server, std::move(channel)));
}

}  // namespace kest
