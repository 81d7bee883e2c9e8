// Helper program of the test suite: writes to a store without end until the
// test kills it, recording what the store acknowledged.
//
//   crash_writer <database path> <journal file> <seed> <first remote sequence number>
//
// The main thread saves and deletes objects of "crash:notes" and
// "crash:tasks" in a loop chosen by the seed. Before each write it appends
//   W <collection> <primary key> <S|D> <sort key> <blob seed> <blob size>
// to the journal, and after the write returned true
//   A <version id>
// (the version id the transport was handed), flushed to disk before the
// next write starts; a write that returned false is recorded as "F". The
// blob of a save is journalBlob(blob seed, blob size). Meanwhile a transport
// thread delivers batches of another client's saves for "crash:remote", one
// after the other as soon as the previous one has been applied: each batch
// saves the objects r0 to r7 with the blob remoteBlob(sequence number) and
// carries its own sequence number, counting up from the given first one. A
// line "ready" is written once the store is open and both loops start.
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "CrashJournal.h"
#include "tessarine/Tessarine.h"

namespace {

using namespace lumivale::tessarine;

// Remembers the version id of the last delta handed to it; the writer
// thread is the only one that sends.
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

class Journal {
public:
    explicit Journal(const char* path) : fd(::open(path, O_WRONLY | O_CREAT | O_APPEND, 0644)) {
        if (fd < 0) {
            std::perror("crash_writer: journal");
            std::exit(1);
        }
    }
    // One write per line, so that a kill leaves whole lines or none.
    void line(const std::string& text, bool durable) {
        std::string withNewline = text + "\n";
        if (::write(fd, withNewline.data(), withNewline.size()) != static_cast<ssize_t>(withNewline.size())) {
            std::perror("crash_writer: journal write");
            std::exit(1);
        }
        if (durable) ::fdatasync(fd);
    }

private:
    int fd;
};

// Delivers the remote batches one after the other, each once the store's
// callback has heard the previous one.
class RemoteFeed {
public:
    RemoteFeed(std::shared_ptr<SyncProtocol> theTransport, uint64_t firstSequenceNumber)
        : transport(std::move(theTransport)), next(firstSequenceNumber) {}

    void onApplied(const std::vector<Delta>& deltas) {
        if (deltas.empty() || deltas.front().collectionName != "crash:remote") return;
        std::lock_guard<std::mutex> lock(mutex);
        applied = true;
        condition.notify_one();
    }

    [[noreturn]] void run() {
        while (true) {
            std::vector<SyncProtocol::Delta> batch;
            for (int i = 0; i < testsupport::kRemoteObjects; ++i) {
                SyncProtocol::Delta delta;
                delta.clientId = "ANOTHERCLIENT";
                delta.collectionName = "crash:remote";
                delta.versionId = next;
                delta.primaryKey = "r" + std::to_string(i);
                delta.sortKey = std::to_string(next);
                delta.blob = testsupport::remoteBlob(next);
                delta.sequenceNumber = next;
                batch.push_back(delta);
            }
            {
                std::lock_guard<std::mutex> lock(mutex);
                applied = false;
            }
            transport->onDeltaReceived(batch);
            std::unique_lock<std::mutex> lock(mutex);
            condition.wait(lock, [this] { return applied; });
            ++next;
        }
    }

private:
    std::shared_ptr<SyncProtocol> transport;
    uint64_t next;
    std::mutex mutex;
    std::condition_variable condition;
    bool applied = false;
};

}  // namespace

int main(int argc, char** argv) {
    if (argc != 5) {
        std::fprintf(stderr, "usage: crash_writer <database> <journal> <seed> <first remote sequence number>\n");
        return 1;
    }
    Journal journal(argv[2]);
    std::mt19937 random(static_cast<unsigned>(std::strtoul(argv[3], nullptr, 10)));
    auto transport = std::make_shared<RecordingTransport>();
    auto store = Tessarine::open(argv[1], transport, std::make_shared<StdThreadCreator>());
    if (!store) return 1;
    RemoteFeed feed(transport, std::strtoull(argv[4], nullptr, 10));
    store->addDeltaReceivedCallback([&feed](const std::vector<Delta>& deltas) { feed.onApplied(deltas); });
    store->setCollectionIndexerFunction(testsupport::journalIndexer);
    std::vector<std::unique_ptr<Collection>> collections;
    for (const char* name : testsupport::kJournalCollections) collections.push_back(store->subscribeCollection(name));
    if (!store->subscribeCollection("crash:remote")) return 1;
    store->start();
    journal.line("ready", true);
    std::thread(&RemoteFeed::run, &feed).detach();  // runs until the process is killed

    while (true) {
        size_t which = random() % collections.size();
        testsupport::JournalWrite write;
        write.collection = testsupport::kJournalCollections[which];
        write.primaryKey = "k" + std::to_string(random() % testsupport::kKeysPerCollection);
        write.isSave = random() % 5 != 0;
        if (write.isSave) {
            write.sortKey = "s" + std::to_string(random() % 1000);
            write.blobSeed = random();
            unsigned sizeClass = random() % 20;
            write.blobSize = sizeClass == 0 ? 100000 + random() % 300000 : sizeClass < 6 ? random() % 20000
                                                                                          : random() % 300;
        }
        journal.line(testsupport::formatWrite(write), false);
        std::unique_ptr<Collection>& collection = collections[which];
        bool ok = write.isSave ? collection->saveObject(write.primaryKey, write.sortKey,
                                                        testsupport::journalBlob(write.blobSeed, write.blobSize))
                               : collection->deleteObject(write.primaryKey);
        journal.line(ok ? "A " + std::to_string(transport->lastVersionId.load()) : "F", true);
    }
}
