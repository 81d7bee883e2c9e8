// Internal to the SQLite access layer: the compiled statements of one
// connection that nobody holds, kept for reuse and keyed by their SQL text,
// so that an operation the store runs again and again is compiled once.
//
// A statement is in the cache only while idle: take removes it, so a
// statement in use (an open cursor's) is never handed out twice, and a second
// user of the same SQL gets a fresh one. give resets a statement and clears
// its bindings before keeping it; past kMaxIdleStatements the statements of
// the least recently used SQL text are finalised. Statements prepared with
// sqlite3_prepare_v2 recompile themselves after a schema change, so a cached
// one stays correct when tables are added.
//
// Not thread-safe: the owner (Connection) calls it only under its mutex.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

struct sqlite3_stmt;

namespace lumivale {
namespace sqlite {

class StatementCache {
public:
    static constexpr std::size_t kMaxIdleStatements = 128;

    StatementCache() = default;
    ~StatementCache() { clear(); }
    StatementCache(const StatementCache&) = delete;
    StatementCache& operator=(const StatementCache&) = delete;

    // Finalises every idle statement; the connection calls it before closing.
    void clear() noexcept;
    // An idle statement compiled from exactly sql, or nullptr.
    sqlite3_stmt* take(const std::string& sql);
    // Takes back a statement that is no longer used. Never throws: a
    // statement that cannot be kept is finalised.
    void give(sqlite3_stmt* statement) noexcept;

private:
    struct Entry {
        std::string sql;
        std::vector<sqlite3_stmt*> idle;
        uint64_t lastUse = 0;
    };

    void evictLeastRecentlyUsed();

    // Keyed by a view of the entry's own text, so that give looks SQLite's
    // copy of the text up without building a string. SQL texts share long
    // prefixes, which makes a hash cheaper than an ordered compare.
    std::unordered_map<std::string_view, std::unique_ptr<Entry>> entries;
    std::size_t idleCount = 0;
    uint64_t useClock = 0;
};

}  // namespace sqlite
}  // namespace lumivale
