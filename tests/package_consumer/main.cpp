// A program outside the repository, built against an installed copy of the
// library: it opens a store database, checks one pragma and removes it, then
// builds a wire payload and reads it back through the installed generated
// tables, as a transport would.
#include <cstdio>
#include <string>

#include "platform/Log.h"
#include "sqlite/Database.h"
#include "tessarine/Protocol.h"
#include "tessarine/Tessarine.h"
#include "tessarine/schema/tessarine_generated.h"

int main(int argc, char** argv) {
    if (argc < 2) return 2;
    std::string path = argv[1];
    auto database = lumivale::tessarine::Tessarine::createSqliteDatabase(path, {});
    auto statement = database->prepare("PRAGMA journal_mode");
    if (!statement.step() || statement(0).getText() != "wal") return 3;
    lumivale::tessarine::Tessarine store(std::move(database), path);
    if (!store.remove() || lumivale::tessarine::Tessarine::fileExists(path)) return 4;

    lumivale::tessarine::SyncProtocol::Delta delta;
    delta.collectionName = "app:notes";
    delta.primaryKey = "pk";
    delta.versionId = 3;
    auto payload = lumivale::tessarine::protocol::makePayloadForSendDelta(delta);
    auto* table = flatbuffers::GetRoot<tessarine::wire::ServerDelta>(payload.data());
    if (table->primaryKey()->str() != "pk") return 5;
    if (lumivale::tessarine::protocol::makeTessarineDelta(payload, 0).versionId != 3) return 6;
    lv_printLog(4, "consumer", "installed package works");
    return 0;
}
