// A program outside the repository, built against an installed copy of the
// library: it opens a store, writes one object offline and reads it back,
// removes the store, then builds a wire payload and reads it back through the
// installed generated tables, as a transport would, and finally syncs a store
// through the installed reference server and loopback transport.
#include <chrono>
#include <cstdio>
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

namespace {

class OfflineTransport : public lumivale::tessarine::SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest&) override {}
    int sendDelta(const Delta&) override { return 0; }
    void sendSnapshotRequest(const std::string&, const std::string&) override {}
};

// True once the store's object has come back from the server PERSISTED.
bool syncsThroughTheServer(const std::string& path) {
    using namespace lumivale::tessarine;
    auto server = std::make_shared<server::SyncServer>();
    auto store = Tessarine::open(path, std::make_shared<server::LoopbackTransport>(server),
                                 std::make_shared<StdThreadCreator>());
    if (!store) return false;
    store->start();
    auto items = store->subscribeCollection("app:items");
    if (!items || !items->saveObject("pk", "sort", std::vector<unsigned char>{3})) return false;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    bool persisted = false;
    while (!persisted && std::chrono::steady_clock::now() < deadline) {
        auto cursor = items->getObject("pk");
        persisted = cursor && cursor->step() && cursor->getStatus() == 3 && server->objects("app:items").size() == 1;
        if (!persisted) std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    items.reset();
    return store->remove() && persisted;
}

}  // namespace

int main(int argc, char** argv) {
    using lumivale::tessarine::Tessarine;
    if (argc < 2) return 2;
    std::string path = argv[1];
    auto store = Tessarine::open(path, std::make_shared<OfflineTransport>(), std::make_shared<StdThreadCreator>());
    if (!store) return 3;
    auto notes = store->subscribeCollection("app:notes");
    if (!notes || !notes->saveObject("pk", "sort", std::vector<unsigned char>{1, 2})) return 4;
    auto cursor = notes->getObject("pk");
    if (!cursor || !cursor->step() || cursor->getStatus() != 1) return 5;
    cursor.reset();
    notes.reset();
    if (!store->remove() || Tessarine::fileExists(path)) return 6;

    lumivale::tessarine::SyncProtocol::Delta delta;
    delta.collectionName = "app:notes";
    delta.primaryKey = "pk";
    delta.versionId = 3;
    auto payload = lumivale::tessarine::protocol::makePayloadForSendDelta(delta);
    auto* table = flatbuffers::GetRoot<tessarine::wire::ServerDelta>(payload.data());
    if (table->primaryKey()->str() != "pk") return 7;
    if (lumivale::tessarine::protocol::makeTessarineDelta(payload, 0).versionId != 3) return 8;
    if (!syncsThroughTheServer(path + ".synced")) return 9;
    lv_printLog(4, "consumer", "installed package works");
    return 0;
}
