#pragma once

#include <string>
#include <vector>

namespace kest::tool {

// Exit codes of the tool.
constexpr int kExitOk = 0;
constexpr int kExitError = 1;
constexpr int kExitUsage = 2;

// Each subcommand takes the words after its name and returns the exit code.
int runInit(const std::vector<std::string>& words);
int runServe(const std::vector<std::string>& words);
int runCall(const std::vector<std::string>& words);

// Prints the usage text (after `problem`, when there is one) on standard error
// and returns kExitUsage.
int usageError(const std::string& problem);
// Prints "error <number>: <description>" on standard error and returns kExitError.
int reportError(int number, const std::string& description);
// One line of standard input without its line end; false at the end of input.
bool readSecretLine(std::string& line);

}  // namespace kest::tool
