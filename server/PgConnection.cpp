#include "server/PgConnection.h"

#include <libpq-fe.h>

#include <algorithm>

#include "platform/Log.h"
#include "server/ServerLog.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

constexpr int kTextFormat = 0;
constexpr int kBinaryFormat = 1;

// libpq's messages span lines (a tab before each continuation) and end
// with a newline; log lines and exceptions are one line.
std::string oneLine(const char* message) {
    std::string text;
    for (const char* c = message == nullptr ? "" : message; *c != '\0'; ++c) {
        bool blank = *c == '\n' || *c == '\t' || *c == ' ';
        if (!blank) text += *c;
        else if (!text.empty() && text.back() != ' ') text += ' ';
    }
    while (!text.empty() && text.back() == ' ') text.pop_back();
    return text;
}

}  // namespace

void PgResult::release(pg_result* result) { PQclear(result); }

bool PgResult::succeeded() const {
    ExecStatusType status = PQresultStatus(result.get());
    return status == PGRES_COMMAND_OK || status == PGRES_TUPLES_OK;
}

std::string PgResult::sqlState() const {
    const char* state = PQresultErrorField(result.get(), PG_DIAG_SQLSTATE);
    return state == nullptr ? "" : state;
}

int PgResult::rows() const { return PQntuples(result.get()); }

int PgResult::columns() const { return PQnfields(result.get()); }

bool PgResult::isNull(int row, int column) const { return PQgetisnull(result.get(), row, column) != 0; }

std::string PgResult::text(int row, int column) const {
    return std::string(PQgetvalue(result.get(), row, column),
                       static_cast<size_t>(PQgetlength(result.get(), row, column)));
}

int64_t PgResult::integer(int row, int column) const { return std::stoll(text(row, column)); }

std::vector<unsigned char> PgResult::bytes(int row, int column) const {
    size_t length = 0;
    unsigned char* raw =
        PQunescapeBytea(reinterpret_cast<const unsigned char*>(PQgetvalue(result.get(), row, column)), &length);
    if (raw == nullptr) throw PgError("cannot decode a bytea column", "");
    std::vector<unsigned char> data(raw, raw + length);
    PQfreemem(raw);
    return data;
}

PgConnection::PgConnection(std::string info) : conninfo(std::move(info)) {
    try {
        connect();
    } catch (const PgError&) {
        // Logged; the first operation tries again.
    }
}

PgConnection::~PgConnection() { PQfinish(connection); }

void PgConnection::connect() {
    PQfinish(connection);
    connection = PQconnectdb(conninfo.c_str());
    if (PQstatus(connection) != CONNECTION_OK) {
        std::string why = oneLine(PQerrorMessage(connection));
        lost(why);
        throw PgError("cannot connect to the database: " + why, "");
    }
    // Only warnings and errors reach the log; notices (a table that already
    // exists, say) are not news.
    PQsetNoticeProcessor(connection, [](void*, const char*) {}, nullptr);
    retryDelay = kMinRetryDelay;
    if (inOutage) lv_printLog(LogPriority::kInfo, kServerLogTag, "PgConnection: connected to the database again");
    inOutage = false;
}

void PgConnection::lost(const std::string& why) {
    if (!inOutage) {
        lv_printLog(LogPriority::kWarn, kServerLogTag, "PgConnection: lost the database (%s); retrying", why.c_str());
    }
    inOutage = true;
    nextAttempt = std::chrono::steady_clock::now() + retryDelay;
    retryDelay = std::min(retryDelay * 2, kMaxRetryDelay);
}

void PgConnection::ensureConnected() {
    if (PQstatus(connection) == CONNECTION_OK) return;
    if (std::chrono::steady_clock::now() < nextAttempt) {
        throw PgError("the database is unavailable; retrying shortly", "");
    }
    connect();
}

PgResult PgConnection::exec(const std::string& sql, const std::vector<Param>& params) {
    ensureConnected();
    std::vector<const char*> values;
    std::vector<int> lengths;
    std::vector<int> formats;
    for (const Param& param : params) {
        values.push_back(param.value.data());
        lengths.push_back(static_cast<int>(param.value.size()));
        formats.push_back(param.binary ? kBinaryFormat : kTextFormat);
    }
    PgResult result(PQexecParams(connection, sql.c_str(), static_cast<int>(params.size()), nullptr, values.data(),
                                 lengths.data(), formats.data(), kTextFormat));
    if (result.succeeded()) return result;
    std::string why = oneLine(PQerrorMessage(connection));
    if (PQstatus(connection) != CONNECTION_OK) lost(why);
    throw PgError(why, result.sqlState());
}

PgTransaction::PgTransaction(PgConnection& theConnection, const char* isolation) : connection(theConnection) {
    connection.exec(std::string("BEGIN ISOLATION LEVEL ") + isolation);
}

PgTransaction::~PgTransaction() {
    if (done) return;
    try {
        connection.exec("ROLLBACK");
    } catch (const PgError&) {
    }
}

void PgTransaction::commit() {
    connection.exec("COMMIT");
    done = true;
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
