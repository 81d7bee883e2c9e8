// A program outside the repository, built against an installed copy of the
// library (or its sources added to the program's build): it syncs a store
// through the reference server and loopback transport, removes it, then
// builds a wire payload and reads it back through the installed generated
// tables, as a transport would.
#include <chrono>
#include <string>
#include <thread>

#include "platform/Log.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Protocol.h"
#include "tessarine/Tessarine.h"
#include "tessarine/schema/tessarine_generated.h"

int main(int argc, char** argv) {
    using namespace lumivale::tessarine;
    if (argc < 2) return 2;
    const std::string path = argv[1];
    auto server = std::make_shared<server::SyncServer>();
    auto store = Tessarine::open(path, std::make_shared<server::LoopbackTransport>(server),
                                 std::make_shared<StdThreadCreator>());
    if (!store) return 3;
    store->start();
    auto items = store->subscribeCollection("app:items");
    if (!items || !items->saveObject("pk", "sort", std::vector<unsigned char>{3})) return 4;
    // No test helpers here: polls until the object comes back PERSISTED.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    auto persisted = [&] {
        auto cursor = items->getObject("pk");
        return cursor && cursor->step() && cursor->getStatus() == 3 && server->objects("app:items").size() == 1;
    };
    while (!persisted()) {
        if (std::chrono::steady_clock::now() > deadline) return 5;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    items.reset();
    if (!store->remove() || Tessarine::fileExists(path)) return 6;

    SyncProtocol::Delta delta;
    delta.collectionName = "app:notes";
    delta.primaryKey = "pk";
    delta.versionId = 3;
    auto payload = protocol::makePayloadForSendDelta(delta);
    if (flatbuffers::GetRoot<::tessarine::wire::ServerDelta>(payload.data())->primaryKey()->str() != "pk") return 7;
    if (protocol::makeTessarineDelta(payload, 0).versionId != 3) return 8;
    lv_printLog(4, "consumer", "installed package works");
    return 0;
}
