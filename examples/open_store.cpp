// Opens a store database with the store's fixed tuning, prints the pragmas in
// effect, and removes the database with its companion files again.
//
//   open_store [path]     (default: a file in the system's temporary folder)
#include <cstdio>
#include <filesystem>
#include <string>

#include "sqlite/Database.h"
#include "tessarine/Tessarine.h"

using lumivale::tessarine::Tessarine;
using lumivale::tessarine::TessarineOptions;

namespace {

std::string readPragma(lumivale::sqlite::Database& database, const std::string& name) {
    auto statement = database.prepare("PRAGMA " + name);
    return statement.step() ? statement(0).getText() : "(no value)";
}

}  // namespace

int main(int argc, char** argv) {
    std::string path = argc > 1 ? argv[1] : (std::filesystem::temp_directory_path() / "tessarine-example.db").string();
    try {
        auto database = Tessarine::createSqliteDatabase(path, TessarineOptions());
        std::printf("opened %s\n", path.c_str());
        for (const char* pragma : {"temp_store", "journal_mode", "synchronous", "busy_timeout"}) {
            std::printf("  %-13s = %s\n", pragma, readPragma(*database, pragma).c_str());
        }
        database->exec("CREATE TABLE IF NOT EXISTS example (x INTEGER)");
        Tessarine store(std::move(database), path);
        bool removed = store.remove();
        std::printf("removed: %s, file still there: %s\n", removed ? "yes" : "no",
                    Tessarine::fileExists(path) ? "yes" : "no");
        return removed ? 0 : 1;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "open_store: %s\n", e.what());
        return 1;
    }
}
