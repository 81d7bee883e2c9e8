// A program outside the repository, built against an installed copy of the
// library: it opens a store, writes one object offline and reads it back,
// removes the store, then builds a wire payload and reads it back through the
// installed generated tables, as a transport would.
#include <cstdio>
#include <string>
#include <thread>

#include "platform/Log.h"
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

class PlainThreadCreator : public ThreadCreator {
public:
    std::thread createThread(std::function<void()> body) override { return std::thread(std::move(body)); }
};

}  // namespace

int main(int argc, char** argv) {
    using lumivale::tessarine::Tessarine;
    if (argc < 2) return 2;
    std::string path = argv[1];
    auto store = Tessarine::open(path, std::make_shared<OfflineTransport>(), std::make_shared<PlainThreadCreator>());
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
    lv_printLog(4, "consumer", "installed package works");
    return 0;
}
