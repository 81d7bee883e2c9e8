#include "BenchSupport.h"

#include <sqlite3.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <valgrind/callgrind.h>

#include <algorithm>
#include <chrono>
#include <ctime>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <stdexcept>

#include "platform/Log.h"

namespace bench {

const std::string kCollection = "bench:Items";
const std::string kObjectTable = "\"collection_bench:Items\"";
const std::string kIndexTable = "\"collection_index_bench:Items\"";

namespace sql {
const char* const kBegin = "BEGIN IMMEDIATE";
const char* const kCommit = "COMMIT";
const std::string kIncrementVersionId =
    "UPDATE collection_version_ids SET version_id = version_id + 1 WHERE collection_name = ?";
const std::string kQueryVersionId = "SELECT version_id FROM collection_version_ids WHERE collection_name = ?";
const std::string kInsertDelta =
    "INSERT INTO delta_queue (collection_name, version_id, type, primary_key, sort_key, blob, status) "
    "VALUES (?, ?, ?, ?, ?, ?, ?)";
const std::string kSaveObject =
    "INSERT OR REPLACE INTO " + kObjectTable + " (primary_key, sort_key, blob, status) VALUES (?, ?, ?, ?)";
const std::string kDeleteIndexRows = "DELETE FROM " + kIndexTable + " WHERE primary_key = ?";
const std::string kSaveIndexRow =
    "INSERT OR REPLACE INTO " + kIndexTable + " (primary_key, field_name, field_value) VALUES (?, ?, ?)";
const std::string kUpdateSequenceNumber = "UPDATE subscriptions SET seq_num = ? WHERE collection_name = ?";
const std::string kGetVersionVector =
    "SELECT version_id FROM collection_version_vectors WHERE collection_name = ? AND client_id = ?";
const std::string kSetVersionVector =
    "INSERT OR REPLACE INTO collection_version_vectors (collection_name, client_id, version_id) VALUES (?, ?, ?)";
const std::string kGetDeltaStatuses =
    "SELECT status FROM delta_queue WHERE  collection_name = ? AND   primary_key = ?";
const std::string kQueryCollection = "SELECT primary_key, sort_key, blob, status FROM " + kObjectTable +
                                     " WHERE sort_key >= ? ORDER BY sort_key ASC LIMIT ?";
const std::string kGetObject = "SELECT primary_key, sort_key, blob, status FROM " + kObjectTable +
                               " WHERE primary_key = ?";
const std::string kIndexSubquery = "SELECT primary_key FROM {0} WHERE field_name = ? AND field_value = ?";
static const std::string kSubqueryInPlace =
    "SELECT primary_key FROM " + kIndexTable + " WHERE field_name = ? AND field_value = ?";
const std::string kQueryWithIndex = "SELECT primary_key, sort_key, blob, status FROM " + kObjectTable +
                                    " WHERE primary_key IN (" + kSubqueryInPlace + ") LIMIT ?";
const std::string kQueryWithIndexSorted =
    "SELECT obj.primary_key, obj.sort_key, obj.blob, obj.status FROM " + kObjectTable + " obj LEFT OUTER JOIN " +
    kIndexTable + " idx   ON obj.primary_key = idx.primary_key AND idx.field_name = ? WHERE obj.primary_key IN (" +
    kSubqueryInPlace + ") ORDER BY idx.field_value ASC LIMIT ?";
const std::string kGetSubscriptions = "SELECT collection_name, seq_num FROM subscriptions";
const std::string kGetMetadata = "SELECT value FROM library_metadata WHERE  key = ?";
const std::string kGetAllDeltas =
    "SELECT  collection_name,  version_id,  type,  primary_key,  sort_key,  blob,  status FROM delta_queue "
    "ORDER BY id ASC";
}  // namespace sql

// --- scratch files -------------------------------------------------------

ScratchDir::ScratchDir() {
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base && *base ? base : "/tmp") + "/tessarine-bench-XXXXXX";
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (mkdtemp(buffer.data()) == nullptr) throw std::runtime_error("cannot create a scratch directory");
    path = buffer.data();
}

ScratchDir::~ScratchDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
}

void copyFile(const std::string& from, const std::string& to) {
    std::filesystem::copy_file(from, to, std::filesystem::copy_options::overwrite_existing);
}

// --- transport and callbacks ---------------------------------------------

void CountingTransport::sendSubscriptionRequest(const SubscriptionRequest&) { ++subscriptionsSent; }

int CountingTransport::sendDelta(const Delta& delta) {
    bytesSent += delta.blob.size();
    return static_cast<int>(++deltasSent);
}

void CallbackCounter::add(size_t added) {
    {
        std::lock_guard<std::mutex> lock(mutex);
        count += added;
    }
    reached.notify_all();
}

uint64_t CallbackCounter::seen() const {
    std::lock_guard<std::mutex> lock(mutex);
    return count;
}

bool CallbackCounter::waitFor(uint64_t target) {
    std::unique_lock<std::mutex> lock(mutex);
    return reached.wait_for(lock, std::chrono::minutes(2), [&] { return count >= target; });
}

// --- objects ---------------------------------------------------------------

uint64_t mix(uint64_t i) {
    // splitmix64: consecutive numbers give unrelated values.
    uint64_t z = i + 0x9E3779B97F4A7C15ull;
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ull;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBull;
    return z ^ (z >> 31);
}

std::string primaryKey(uint64_t i) {
    char text[33];
    std::snprintf(text, sizeof text, "%016llX%016llX", static_cast<unsigned long long>(mix(i)),
                  static_cast<unsigned long long>(mix(~i)));
    return text;
}

std::string sortKey(uint64_t i) {
    char text[24];
    std::snprintf(text, sizeof text, "%014llu", static_cast<unsigned long long>(i));
    return text;
}

std::vector<unsigned char> blob(uint64_t i, uint64_t generation) {
    std::vector<unsigned char> bytes(200);
    std::memcpy(bytes.data(), &i, sizeof i);
    std::memcpy(bytes.data() + sizeof i, &generation, sizeof generation);
    uint64_t filler = mix(i ^ generation);
    for (size_t k = 2 * sizeof i; k < bytes.size(); ++k) bytes[k] = static_cast<unsigned char>(filler >> (k % 8 * 8));
    return bytes;
}

std::string tagOf(uint64_t i) { return "t" + std::to_string(i % 1000); }

Fields indexObject(const std::string&, const std::string&, const std::string&,
                   const std::vector<unsigned char>& bytes) {
    uint64_t i = 0;
    if (bytes.size() >= sizeof i) std::memcpy(&i, bytes.data(), sizeof i);
    char rank[24];
    std::snprintf(rank, sizeof rank, "%010llu", static_cast<unsigned long long>(mix(i) % 10000000000ull));
    Fields fields;
    fields.emplace("tag", tagOf(i));
    fields.emplace("rank", rank);
    return fields;
}

// --- raw SQLite --------------------------------------------------------------

RawDatabase::RawDatabase(const std::string& path) {
    // The store's flags: read-write, create, and no SQLite mutex (the store
    // serialises calls itself).
    int rc = sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                             nullptr);
    if (rc != SQLITE_OK) {
        sqlite3_close(db);
        throw std::runtime_error("cannot open " + path);
    }
    exec("PRAGMA temp_store=MEMORY");
    exec("PRAGMA journal_mode=WAL");
    exec("PRAGMA synchronous=NORMAL");
    exec("PRAGMA busy_timeout=1000");
}

RawDatabase::~RawDatabase() { sqlite3_close_v2(db); }

void RawDatabase::exec(const std::string& text) {
    char* error = nullptr;
    if (sqlite3_exec(db, text.c_str(), nullptr, nullptr, &error) != SQLITE_OK) {
        std::string message = error ? error : "unknown error";
        sqlite3_free(error);
        throw std::runtime_error(message + " in: " + text);
    }
}

RawStatement::RawStatement(RawDatabase& theDatabase, std::string text, bool thePrepareEachUse)
    : database(theDatabase), sql(std::move(text)), prepareEachUse(thePrepareEachUse) {
    if (!thePrepareEachUse) prepare();
}

RawStatement::~RawStatement() { finalize(); }

void RawStatement::prepare() {
    if (sqlite3_prepare_v2(database.handle(), sql.c_str(), static_cast<int>(sql.size()), &statement, nullptr) !=
        SQLITE_OK) {
        throw std::runtime_error(std::string(sqlite3_errmsg(database.handle())) + " in: " + sql);
    }
}

void RawStatement::finalize() {
    sqlite3_finalize(statement);
    statement = nullptr;
}

RawStatement& RawStatement::start() {
    if (prepareEachUse) prepare();
    return *this;
}

void RawStatement::reset() { sqlite3_reset(statement); }

void RawStatement::done() {
    if (prepareEachUse) {
        finalize();
    } else {
        sqlite3_reset(statement);
    }
}

RawStatement& RawStatement::bind(int index, const std::string& text) {
    sqlite3_bind_text64(statement, index, text.data(), text.size(), SQLITE_TRANSIENT, SQLITE_UTF8);
    return *this;
}

RawStatement& RawStatement::bind(int index, long long value) {
    sqlite3_bind_int64(statement, index, value);
    return *this;
}

RawStatement& RawStatement::bindBlob(int index, const unsigned char* data, size_t size) {
    sqlite3_bind_blob64(statement, index, data, size, SQLITE_TRANSIENT);
    return *this;
}

bool RawStatement::step() {
    int rc = sqlite3_step(statement);
    if (rc == SQLITE_ROW) return true;
    if (rc == SQLITE_DONE) return false;
    throw std::runtime_error(std::string(sqlite3_errmsg(database.handle())) + " in: " + sql);
}

void RawStatement::run() {
    while (step()) {
    }
    done();
}

long long RawStatement::columnInt64(int column) const { return sqlite3_column_int64(statement, column); }

std::string RawStatement::columnText(int column) const {
    const unsigned char* text = sqlite3_column_text(statement, column);
    if (text == nullptr) return std::string();
    return std::string(reinterpret_cast<const char*>(text), static_cast<size_t>(sqlite3_column_bytes(statement, column)));
}

std::pair<const unsigned char*, size_t> RawStatement::columnBlob(int column) const {
    const void* data = sqlite3_column_blob(statement, column);
    return {static_cast<const unsigned char*>(data), static_cast<size_t>(sqlite3_column_bytes(statement, column))};
}

// --- store files -------------------------------------------------------------

namespace {

void fill(const std::string& path, uint64_t objects, uint64_t queuedDeltas) {
    RawDatabase database(path);
    // A page cache that holds the whole file keeps a million random index
    // insertions fast; it lives only in the filling process.
    database.exec("PRAGMA cache_size=-2000000");
    database.exec(sql::kBegin);
    RawStatement saveObject(database, sql::kSaveObject);
    RawStatement saveIndexRow(database, sql::kSaveIndexRow);
    for (uint64_t i = 0; i < objects; ++i) {
        std::string key = primaryKey(i);
        std::string sort = sortKey(i);
        std::vector<unsigned char> bytes = blob(i);
        saveObject.start().bind(1, key).bind(2, sort).bindBlob(3, bytes.data(), bytes.size()).bind(4, 3LL).run();
        for (const auto& field : indexObject(kCollection, key, sort, bytes)) {
            saveIndexRow.start().bind(1, key).bind(2, field.first).bind(3, field.second).run();
        }
    }
    RawStatement insertDelta(database, sql::kInsertDelta);
    for (uint64_t v = 1; v <= queuedDeltas; ++v) {
        uint64_t i = objects + v;
        std::vector<unsigned char> bytes = blob(i);
        insertDelta.start()
            .bind(1, kCollection)
            .bind(2, static_cast<long long>(v))
            .bind(3, 1LL)
            .bind(4, primaryKey(i))
            .bind(5, sortKey(i))
            .bindBlob(6, bytes.data(), bytes.size())
            .bind(7, 1LL)
            .run();
    }
    RawStatement setVersion(database, "UPDATE collection_version_ids SET version_id = ? WHERE collection_name = ?");
    setVersion.start().bind(1, static_cast<long long>(queuedDeltas)).bind(2, kCollection).run();
    database.exec(sql::kCommit);
    database.exec("PRAGMA wal_checkpoint(TRUNCATE)");
}

}  // namespace

void makeStoreFile(const std::string& path, uint64_t objects, uint64_t queuedDeltas) {
    {
        // The store itself lays out its tables, client id and subscription.
        OpenStore store(path);
    }
    if (objects == 0 && queuedDeltas == 0) return;
    std::fflush(nullptr);
    pid_t child = fork();
    if (child < 0) throw std::runtime_error("fork failed");
    if (child == 0) {
        int status = 0;
        try {
            fill(path, objects, queuedDeltas);
        } catch (const std::exception& e) {
            std::fprintf(stderr, "fill failed: %s\n", e.what());
            status = 1;
        }
        std::fflush(nullptr);
        _exit(status);
    }
    int status = 0;
    if (waitpid(child, &status, 0) != child || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        throw std::runtime_error("filling " + path + " failed");
    }
}

bool makeSideFiles(const ScratchDir& dir, uint64_t objects, uint64_t queuedDeltas) {
    makeStoreFile(dir.file("ours.db"), objects, queuedDeltas);
    copyFile(dir.file("ours.db"), dir.file("floor.db"));
    copyFile(dir.file("ours.db"), dir.file("floor_prepare.db"));
    return true;
}

OpenStore::OpenStore(const std::string& path)
    : store(lumivale::tessarine::Tessarine::open(path, transport, threadCreator)) {
    if (!store) throw std::runtime_error("cannot open a store at " + path);
    std::shared_ptr<CallbackCounter> counter = callbacks;
    store->addDeltaReceivedCallback(
        [counter](const std::vector<lumivale::tessarine::Delta>& deltas) { counter->add(deltas.size()); });
    store->setCollectionIndexerFunction(indexObject);
    store->start();
    collection = store->subscribeCollection(kCollection);
    if (!collection) throw std::runtime_error("cannot open the collection");
}

OpenStore::~OpenStore() {
    collection.reset();
    store.reset();
}

// --- running -------------------------------------------------------------------

long peakRssKiB() {
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_maxrss;  // KiB on Linux
}

namespace {
double processCpuSeconds() {
    timespec now{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}
}  // namespace

// Under callgrind (scripts/bench.sh starts it with collection off) the
// instructions of the measured loop are counted, from here to report().
CpuMeter::CpuMeter() : start(processCpuSeconds()) { CALLGRIND_TOGGLE_COLLECT; }

double CpuMeter::seconds() const { return processCpuSeconds() - start; }

void report(benchmark::State& state, double opsPerIteration, const CpuMeter& cpu) {
    CALLGRIND_TOGGLE_COLLECT;
    double iterations = static_cast<double>(std::max<benchmark::IterationCount>(state.iterations(), 1));
    state.counters["ops"] = opsPerIteration;
    state.counters["cpu_s"] = cpu.seconds() / iterations;
}

namespace {
std::vector<std::function<void()>>& teardowns() {
    static std::vector<std::function<void()>> work;
    return work;
}
}  // namespace

void atTeardown(std::function<void()> work) { teardowns().push_back(std::move(work)); }

benchmark::internal::Benchmark* add(const std::string& name, std::function<void(benchmark::State&)> body) {
    auto* registered = benchmark::RegisterBenchmark(name.c_str(), [body](benchmark::State& state) {
                           try {
                               body(state);
                           } catch (const std::exception& e) {
                               state.SkipWithError(e.what());
                           }
                       })
                           ->UseRealTime()
                           ->Unit(benchmark::kMicrosecond);
    // A count of instructions is only read right when the measured loop ran
    // once, with a known number of iterations; benchmarks that fix their own
    // count override this.
    if (const char* iterations = std::getenv("TESSARINE_BENCH_ITERATIONS")) {
        registered->Iterations(std::atoll(iterations));
    }
    return registered;
}

int runMain(int argc, char** argv) {
    // Progress notes of the store (one per resend) would only add noise;
    // warnings and errors still reach standard error.
    lumivale::setLogSink([](int priority, const std::string& tag, const std::string& message) {
        if (priority >= 5) std::fprintf(stderr, "%d/%s: %s\n", priority, tag.c_str(), message.c_str());
    });
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    for (auto it = teardowns().rbegin(); it != teardowns().rend(); ++it) (*it)();
    teardowns().clear();
    std::printf("peak resident memory: %ld KiB\n", peakRssKiB());
    return 0;
}

}  // namespace bench
