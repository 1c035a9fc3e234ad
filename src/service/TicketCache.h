#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>

namespace kest {

// Session tickets of this process, by server and data source, so that every
// service object created on the same server shares the logon's session. The
// server key is the server name for remote objects and "local:" + the data
// folder for in-process ones. Thread-safe.
class TicketCache {
public:
    static TicketCache& instance();

    void put(const std::string& server, const std::string& dsn, const std::string& ticket);
    std::optional<std::string> get(const std::string& server, const std::string& dsn) const;
    // The ticket last put for that server, whatever its data source (for calls
    // that name none, such as PasswordCode).
    std::optional<std::string> latest(const std::string& server) const;
    void erase(const std::string& server, const std::string& dsn);
    void clear();

private:
    mutable std::mutex mutex_;
    std::unordered_map<std::string, std::string> tickets_;  // server + '\n' + lower(dsn)
    std::unordered_map<std::string, std::string> latest_;   // server
};

}  // namespace kest
