// Helper program of the test suite: writes to a store without end until the
// test kills it, journaling what the store acknowledged (CrashJournal.h).
//
//   crash_writer <database path> <journal file> <seed> <first remote sequence number>
//
// The main thread makes the writes of WritePlan(seed); a write the store
// refuses ends the program with exit code 3. Meanwhile a thread delivers
// another client's batches for "crash:remote", each once the previous one has
// been applied, numbered up from the given first sequence number.
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

#include "CrashJournal.h"
#include "tessarine/Tessarine.h"

namespace {

using namespace lumivale::tessarine;

// Remembers the version id of the last delta handed to it; only the writing
// thread sends.
class RecordingTransport : public SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest&) override {}
    int sendDelta(const Delta& delta) override {
        lastVersionId = delta.versionId;
        return 0;
    }
    void sendSnapshotRequest(const std::string&, const std::string&) override {}
    std::atomic<uint64_t> lastVersionId{0};
};

// One write(2) per line, so that a kill leaves whole lines or none.
void journalLine(int fd, const std::string& text) {
    std::string line = text + "\n";
    if (::write(fd, line.data(), line.size()) != static_cast<ssize_t>(line.size()) || ::fdatasync(fd) != 0) std::exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 5) return 1;
    int journal = ::open(argv[2], O_WRONLY | O_CREAT | O_APPEND, 0644);
    auto transport = std::make_shared<RecordingTransport>();
    auto store = Tessarine::open(argv[1], transport, std::make_shared<StdThreadCreator>());
    if (journal < 0 || !store) return 1;
    std::mutex mutex;
    std::condition_variable condition;
    bool applied = false;
    store->addDeltaReceivedCallback([&](const std::vector<Delta>& deltas) {
        if (deltas.empty() || deltas.front().collectionName != "crash:remote") return;
        std::lock_guard<std::mutex> lock(mutex);
        applied = true;
        condition.notify_one();
    });
    store->setCollectionIndexerFunction(testsupport::journalIndexer);
    std::map<std::string, std::unique_ptr<Collection>> collections;
    for (const char* name : {"crash:notes", "crash:tasks", "crash:remote"}) {
        if (!(collections[name] = store->subscribeCollection(name))) return 1;
    }
    store->start();
    journalLine(journal, "ready");
    std::thread([&, sequenceNumber = std::strtoull(argv[4], nullptr, 10)]() mutable {
        for (;; ++sequenceNumber) {  // until the process is killed
            std::vector<SyncProtocol::Delta> batch;
            for (size_t i = 0; i < testsupport::kRemoteObjects; ++i) {
                batch.push_back({"ANOTHERCLIENT", "crash:remote", sequenceNumber, "r" + std::to_string(i),
                                 std::to_string(sequenceNumber), SyncProtocol::DeltaType::SAVE,
                                 testsupport::remoteBlob(sequenceNumber), sequenceNumber});
            }
            std::unique_lock<std::mutex> lock(mutex);
            applied = false;
            lock.unlock();
            transport->onDeltaReceived(batch);
            lock.lock();
            condition.wait(lock, [&] { return applied; });
        }
    }).detach();

    testsupport::WritePlan plan(static_cast<unsigned>(std::strtoul(argv[3], nullptr, 10)));
    while (true) {
        SyncProtocol::Delta write = plan.next();
        Collection& collection = *collections[write.collectionName];
        bool ok = write.type == SyncProtocol::DeltaType::SAVE
                      ? collection.saveObject(write.primaryKey, write.sortKey, write.blob)
                      : collection.deleteObject(write.primaryKey);
        if (!ok) std::_Exit(3);  // the remote thread still runs: no destructors
        journalLine(journal, std::to_string(transport->lastVersionId.load()));
    }
}
