#include <signal.h>
#include <unistd.h>

#include <fstream>
#include <iostream>

#include "ArgParser.h"
#include "Commands.h"
#include "remote/HostPort.h"
#include "remote/ObjectFactory.h"
#include "remote/RemoteServer.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/LocalBusinessRules.h"

namespace kest::tool {

int runServe(const std::vector<std::string>& words) {
    ArgParser args({"data-dir", "listen", "tls-cert", "tls-key", "pid-file"}, {});
    std::string problem;
    if (!args.parse(words, problem))
        return usageError(problem);
    if (!args.positional().empty())
        return usageError("serve takes no words besides its options");
    if (args.value("tls-cert").has_value() != args.value("tls-key").has_value())
        return usageError("--tls-cert and --tls-key go together");

    const std::filesystem::path dataDir =
        args.value("data-dir") ? std::filesystem::path(*args.value("data-dir")) : defaultDataDir();
    ServerOptions options;
    options.listen = args.value("listen").value_or("127.0.0.1:" + std::to_string(kDefaultPort));
    options.tlsCertFile = args.value("tls-cert").value_or("");
    options.tlsKeyFile = args.value("tls-key").value_or("");
    auto address = remote::parseHostPort(options.listen, kDefaultPort, true);
    if (!address)
        return usageError(address.error().description);
    options.listen = address.value().target();

    // The signals that stop the server are taken by sigwait below, on this
    // thread; blocking them first keeps gRPC's threads, which inherit the
    // mask, from being chosen to receive them.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGINT);
    sigaddset(&stopSignals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    auto server = RemoteServer::start(LocalBusinessRules::coreFor(dataDir), options);
    if (!server)
        return reportError(server.error().number, server.error().description);

    remote::HostPort bound = address.value();
    bound.port = server.value()->port();
    const auto pidFile = args.value("pid-file");
    if (pidFile) {
        std::ofstream out(*pidFile, std::ios::trunc);
        out << getpid() << "\n";
        if (!out) {
            server.value()->shutdown();
            return reportError(err::kBadArgument, "cannot write the pid file " + *pidFile);
        }
    }
    std::cout << "listening on " << bound.target() << std::endl;

    int received = 0;
    while (sigwait(&stopSignals, &received) != 0) {
    }
    std::cerr << "kestlogon: stopping on signal " << received << std::endl;
    server.value()->shutdown();
    server.value()->wait();
    if (pidFile)
        std::remove(pidFile->c_str());
    return kExitOk;
}

}  // namespace kest::tool
