#include "sqlite/StatementCache.h"

#include <sqlite3.h>

#include <exception>
#include <string_view>

namespace lumivale {
namespace sqlite {

void StatementCache::clear() noexcept {
    for (auto& [sql, entry] : entries) {
        for (sqlite3_stmt* statement : entry->idle) sqlite3_finalize(statement);
    }
    entries.clear();
    idleCount = 0;
}

sqlite3_stmt* StatementCache::take(const std::string& sql) {
    auto found = entries.find(std::string_view(sql));
    if (found == entries.end() || found->second->idle.empty()) return nullptr;
    Entry& entry = *found->second;
    sqlite3_stmt* statement = entry.idle.back();
    entry.idle.pop_back();
    entry.lastUse = ++useClock;
    --idleCount;
    return statement;
}

void StatementCache::give(sqlite3_stmt* statement) noexcept {
    // The result repeats the last step's error, which its user has seen.
    sqlite3_reset(statement);
    // Bound values may be large blobs; they are not kept alive in the cache.
    sqlite3_clear_bindings(statement);
    const char* text = sqlite3_sql(statement);
    try {
        std::string_view sql(text == nullptr ? "" : text);
        auto found = entries.find(sql);
        if (found == entries.end()) {
            auto entry = std::make_unique<Entry>();
            entry->sql = sql;
            std::string_view key(entry->sql);
            found = entries.emplace(key, std::move(entry)).first;
        }
        found->second->idle.push_back(statement);
        found->second->lastUse = ++useClock;
        ++idleCount;
    } catch (const std::exception&) {
        sqlite3_finalize(statement);
        return;
    }
    if (idleCount > kMaxIdleStatements) evictLeastRecentlyUsed();
}

void StatementCache::evictLeastRecentlyUsed() {
    auto oldest = entries.end();
    for (auto it = entries.begin(); it != entries.end();) {
        if (it->second->idle.empty()) {
            it = entries.erase(it);  // its statements are all in use; it comes back when one is given
            continue;
        }
        if (oldest == entries.end() || it->second->lastUse < oldest->second->lastUse) oldest = it;
        ++it;
    }
    if (oldest == entries.end()) return;
    for (sqlite3_stmt* statement : oldest->second->idle) sqlite3_finalize(statement);
    idleCount -= oldest->second->idle.size();
    entries.erase(oldest);
}

}  // namespace sqlite
}  // namespace lumivale
