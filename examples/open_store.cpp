// Opens a store database with the store's fixed tuning, prints the pragmas in
// effect, then opens a store on it, writes one object and removes the store
// with its files again.
//
//   open_store [path]     (default: a file in the system's temporary folder)
#include <cstdio>
#include <filesystem>
#include <string>

#include "sqlite/Database.h"
#include "tessarine/Tessarine.h"

using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::Tessarine;
using lumivale::tessarine::TessarineOptions;

namespace {

// A transport that never connects: every change stays queued.
class OfflineTransport : public SyncProtocol {
public:
    void start() override {}
    void sendSubscriptionRequest(const SubscriptionRequest&) override {}
    int sendDelta(const Delta&) override { return 0; }
    void sendSnapshotRequest(const std::string&, const std::string&) override {}
};

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
    } catch (const std::exception& e) {
        std::fprintf(stderr, "open_store: %s\n", e.what());
        return 1;
    }
    auto store = Tessarine::open(path, std::make_shared<OfflineTransport>(), std::make_shared<StdThreadCreator>());
    if (!store) return 1;
    auto notes = store->subscribeCollection("example:notes");
    bool saved = notes && notes->saveObject("note-1", "2026-11-22", std::vector<unsigned char>{'h', 'i'});
    std::printf("saved one object offline: %s\n", saved ? "yes" : "no");
    notes.reset();
    bool removed = store->remove();
    std::printf("removed: %s, file still there: %s\n", removed ? "yes" : "no",
                Tessarine::fileExists(path) ? "yes" : "no");
    return saved && removed ? 0 : 1;
}
