// A program outside the repository, built against an installed copy of the
// library: it opens a store database, checks one pragma and removes it.
#include <cstdio>
#include <string>

#include "platform/Log.h"
#include "sqlite/Database.h"
#include "tessarine/Tessarine.h"

int main(int argc, char** argv) {
    if (argc < 2) return 2;
    std::string path = argv[1];
    auto database = lumivale::tessarine::Tessarine::createSqliteDatabase(path, {});
    auto statement = database->prepare("PRAGMA journal_mode");
    if (!statement.step() || statement(0).getText() != "wal") return 3;
    lumivale::tessarine::Tessarine store(std::move(database), path);
    if (!store.remove() || lumivale::tessarine::Tessarine::fileExists(path)) return 4;
    lv_printLog(4, "consumer", "installed package works");
    return 0;
}
