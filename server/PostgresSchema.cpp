#include "server/PostgresSchema.h"

namespace lumivale {
namespace tessarine {
namespace server {

namespace {

// An arbitrary key of the database-wide advisory lock space, ours alone.
constexpr int64_t kSchemaLockKey = 0x7465737361726e;

constexpr const char* kTables[] = {
    // Each statement in parentheses: one element, written over several lines.
    ("CREATE TABLE IF NOT EXISTS tessarine_changes ("
     " collection TEXT NOT NULL, sequence BIGINT NOT NULL, client_id TEXT NOT NULL,"
     " version_id BIGINT NOT NULL, primary_key TEXT NOT NULL, sort_key TEXT NOT NULL,"
     " type INTEGER NOT NULL, blob BYTEA NOT NULL,"
     " PRIMARY KEY (collection, sequence), UNIQUE (client_id, collection, version_id))"),
    ("CREATE TABLE IF NOT EXISTS tessarine_objects ("
     " collection TEXT NOT NULL, primary_key TEXT NOT NULL, sort_key TEXT NOT NULL, blob BYTEA NOT NULL,"
     " PRIMARY KEY (collection, primary_key))"),
    "CREATE TABLE IF NOT EXISTS tessarine_sequences (collection TEXT PRIMARY KEY, last BIGINT NOT NULL)",
    ("CREATE TABLE IF NOT EXISTS tessarine_leases ("
     " collection TEXT PRIMARY KEY, holder TEXT NOT NULL, expires_at TIMESTAMPTZ NOT NULL)"),
    "CREATE TABLE IF NOT EXISTS tessarine_instances (instance TEXT PRIMARY KEY, expires_at TIMESTAMPTZ NOT NULL)",
};

}  // namespace

void createPostgresSchema(PgConnection& connection) {
    PgTransaction transaction(connection);
    connection.exec("SELECT pg_advisory_xact_lock($1)", {kSchemaLockKey});
    for (const char* table : kTables) connection.exec(table);
    transaction.commit();
}

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
