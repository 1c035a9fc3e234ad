#include <algorithm>
#include <cstdio>
#include <iostream>
#include <string>
#include <vector>

#include "Commands.h"
#include "service/Errors.h"

namespace kest::tool {

namespace {

constexpr const char* kUsage =
    "usage:\n"
    "  kestlogon init  [--data-dir DIR] --dsn NAME --admin NAME [--demo]\n"
    "                  (the password is read from standard input)\n"
    "  kestlogon serve [--data-dir DIR] --listen ADDR:PORT [--tls-cert F --tls-key F]\n"
    "                  [--pid-file F]\n"
    "  kestlogon call  [--server HOST[:PORT]] [--data-dir DIR] --dsn NAME --user NAME\n"
    "                  OPERATION [ARG...]\n"
    "                  (the password is read from standard input)\n"
    "operations of call:\n"
    "  GetTable TABLE             prints the table as CSV with a header line\n"
    "  GetUniqueID FIELD          prints a new key value for FIELD\n"
    "  ValidateID FIELD TABLE     prints the number of records repaired\n"
    "  Version                    prints the version once the service answers\n"
    "  ValidLogon                 prints the logon result\n"
    "  ChangePassword             reads the new password from the second line of\n"
    "                             standard input; prints the result\n"
    "--data-dir defaults to $KESTLOGON_DATA_DIR, else $XDG_DATA_HOME/kestlogon,\n"
    "else ~/.local/share/kestlogon.\n";

}  // namespace

int usageError(const std::string& problem) {
    if (!problem.empty())
        std::cerr << "kestlogon: " << problem << "\n";
    std::cerr << kUsage;
    return kExitUsage;
}

int reportError(int number, const std::string& description) {
    std::cerr << "error " << number << ": " << description << std::endl;
    return kExitError;
}

bool readSecretLine(std::string& line) {
    if (!std::getline(std::cin, line))
        return false;
    if (!line.empty() && line.back() == '\r')
        line.pop_back();
    return true;
}

}  // namespace kest::tool

int main(int argc, char** argv) {
    using namespace kest::tool;
    std::vector<std::string> words(argv + std::min(argc, 2), argv + argc);
    const std::string command = argc > 1 ? argv[1] : "";
    try {
        if (command == "init")
            return runInit(words);
        if (command == "serve")
            return runServe(words);
        if (command == "call")
            return runCall(words);
        if (command == "--help" || command == "-h" || command == "help") {
            std::cout << kUsage;
            return kExitOk;
        }
        if (command == "--version") {
            std::cout << KEST_VERSION_MAJOR << "." << KEST_VERSION_MINOR << "."
                      << KEST_VERSION_PATCH << "\n";
            return kExitOk;
        }
    } catch (const std::exception& e) {
        return reportError(kest::err::kInternal, std::string("unexpected failure: ") + e.what());
    }
    return usageError(command.empty() ? "no subcommand" : "unknown subcommand " + command);
}
