#include "tessarine/Tessarine.h"

#include <cstdio>
#include <fstream>

#include "sqlite/Database.h"
#include "tessarine/Lifecycle.h"

namespace lumivale {
namespace tessarine {

namespace {
constexpr int kOpenReadWriteCreate = 6;  // SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE
}

Tessarine::Tessarine(std::shared_ptr<lumivale::sqlite::Database> database, const std::string& path)
    : database(std::move(database)), lifecycle(std::make_shared<Lifecycle>()), path(path) {}

Tessarine::~Tessarine() = default;

std::shared_ptr<lumivale::sqlite::Database> Tessarine::createSqliteDatabase(const std::string& path,
                                                                            const TessarineOptions& options) {
    auto database = std::make_shared<lumivale::sqlite::Database>(path, kOpenReadWriteCreate);
    database->exec("PRAGMA temp_store=" + options.tempStore);
    database->exec("PRAGMA journal_mode=" + options.journalMode);
    database->exec("PRAGMA synchronous=" + options.synchronous);
    database->exec("PRAGMA busy_timeout=" + std::to_string(options.busyTimeout));
    return database;
}

bool Tessarine::fileExists(const std::string& path) { return std::ifstream(path).good(); }

bool Tessarine::remove() {
    lifecycle->stop();
    database.reset();
    if (path.empty() || path == ":memory:") return true;
    for (const std::string& file : {path, path + "-shm", path + "-wal"}) {
        if (fileExists(file) && std::remove(file.c_str()) != 0) return false;
    }
    return true;
}

}  // namespace tessarine
}  // namespace lumivale
