#include "service/TicketCache.h"

#include <cctype>

namespace kest {

namespace {

std::string cacheKey(const std::string& server, const std::string& dsn) {
    std::string key = server;
    key += '\n';
    for (char c : dsn)
        key += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return key;
}

}  // namespace

TicketCache& TicketCache::instance() {
    static TicketCache cache;
    return cache;
}

void TicketCache::put(const std::string& server, const std::string& dsn,
                      const std::string& ticket) {
    std::lock_guard lock(mutex_);
    tickets_[cacheKey(server, dsn)] = ticket;
    latest_[server] = ticket;
}

std::optional<std::string> TicketCache::get(const std::string& server,
                                            const std::string& dsn) const {
    std::lock_guard lock(mutex_);
    auto it = tickets_.find(cacheKey(server, dsn));
    if (it == tickets_.end())
        return std::nullopt;
    return it->second;
}

std::optional<std::string> TicketCache::latest(const std::string& server) const {
    std::lock_guard lock(mutex_);
    auto it = latest_.find(server);
    if (it == latest_.end())
        return std::nullopt;
    return it->second;
}

void TicketCache::erase(const std::string& server, const std::string& dsn) {
    std::lock_guard lock(mutex_);
    auto it = tickets_.find(cacheKey(server, dsn));
    if (it == tickets_.end())
        return;
    // A forgotten session must not live on as the server's latest one.
    auto last = latest_.find(server);
    if (last != latest_.end() && last->second == it->second)
        latest_.erase(last);
    tickets_.erase(it);
}

void TicketCache::clear() {
    std::lock_guard lock(mutex_);
    tickets_.clear();
    latest_.clear();
}

}  // namespace kest
