#pragma once

#include <string>

#include "service/BusinessRules.h"
#include "service/Result.h"

namespace kest {

// Creates the service object by its ProgID on a server, as the platform's
// CreateObject does. An empty server gives the service in process on the
// data sources of defaultDataDir(); "host" or "host:port" (default port
// kDefaultPort) connects to a running `kestlogon serve`, checking within a
// few seconds that it answers. An unknown ProgID is err::kUnknownProgID, an
// unreachable server err::kUnreachable.
Result<BusinessObjectPtr> CreateObject(const std::string& progId, const std::string& server);

constexpr int kDefaultPort = 50551;

}  // namespace kest
