#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace kest::tool {

// The options of one subcommand: "--name value", "--name=value" and flags.
// Options come first; the first word that is not an option starts the
// positional words, which are kept as they are.
class ArgParser {
public:
    ArgParser(std::set<std::string> valued, std::set<std::string> flags)
        : valued_(std::move(valued)), flags_(std::move(flags)) {}

    // False with `error` set on an unknown option or a missing value.
    bool parse(const std::vector<std::string>& words, std::string& error);

    std::optional<std::string> value(const std::string& name) const;
    bool flag(const std::string& name) const { return seenFlags_.count(name) != 0; }
    const std::vector<std::string>& positional() const { return positional_; }

private:
    std::set<std::string> valued_;
    std::set<std::string> flags_;
    std::map<std::string, std::string> values_;
    std::set<std::string> seenFlags_;
    std::vector<std::string> positional_;
};

}  // namespace kest::tool
