// A thin RAII layer over libpq for the server's PostgreSQL storage and its
// collection leases: PgResult owns one PGresult, PgConnection one PGconn,
// PgTransaction one BEGIN ... COMMIT that rolls back unless committed.
//
// PgConnection reconnects by itself: an operation on a connection that was
// lost (the server restarted, the network went) first connects again,
// waiting between failed attempts from kMinRetryDelay doubling up to
// kMaxRetryDelay; while it waits, operations throw at once instead of
// blocking. It logs each loss and each recovery once (tag
// "tessarine_server"), so that an operator sees an outage and its end.
//
// Parameters are sent as text, except bytes (Param::bytes), which go as
// binary; results come back as text, except columns read with bytes().
//
// Errors: PgError (a std::runtime_error with libpq's message and the
// SQLSTATE code, empty when the connection failed). A statement that fails
// inside a transaction aborts it; the PgTransaction then rolls back.
//
// Threads: one thread at a time; each thread that talks to the database
// (the rules' thread, the lease keeper) has a connection of its own.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

struct pg_conn;
struct pg_result;

namespace lumivale {
namespace tessarine {
namespace server {

class PgError : public std::runtime_error {
public:
    PgError(const std::string& message, std::string sqlState)
        : std::runtime_error(message), state(std::move(sqlState)) {}
    // "23505" for a unique violation; empty when there was no server answer.
    const std::string& sqlState() const { return state; }

private:
    std::string state;
};

inline constexpr char kUniqueViolation[] = "23505";

class PgResult {
public:
    explicit PgResult(pg_result* owned) : result(owned, &release) {}

    // The statement ran (whether or not it returned rows).
    bool succeeded() const;
    // The SQLSTATE of a failure; empty without one.
    std::string sqlState() const;
    int rows() const;
    int columns() const;
    bool isNull(int row, int column) const;
    std::string text(int row, int column) const;
    int64_t integer(int row, int column) const;
    std::vector<unsigned char> bytes(int row, int column) const;

private:
    static void release(pg_result* result);
    std::unique_ptr<pg_result, void (*)(pg_result*)> result;
};

class PgConnection {
public:
    // A statement parameter: text, or bytes sent as binary.
    struct Param {
        Param(std::string text) : value(std::move(text)) {}
        Param(const char* text) : value(text) {}
        Param(int64_t number) : value(std::to_string(number)) {}
        static Param bytes(const std::vector<unsigned char>& data) {
            Param param(std::string(data.begin(), data.end()));
            param.binary = true;
            return param;
        }
        std::string value;
        bool binary = false;
    };

    static constexpr std::chrono::milliseconds kMinRetryDelay{100};
    static constexpr std::chrono::milliseconds kMaxRetryDelay{1000};

    // Connects now; when the database cannot be reached (logged), the first
    // operation tries again.
    explicit PgConnection(std::string conninfo);
    ~PgConnection();
    PgConnection(const PgConnection&) = delete;
    PgConnection& operator=(const PgConnection&) = delete;

    // Runs one statement; throws PgError when it fails.
    PgResult exec(const std::string& sql, const std::vector<Param>& params = {});

private:
    void ensureConnected();
    void connect();
    void lost(const std::string& why);

    const std::string conninfo;
    pg_conn* connection = nullptr;
    bool inOutage = false;
    std::chrono::milliseconds retryDelay = kMinRetryDelay;
    std::chrono::steady_clock::time_point nextAttempt;
};

// BEGIN (with the given isolation level) now; ROLLBACK when destroyed
// uncommitted (errors then are ignored: a lost connection rolled back anyway).
class PgTransaction {
public:
    explicit PgTransaction(PgConnection& connection, const char* isolation = "READ COMMITTED");
    ~PgTransaction();
    PgTransaction(const PgTransaction&) = delete;
    PgTransaction& operator=(const PgTransaction&) = delete;

    void commit();

private:
    PgConnection& connection;
    bool done = false;
};

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
