// The entry object of the library: one store per database file.
//
// A store keeps all its durable state in one SQLite database at a path the
// application chooses, opened with fixed tuning (TessarineOptions) and deleted
// again, with its "-shm" and "-wal" companions, by remove().
//
// Threads: the instance takes no lock of its own; call it from application
// threads. remove() is meant as the last call before destruction.
#pragma once

#include <memory>
#include <string>

namespace lumivale {
namespace sqlite {
class Database;
}

namespace tessarine {

class Lifecycle;

// The pragmas a store database is opened with. The defaults are the store's
// fixed tuning; applications do not choose other values.
struct TessarineOptions {
    std::string tempStore = "MEMORY";
    std::string journalMode = "WAL";
    std::string synchronous = "NORMAL";
    int busyTimeout = 1000;  // milliseconds
};

class Tessarine {
public:
    Tessarine(std::shared_ptr<lumivale::sqlite::Database> database, const std::string& path);
    ~Tessarine();
    Tessarine(const Tessarine&) = delete;
    Tessarine& operator=(const Tessarine&) = delete;

    // Opens (creating if needed) the database at path with flags read-write |
    // create and issues the four pragmas of options, in the order temp_store,
    // journal_mode, synchronous, busy_timeout. "" and ":memory:" keep SQLite's
    // meaning. Throws lumivale::sqlite::SQLiteException.
    static std::shared_ptr<lumivale::sqlite::Database> createSqliteDatabase(const std::string& path,
                                                                            const TessarineOptions& options);

    // True when the path can be opened for reading.
    static bool fileExists(const std::string& path);

    // Stops the store's lifecycle, drops this instance's reference to the
    // database and deletes the database file, then its "-shm" and "-wal"
    // files, skipping those that do not exist. Returns false at the first
    // existing file that cannot be deleted, leaving the rest untouched; true
    // otherwise, and always for "" and ":memory:". Logs nothing.
    bool remove();

private:
    std::shared_ptr<lumivale::sqlite::Database> database;
    std::shared_ptr<Lifecycle> lifecycle;
    std::string path;
};

}  // namespace tessarine
}  // namespace lumivale
