// The tables of the server's PostgreSQL database, created when missing by
// whichever server instance starts first. Any number of instances may start
// at once: the creation runs under a transaction-scoped advisory lock, so
// that two CREATE TABLE IF NOT EXISTS never race on the catalog.
//
//   "tessarine_changes"    the log: (collection, sequence) is the key and
//                          (client_id, collection, version_id) is unique, so
//                          the database itself refuses a change twice
//   "tessarine_objects"    the current objects
//   "tessarine_sequences"  per collection the last sequence number given;
//                          its row is the lock that orders a collection's
//                          writers
//   "tessarine_leases"     which instance serves which collection, until when
//   "tessarine_instances"  the live instances, until when (to share the
//                          collections out evenly)
//
// Errors: PgError.
#pragma once

#include "server/PgConnection.h"

namespace lumivale {
namespace tessarine {
namespace server {

void createPostgresSchema(PgConnection& connection);

}  // namespace server
}  // namespace tessarine
}  // namespace lumivale
