#include "ArgParser.h"

namespace kest::tool {

bool ArgParser::parse(const std::vector<std::string>& words, std::string& error) {
    for (std::size_t i = 0; i < words.size(); ++i) {
        const std::string& word = words[i];
        if (word.rfind("--", 0) != 0 || word == "--") {
            positional_.assign(words.begin() + static_cast<long>(i) + (word == "--" ? 1 : 0),
                               words.end());
            return true;
        }
        std::string name = word.substr(2);
        std::optional<std::string> inlineValue;
        if (const auto eq = name.find('='); eq != std::string::npos) {
            inlineValue = name.substr(eq + 1);
            name.resize(eq);
        }
        if (flags_.count(name) != 0 && !inlineValue) {
            seenFlags_.insert(name);
        } else if (valued_.count(name) != 0) {
            if (!inlineValue) {
                if (i + 1 >= words.size()) {
                    error = "option --" + name + " needs a value";
                    return false;
                }
                inlineValue = words[++i];
            }
            values_[name] = *inlineValue;
        } else {
            error = "unknown option --" + name;
            return false;
        }
    }
    return true;
}

std::optional<std::string> ArgParser::value(const std::string& name) const {
    const auto it = values_.find(name);
    if (it == values_.end())
        return std::nullopt;
    return it->second;
}

}  // namespace kest::tool
