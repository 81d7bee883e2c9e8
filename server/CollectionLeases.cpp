#include "server/CollectionLeases.h"

#include <algorithm>

#include "platform/Log.h"
#include "server/ServerLog.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

// A PostgreSQL text[] literal: {"a","b"}, quotes and backslashes escaped.
std::string arrayLiteral(const std::vector<std::string>& values) {
    std::string literal = "{";
    for (const std::string& value : values) {
        if (literal.size() > 1) literal += ",";
        literal += "\"";
        for (char c : value) {
            if (c == '"' || c == '\\') literal += '\\';
            literal += c;
        }
        literal += "\"";
    }
    return literal + "}";
}

std::set<std::string> collectionsOf(const PgResult& result) {
    std::set<std::string> collections;
    for (int row = 0; row < result.rows(); ++row) collections.insert(result.text(row, 0));
    return collections;
}

}  // namespace

CollectionLeases::CollectionLeases(const std::string& conninfo, std::string id, Timings theTimings,
                                   Handlers theHandlers)
    : connection(conninfo), instanceId(std::move(id)), timings(theTimings), handlers(std::move(theHandlers)) {}

CollectionLeases::~CollectionLeases() { stop(); }

void CollectionLeases::start() {
    std::lock_guard<std::mutex> lock(mutex);
    stopping = false;
    if (!keeper.joinable()) keeper = std::thread([this] { run(); });
}

void CollectionLeases::stop() {
    {
        std::lock_guard<std::mutex> lock(mutex);
        stopping = true;
    }
    wake.notify_all();
    if (!keeper.joinable()) return;
    keeper.join();
    {
        std::lock_guard<std::mutex> lock(mutex);
        held.clear();
    }
    release();
}

uint64_t CollectionLeases::epoch(const std::string& collection) {
    std::lock_guard<std::mutex> lock(mutex);
    auto found = held.find(collection);
    if (found == held.end()) return 0;
    if (std::chrono::steady_clock::now() < found->second.validUntil) return found->second.epoch;
    // Lapsed before its renewal came back (the database slow, say). What is
    // refused from now on reaches no instance, so whatever serves the
    // collection next, this instance included, must start afresh: a renewal
    // still under way makes it a new lease.
    lv_printLog(LogPriority::kInfo, kServerLogTag, "CollectionLeases: %s no longer serves \"%s\": not renewed in time",
                instanceId.c_str(), collection.c_str());
    held.erase(found);
    return 0;
}

void CollectionLeases::noticed(const std::string& collection) {
    bool isNew = false;
    {
        std::lock_guard<std::mutex> lock(mutex);
        if (held.count(collection) == 0) isNew = waitingRounds.emplace(collection, 0).second;
    }
    if (isNew) wake.notify_all();
}

void CollectionLeases::run() {
    std::unique_lock<std::mutex> lock(mutex);
    while (!stopping) {
        auto roundStart = std::chrono::steady_clock::now();
        lock.unlock();
        round();
        lock.lock();
        // A newly noticed collection (no round waited) starts a round early.
        wake.wait_until(lock, roundStart + timings.renewPeriod, [&] {
            return stopping || std::any_of(waitingRounds.begin(), waitingRounds.end(),
                                           [](const auto& entry) { return entry.second == 0; });
        });
    }
}

void CollectionLeases::round() {
    auto roundStart = std::chrono::steady_clock::now();
    if (handlers.mayRenew && !handlers.mayRenew()) {
        // Not renewed: the leases lapse by themselves. Nothing is tried
        // either, so the noticed collections are not retried at once.
        std::lock_guard<std::mutex> lock(mutex);
        for (auto& entry : waitingRounds) entry.second = std::max(entry.second, 1);
        return;
    }
    bool acquired = false;
    try {
        std::set<std::string> nowHeld;
        int64_t liveInstances = renew(nowHeld);
        std::set<std::string> taken = take(candidates(liveInstances, servedElsewhere()));
        nowHeld.insert(taken.begin(), taken.end());
        acquired = settle(nowHeld, roundStart);
        if (std::optional<std::string> surplus = surplusOf(liveInstances)) handOver(*surplus);
    } catch (const PgError& e) {
        if (!failing) {
            lv_printLog(LogPriority::kWarn, kServerLogTag,
                        "CollectionLeases: %s cannot renew its leases (%s); they lapse until the database is back",
                        instanceId.c_str(), e.what());
        }
        failing = true;
        std::lock_guard<std::mutex> lock(mutex);
        for (auto& entry : waitingRounds) entry.second = std::max(entry.second, 1);
        return;
    }
    if (failing)
        lv_printLog(LogPriority::kInfo, kServerLogTag, "CollectionLeases: %s renews its leases again",
                    instanceId.c_str());
    failing = false;
    if (handlers.afterRound) handlers.afterRound(acquired);
}

int64_t CollectionLeases::renew(std::set<std::string>& renewed) {
    const int64_t durationMs = timings.duration.count();
    PgTransaction transaction(connection);
    // A renewal lost in a database crash only makes the lease look older,
    // which is safe (the log's writes check the lease themselves): renewals
    // need not wait for the disk, which may be slow under load.
    connection.exec("SET LOCAL synchronous_commit = off");
    renewed = collectionsOf(connection.exec(
        "UPDATE tessarine_leases SET expires_at = now() + $2::bigint * interval '1 millisecond'"
        " WHERE holder = $1 AND expires_at > now() RETURNING collection",
        {instanceId, durationMs}));
    connection.exec(
        "INSERT INTO tessarine_instances (instance, expires_at)"
        " VALUES ($1, now() + $2::bigint * interval '1 millisecond')"
        " ON CONFLICT (instance) DO UPDATE SET expires_at = EXCLUDED.expires_at",
        {instanceId, durationMs});
    int64_t live = connection.exec("SELECT COUNT(*) FROM tessarine_instances WHERE expires_at > now()").integer(0, 0);
    transaction.commit();
    return live;
}

std::set<std::string> CollectionLeases::take(const std::vector<std::string>& collections) {
    if (collections.empty()) return {};
    const std::string names = arrayLiteral(collections);
    const int64_t durationMs = timings.duration.count();
    // Leases never taken: new rows, in one order so that instances inserting
    // the same names wait for each other rather than deadlock.
    std::set<std::string> taken = collectionsOf(connection.exec(
        "INSERT INTO tessarine_leases (collection, holder, expires_at)"
        " SELECT name, $2, now() + $3::bigint * interval '1 millisecond'"
        " FROM unnest($1::text[]) AS name ORDER BY name ON CONFLICT (collection) DO NOTHING RETURNING collection",
        {names, instanceId, durationMs}));
    // Expired leases (or this instance's own). Rows locked elsewhere (a
    // commit of the holder in progress, another instance taking them) are
    // skipped for this round rather than waited for: waiting would hold this
    // round up and could close a cycle of waits with other instances.
    std::set<std::string> expired = collectionsOf(connection.exec(
        "UPDATE tessarine_leases SET holder = $2, expires_at = now() + $3::bigint * interval '1 millisecond'"
        " WHERE collection IN (SELECT collection FROM tessarine_leases WHERE collection = ANY($1::text[])"
        " AND (expires_at <= now() OR holder = $2) ORDER BY collection FOR UPDATE SKIP LOCKED)"
        " RETURNING collection",
        {names, instanceId, durationMs}));
    taken.insert(expired.begin(), expired.end());
    return taken;
}

std::set<std::string> CollectionLeases::servedElsewhere() {
    std::vector<std::string> waiting;
    {
        std::lock_guard<std::mutex> lock(mutex);
        for (const auto& entry : waitingRounds) waiting.push_back(entry.first);
    }
    if (waiting.empty()) return {};
    return collectionsOf(connection.exec(
        "SELECT collection FROM tessarine_leases WHERE collection = ANY($1::text[]) AND expires_at > now()"
        " AND holder <> $2",
        {arrayLiteral(waiting), instanceId}));
}

std::vector<std::string> CollectionLeases::candidates(int64_t liveInstances, const std::set<std::string>& served) {
    std::lock_guard<std::mutex> lock(mutex);
    int64_t room = shareOf(liveInstances) - static_cast<int64_t>(held.size());
    std::vector<std::string> free;
    std::vector<std::string> overdue;
    for (auto& [name, rounds] : waitingRounds) {
        if (served.count(name) != 0) {
            rounds = 1;  // served: nothing to do, and no longer new
            continue;
        }
        (rounds >= kMaxWaitRounds ? overdue : free).push_back(name);
        ++rounds;
    }
    std::shuffle(free.begin(), free.end(), random);
    free.resize(static_cast<size_t>(std::clamp<int64_t>(room, 0, static_cast<int64_t>(free.size()))));
    free.insert(free.end(), overdue.begin(), overdue.end());
    return free;
}

// The share of an instance: the collections it knows of over the live
// instances, rounded up.
int64_t CollectionLeases::shareOf(int64_t liveInstances) const {
    int64_t known = static_cast<int64_t>(held.size() + waitingRounds.size());
    return (known + liveInstances - 1) / std::max<int64_t>(liveInstances, 1);
}

std::optional<std::string> CollectionLeases::surplusOf(int64_t liveInstances) {
    std::lock_guard<std::mutex> lock(mutex);
    if (static_cast<int64_t>(held.size()) <= shareOf(liveInstances)) return std::nullopt;
    auto chosen = std::next(held.begin(), std::uniform_int_distribution<size_t>(0, held.size() - 1)(random));
    std::string name = chosen->first;
    held.erase(chosen);
    // Not retried before the others had a round to take it.
    waitingRounds[name] = 1;
    return name;
}

void CollectionLeases::handOver(const std::string& collection) {
    lv_printLog(LogPriority::kInfo, kServerLogTag,
                "CollectionLeases: %s hands \"%s\" over: it serves more than its share", instanceId.c_str(),
                collection.c_str());
    connection.exec("UPDATE tessarine_leases SET expires_at = now() WHERE collection = $1 AND holder = $2",
                    {collection, instanceId});
}

bool CollectionLeases::settle(const std::set<std::string>& nowHeld, std::chrono::steady_clock::time_point roundStart) {
    std::lock_guard<std::mutex> lock(mutex);
    auto validUntil = roundStart + timings.duration - timings.renewPeriod;
    bool acquired = false;
    // A lease that lapsed here is a new one even if this instance got it
    // back: the collection may have been served elsewhere meanwhile.
    for (auto entry = held.begin(); entry != held.end();) {
        bool keep = nowHeld.count(entry->first) != 0 && roundStart < entry->second.validUntil;
        if (!keep) {
            lv_printLog(LogPriority::kInfo, kServerLogTag, "CollectionLeases: %s no longer serves \"%s\"",
                        instanceId.c_str(), entry->first.c_str());
            waitingRounds.emplace(entry->first, kMaxWaitRounds);
        }
        entry = keep ? std::next(entry) : held.erase(entry);
    }
    for (const std::string& name : nowHeld) {
        auto [entry, isNew] = held.emplace(name, Held{0, validUntil});
        entry->second.validUntil = validUntil;
        if (!isNew) continue;
        entry->second.epoch = ++lastEpoch;
        waitingRounds.erase(name);
        acquired = true;
        lv_printLog(LogPriority::kInfo, kServerLogTag, "CollectionLeases: %s serves \"%s\"", instanceId.c_str(),
                    name.c_str());
    }
    return acquired;
}

void CollectionLeases::release() {
    try {
        connection.exec("UPDATE tessarine_leases SET expires_at = now() WHERE holder = $1", {instanceId});
        connection.exec("DELETE FROM tessarine_instances WHERE instance = $1", {instanceId});
    } catch (const PgError& e) {
        lv_printLog(LogPriority::kWarn, kServerLogTag, "CollectionLeases: %s could not end its leases (%s); they lapse",
                    instanceId.c_str(), e.what());
    }
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
