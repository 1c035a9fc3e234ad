#include <iostream>

#include "ArgParser.h"
#include "Commands.h"
#include "service/DataSources.h"
#include "service/Errors.h"
#include "service/Provisioning.h"

namespace kest::tool {

int runInit(const std::vector<std::string>& words) {
    ArgParser args({"data-dir", "dsn", "admin"}, {"demo"});
    std::string problem;
    if (!args.parse(words, problem))
        return usageError(problem);
    if (!args.positional().empty())
        return usageError("init takes no words besides its options");
    if (!args.value("dsn") || !args.value("admin"))
        return usageError("init needs --dsn and --admin");

    InitOptions options;
    options.dataDir =
        args.value("data-dir") ? std::filesystem::path(*args.value("data-dir")) : defaultDataDir();
    options.dsn = *args.value("dsn");
    options.adminName = *args.value("admin");
    options.demo = args.flag("demo");
    if (!readSecretLine(options.password) || options.password.empty())
        return reportError(err::kBadArgument,
                           "no password on standard input: give the administrator's password "
                           "as one line");

    const Status done = initDataSource(options);
    if (!done)
        return reportError(done.error().number, done.error().description);
    std::cout << "data source " << options.dsn << " created in " << options.dataDir.string()
              << "\n";
    return kExitOk;
}

}  // namespace kest::tool
