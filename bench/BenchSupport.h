// What the benchmark programs share.
//
// Every program measures one kind of work twice in the same run: through the
// store's public API ("ours") and as the same SQL statements issued with raw
// sqlite3 calls on a database of the same layout and pragmas ("floor", with
// every statement prepared once and reused). Some also run the floor with
// each statement prepared anew ("floor_prepare"), which is what the store
// does by rule, so the cost of that rule can be read off. Benchmarks are
// named "<operation>/<side>" (plus "/<size>" where a size applies) and set the
// counters "ops" (operations per iteration; scripts/bench.sh divides by it)
// and "cpu_s" (process CPU time per iteration).
//
// Threads: everything here is used from the benchmark's thread, except the
// transport and the callback counter, which the store's worker also calls.
// Failures throw std::runtime_error; a benchmark turns them into
// SkipWithError.
#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include <benchmark/benchmark.h>

#include "tessarine/Collection.h"
#include "tessarine/SyncProtocol.h"
#include "tessarine/Tessarine.h"
#include "tessarine/ThreadCreator.h"

struct sqlite3;
struct sqlite3_stmt;

namespace bench {

using lumivale::tessarine::SyncProtocol;

// The collection every benchmark works on, and its two tables.
extern const std::string kCollection;
extern const std::string kObjectTable;  // quoted, ready for SQL
extern const std::string kIndexTable;   // quoted, ready for SQL

// A fresh directory under $TMPDIR (or /tmp), removed with its content.
class ScratchDir {
public:
    ScratchDir();
    ~ScratchDir();
    ScratchDir(const ScratchDir&) = delete;
    ScratchDir& operator=(const ScratchDir&) = delete;
    std::string file(const std::string& name) const { return path + "/" + name; }

private:
    std::string path;
};

// A transport that sends nothing anywhere: it counts what the store hands it
// and keeps nothing, so that memory figures are the store's own.
class CountingTransport : public SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest& request) override;
    int sendDelta(const Delta& delta) override;
    void sendSnapshotRequest(const std::string&, const std::string&) override {}

    std::atomic<uint64_t> deltasSent{0};
    std::atomic<uint64_t> bytesSent{0};
    std::atomic<uint64_t> subscriptionsSent{0};
};

// Counts the deltas the application's callback has seen, and lets the
// benchmark wait for a count.
class CallbackCounter {
public:
    void add(size_t count);
    uint64_t seen() const;
    // Returns false if the count is not reached within a generous deadline.
    bool waitFor(uint64_t target);

private:
    mutable std::mutex mutex;
    std::condition_variable reached;
    uint64_t count = 0;
};

// Objects are numbered. Object i has a random-looking 32-hex-digit primary key
// (as a UUID would be), a sort key that grows with i (as a timestamp would),
// and a 200-byte blob that starts with i and a generation number.
std::string primaryKey(uint64_t i);
std::string sortKey(uint64_t i);
std::vector<unsigned char> blob(uint64_t i, uint64_t generation = 0);
// A well mixed 64-bit value of i, for random picks that repeat run to run.
uint64_t mix(uint64_t i);

// The application's indexer: two fields per object, "tag" (1000 distinct
// values, so 100 objects share one in 100 000) and "rank".
using Fields = std::unordered_multimap<std::string, std::string>;
Fields indexObject(const std::string& collectionName, const std::string& primaryKey, const std::string& sortKey,
                   const std::vector<unsigned char>& blob);
std::string tagOf(uint64_t i);

// A raw connection with the store's flags and tuning pragmas.
class RawDatabase {
public:
    explicit RawDatabase(const std::string& path);
    ~RawDatabase();
    RawDatabase(const RawDatabase&) = delete;
    RawDatabase& operator=(const RawDatabase&) = delete;
    void exec(const std::string& sql);
    sqlite3* handle() const { return db; }

private:
    sqlite3* db = nullptr;
};

// One statement of the floor, used as start(), bind..., step()..., done().
// By default it is prepared once: start() does nothing and done() resets it.
// With prepareEachUse it is handled as the store handles its statements:
// start() compiles it from the text and done() finalises it.
class RawStatement {
public:
    RawStatement(RawDatabase& database, std::string sql, bool prepareEachUse = false);
    ~RawStatement();
    RawStatement(const RawStatement&) = delete;
    RawStatement& operator=(const RawStatement&) = delete;

    RawStatement& start();
    RawStatement& bind(int index, const std::string& text);
    RawStatement& bind(int index, long long value);
    RawStatement& bindBlob(int index, const unsigned char* data, size_t size);
    bool step();   // true while a row is current
    void reset();  // ready for new bindings within one use (a batch)
    void done();
    void run();    // steps to the end, then done()
    long long columnInt64(int column) const;
    std::string columnText(int column) const;
    std::pair<const unsigned char*, size_t> columnBlob(int column) const;

private:
    void prepare();
    void finalize();

    RawDatabase& database;
    std::string sql;
    bool prepareEachUse;
    sqlite3_stmt* statement = nullptr;
};

// The store's statements, each as the store writes it for kCollection.
namespace sql {
extern const char* const kBegin;
extern const char* const kCommit;
extern const std::string kIncrementVersionId;
extern const std::string kQueryVersionId;
extern const std::string kInsertDelta;
extern const std::string kSaveObject;
extern const std::string kDeleteIndexRows;
extern const std::string kSaveIndexRow;
extern const std::string kUpdateSequenceNumber;
extern const std::string kGetVersionVector;
extern const std::string kSetVersionVector;
extern const std::string kGetDeltaStatuses;
extern const std::string kQueryCollection;  // ascending
extern const std::string kGetObject;
extern const std::string kIndexSubquery;    // as the application writes it, with {0}
extern const std::string kQueryWithIndex;   // the subquery in place
extern const std::string kQueryWithIndexSorted;  // ascending
extern const std::string kGetSubscriptions;
extern const std::string kGetMetadata;
extern const std::string kGetAllDeltas;
}  // namespace sql

// A store database holding kCollection (tables, counter and subscription,
// as the store creates them), filled with objects 0 to objects - 1 (status
// PERSISTED, with their index rows) and queuedDeltas PENDING saves in the
// delta queue, all written with raw SQL in one transaction. The fill runs in a
// child process, so its large page cache counts in no benchmark's memory.
void makeStoreFile(const std::string& path, uint64_t objects, uint64_t queuedDeltas);
void copyFile(const std::string& from, const std::string& to);
// Makes such a file as "ours.db" in dir and copies it to "floor.db" and
// "floor_prepare.db", one per side. Returns true, for use in a member
// initialiser.
bool makeSideFiles(const ScratchDir& dir, uint64_t objects, uint64_t queuedDeltas);

// One store opened through the public API on an existing file, with the
// indexer, a counting callback, a started transport and a handle on
// kCollection.
struct OpenStore {
    explicit OpenStore(const std::string& path);
    ~OpenStore();

    std::shared_ptr<CountingTransport> transport = std::make_shared<CountingTransport>();
    std::shared_ptr<StdThreadCreator> threadCreator = std::make_shared<StdThreadCreator>();
    std::shared_ptr<CallbackCounter> callbacks = std::make_shared<CallbackCounter>();
    std::unique_ptr<lumivale::tessarine::Tessarine> store;
    std::unique_ptr<lumivale::tessarine::Collection> collection;
};

// Peak resident memory of this process so far, in KiB.
long peakRssKiB();

// CPU time of the whole process (the store's worker included) from
// construction on. Other work on a shared machine disturbs it far less than
// wall-clock time, so scripts/bench.sh reports ratios of both.
class CpuMeter {
public:
    CpuMeter();
    double seconds() const;

private:
    double start;
};

// Sets the counters scripts/bench.sh reads: "ops", the operations one
// iteration performs, and "cpu_s", process CPU seconds per iteration.
void report(benchmark::State& state, double opsPerIteration, const CpuMeter& cpu);

// Registers work to run after the benchmarks and before the peak memory is
// printed (closing stores, removing files).
void atTeardown(std::function<void()> work);

// A benchmark environment built on first use and destroyed at teardown, so
// that Google Benchmark's repeated calls of a benchmark share one setup.
template <typename T>
T& lazily(std::unique_ptr<T>& slot) {
    if (!slot) {
        slot = std::make_unique<T>();
        atTeardown([&slot] { slot.reset(); });
    }
    return *slot;
}

// Registers a benchmark measured in wall-clock time (the store's work is
// partly on its worker thread) and reported in microseconds.
benchmark::internal::Benchmark* add(const std::string& name, std::function<void(benchmark::State&)> body);

// main() of every program: runs the selected benchmarks, tears down, then
// prints "peak resident memory: <n> KiB".
int runMain(int argc, char** argv);

}  // namespace bench
