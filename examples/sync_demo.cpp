// Two devices keep a collection of notes in sync through the reference sync
// server, then a third joins; see usage() for what it shows. It exits 0 only
// when every device ends with the server's notes, all PERSISTED.
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <unistd.h>

#include "examples/DemoNotes.h"
#include "platform/Log.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Tessarine.h"
#include "tessarine/ThreadCreator.h"

namespace {

using demo::Note;
using demo::statusName;

namespace ts = lumivale::tessarine;
using ts::server::LoopbackTransport;
using ts::server::SyncServer;

const char* const kCollection = "demo:notes";
constexpr std::chrono::seconds kStepDeadline(20);

void usage(const char* program) {
    std::printf(
        "usage: %s [--verbose] [FOLDER]\n"
        "\n"
        "Runs two devices, a phone and a tablet, each with its own store file, against one\n"
        "in-process sync server (the reference server of server/, through a loopback\n"
        "transport), and prints a timeline of what each application's change callbacks\n"
        "see and each note's status (PENDING, SENT, PERSISTED):\n"
        "  1. the phone writes two notes offline (PENDING);\n"
        "  2. it reconnects: its notes become SENT and PERSISTED, the tablet receives them;\n"
        "  3. both edit the same note offline and reconnect one after the other: the edit\n"
        "     the server accepts last wins on both devices;\n"
        "  4. the tablet deletes a note and the phone sees it go;\n"
        "  5. the phone is closed with changes still queued, reopened on its file, and\n"
        "     sends them;\n"
        "  6. a third device, a laptop, joins and gets everything through a snapshot.\n"
        "It ends with a table of every device's notes side by side and exits 0 only when\n"
        "all devices hold the same notes as the server, all PERSISTED; 1 otherwise.\n"
        "\n"
        "The store files go to a fresh temporary folder that is removed at the end, or to\n"
        "FOLDER, which is kept (it must not hold files of an earlier run).\n"
        "  --verbose   also print the library's debug log lines\n",
        program);
}

std::string text(const std::vector<unsigned char>& blob) { return std::string(blob.begin(), blob.end()); }

// The timeline: numbered lines with the time since the start and who speaks.
// Callbacks print from the stores' worker threads, so every line is written
// under one lock.
class Timeline {
public:
    void say(const std::string& who, const std::string& what) {
        std::lock_guard<std::mutex> lock(mutex);
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        std::printf("[%7.3fs] %-7s %s\n", seconds, who.c_str(), what.c_str());
        std::fflush(stdout);
    }
    void heading(const std::string& title) {
        std::lock_guard<std::mutex> lock(mutex);
        std::printf("\n== %s\n", title.c_str());
        std::fflush(stdout);
    }

private:
    std::mutex mutex;
    const std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();
};

// One device: a store file, its transport to the server and its handle on
// the notes.
class Device {
public:
    Device(std::string theName, std::string thePath, uint64_t theSeed, std::shared_ptr<SyncServer> theServer,
           Timeline& theTimeline)
        : name(std::move(theName)),
          path(std::move(thePath)),
          seed(theSeed),
          server(std::move(theServer)),
          timeline(theTimeline) {}

    // Opens the store on a new connection to the server and subscribes to the
    // notes. The callback prints every change the application hears of.
    bool open() {
        transport = std::make_shared<LoopbackTransport>(server, seed++);
        // A link of 1 to 3 ms each way, as a real one has: the server's
        // answers do not overtake the store's own bookkeeping of what it
        // sent, so the timeline reads in the order things happen.
        const ts::server::FaultRates latency{0, 0, 1.0, std::chrono::milliseconds(3)};
        transport->setFaults(LoopbackTransport::Direction::TO_SERVER, latency);
        transport->setFaults(LoopbackTransport::Direction::TO_CLIENT, latency);
        store = ts::Tessarine::open(path, transport, threadCreator);
        if (!store) return false;
        store->addDeltaReceivedCallback([this](const std::vector<ts::Delta>& deltas) {
            for (const ts::Delta& delta : deltas) {
                bool isDelete = delta.type == ts::SyncProtocol::DeltaType::DELETE;
                std::string content = isDelete ? "" : "\"" + text(delta.blob) + "\"";
                char line[256];
                std::snprintf(line, sizeof line, "callback: %-6s %-7s %-22s %s", isDelete ? "DELETE" : "SAVE",
                              delta.primaryKey.c_str(), content.c_str(),
                              statusName(static_cast<int>(delta.status)).c_str());
                timeline.say(name, line);
            }
        });
        store->start();
        notes = store->subscribeCollection(kCollection);
        return notes != nullptr;
    }

    // Closes as an application does when it ends: the handle, the store,
    // then the transport.
    void close() {
        notes.reset();
        store.reset();
        transport.reset();
    }

    bool save(const std::string& key, const std::string& content) {
        timeline.say(name, "saves " + key + " \"" + content + "\"");
        return notes->saveObject(key, key, std::vector<unsigned char>(content.begin(), content.end()));
    }
    bool remove(const std::string& key) {
        timeline.say(name, "deletes " + key);
        return notes->deleteObject(key);
    }
    void goOffline() {
        transport->disconnect();
        timeline.say(name, "goes offline");
    }
    void goOnline() {
        timeline.say(name, "comes back online");
        transport->connect();
    }

    std::vector<Note> objects() const {
        std::vector<Note> result;
        auto cursor = notes->query("", -1, ts::CollectionStorage::SortDirection::ASCENDING);
        while (cursor && cursor->step()) {
            auto blob = cursor->getBlob();
            result.push_back({cursor->getPrimaryKey(), std::string(blob.first, blob.first + blob.second),
                              cursor->getStatus()});
        }
        return result;
    }

    int statusOf(const std::string& key) const {
        for (const Note& note : objects()) {
            if (note.key == key) return note.status;
        }
        return 0;
    }

    void showObjects() const {
        std::string line = "holds:";
        for (const Note& note : objects()) line += " " + note.key + "=\"" + note.text + "\"(" + statusName(note.status) + ")";
        if (line == "holds:") line += " nothing";
        timeline.say(name, line);
    }

    const std::string name;
    const std::string path;

private:
    uint64_t seed;
    std::shared_ptr<SyncServer> server;
    Timeline& timeline;
    std::shared_ptr<StdThreadCreator> threadCreator = std::make_shared<StdThreadCreator>();
    std::shared_ptr<LoopbackTransport> transport;
    std::unique_ptr<ts::Tessarine> store;
    std::unique_ptr<ts::Collection> notes;
};

// The server's notes as a device holds them once nothing of its own is
// outstanding.
std::vector<Note> serverNotes(const SyncServer& server) {
    std::vector<Note> result;
    for (const auto& object : server.objects(kCollection)) result.push_back({object.primaryKey, text(object.blob), 3});
    return result;
}

// Waits until condition holds; past the deadline the demo has failed.
bool waitFor(Timeline& timeline, const std::string& what, const std::function<bool()>& condition) {
    auto deadline = std::chrono::steady_clock::now() + kStepDeadline;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) {
            timeline.say("demo", "FAILED: gave up waiting until " + what);
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
}

bool holdsServerNotes(const Device& device, const SyncServer& server) {
    return device.objects() == serverNotes(server);
}

// Every note of every device and of the server, side by side.
void printTable(const std::vector<Device*>& devices, const SyncServer& server) {
    std::vector<std::string> names;
    std::vector<std::vector<demo::Note>> columns;
    for (const Device* device : devices) {
        names.push_back(device->name);
        columns.push_back(device->objects());
    }
    columns.push_back(serverNotes(server));
    demo::printNotesTable(names, columns);
}

struct Options {
    bool verbose = false;
    std::string folder;
};

// 0 when parsed, otherwise the exit code.
int parse(int argc, char** argv, Options& options) {
    for (int i = 1; i < argc; ++i) {
        std::string argument = argv[i];
        if (argument == "--help" || argument == "-h") {
            usage(argv[0]);
            return -1;
        }
        if (argument == "--verbose") {
            options.verbose = true;
        } else if (!argument.empty() && argument[0] != '-' && options.folder.empty()) {
            options.folder = argument;
        } else {
            std::fprintf(stderr, "%s: unexpected argument \"%s\" (see --help)\n", argv[0], argument.c_str());
            return 2;
        }
    }
    return 0;
}

std::string makeTemporaryFolder() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tessarine-demo-XXXXXX").string();
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (mkdtemp(buffer.data()) == nullptr) return "";
    return buffer.data();
}

// The demo itself; true when every device converged on the server's notes.
bool run(const std::string& folder, Timeline& timeline) {
    auto server = std::make_shared<SyncServer>();
    Device phone("phone", folder + "/phone.db", 100, server, timeline);
    Device tablet("tablet", folder + "/tablet.db", 200, server, timeline);
    Device laptop("laptop", folder + "/laptop.db", 300, server, timeline);

    timeline.heading("Two devices open their stores and connect to the server");
    if (!phone.open() || !tablet.open()) return false;
    timeline.say("demo", "store files in " + folder);

    timeline.heading("1. The phone goes offline and writes two notes: they wait, PENDING");
    phone.goOffline();
    if (!phone.save("note-1", "Buy milk") || !phone.save("note-2", "Call Ana")) return false;
    phone.showObjects();

    timeline.heading("2. The phone reconnects: its notes become SENT, then PERSISTED; the tablet receives them");
    phone.goOnline();
    if (!waitFor(timeline, "both devices hold the server's notes",
                 [&] { return holdsServerNotes(phone, *server) && holdsServerNotes(tablet, *server) &&
                              server->objects(kCollection).size() == 2; })) {
        return false;
    }
    phone.showObjects();
    tablet.showObjects();

    timeline.heading("3. Both edit note-1 offline, then reconnect one after the other");
    phone.goOffline();
    tablet.goOffline();
    if (!phone.save("note-1", "Buy oat milk") || !tablet.save("note-1", "Buy milk and eggs")) return false;
    phone.showObjects();
    tablet.showObjects();
    phone.goOnline();
    if (!waitFor(timeline, "the phone's edit is PERSISTED", [&] { return phone.statusOf("note-1") == 3; })) return false;
    tablet.goOnline();
    if (!waitFor(timeline, "both devices hold the server's notes",
                 [&] { return holdsServerNotes(phone, *server) && holdsServerNotes(tablet, *server); })) {
        return false;
    }
    timeline.say("demo", "the tablet heard of the phone's edit while its own was pending and kept its own;");
    timeline.say("demo", "the server accepted the tablet's edit last, so both devices now hold it:");
    phone.showObjects();
    tablet.showObjects();

    timeline.heading("4. The tablet deletes note-2; the phone sees it go");
    if (!tablet.remove("note-2")) return false;
    if (!waitFor(timeline, "note-2 is gone everywhere",
                 [&] { return server->objects(kCollection).size() == 1 && holdsServerNotes(phone, *server) &&
                              holdsServerNotes(tablet, *server); })) {
        return false;
    }
    phone.showObjects();

    timeline.heading("5. The phone, offline, writes two notes and is closed with them queued; reopened, it sends them");
    phone.goOffline();
    if (!phone.save("note-3", "Water the plants") || !phone.save("note-4", "Book the train")) return false;
    phone.showObjects();
    phone.close();
    timeline.say("phone", "closed with 2 changes queued; reopening " + phone.path);
    if (!phone.open()) return false;
    phone.showObjects();
    if (!waitFor(timeline, "both devices hold the phone's new notes",
                 [&] { return server->objects(kCollection).size() == 3 && holdsServerNotes(phone, *server) &&
                              holdsServerNotes(tablet, *server); })) {
        return false;
    }
    tablet.showObjects();

    timeline.heading("6. A third device, the laptop, joins and gets everything in one snapshot");
    if (!laptop.open()) return false;
    if (!waitFor(timeline, "the laptop holds the server's notes", [&] { return holdsServerNotes(laptop, *server); })) {
        return false;
    }
    laptop.showObjects();

    timeline.heading("Every device's notes, side by side");
    std::vector<Device*> devices{&phone, &tablet, &laptop};
    printTable(devices, *server);
    bool converged = true;
    for (const Device* device : devices) converged = converged && holdsServerNotes(*device, *server);
    std::printf("\n%s\n", converged ? "CONVERGED: every device holds the server's notes, all PERSISTED."
                                    : "NOT CONVERGED: the devices differ (see the table).");
    return converged;
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    int parsed = parse(argc, argv, options);
    if (parsed != 0) return parsed < 0 ? 0 : parsed;

    // The library's warnings and errors go to standard error; its debug
    // notes only with --verbose.
    lumivale::setLogSink([&options](int priority, const std::string& tag, const std::string& message) {
        if (priority >= 5 || options.verbose) std::fprintf(stderr, "  log %d/%s: %s\n", priority, tag.c_str(), message.c_str());
    });

    bool keep = !options.folder.empty();
    std::string folder = options.folder;
    if (keep) {
        std::error_code error;
        std::filesystem::create_directories(folder, error);
        for (const char* file : {"phone.db", "tablet.db", "laptop.db"}) {
            if (std::filesystem::exists(std::filesystem::path(folder) / file)) {
                std::fprintf(stderr, "%s: %s already holds %s from an earlier run; give a new or empty folder\n",
                             argv[0], folder.c_str(), file);
                return 2;
            }
        }
    } else {
        folder = makeTemporaryFolder();
    }
    if (folder.empty() || !std::filesystem::is_directory(folder)) {
        std::fprintf(stderr, "%s: cannot make a folder for the store files\n", argv[0]);
        return 2;
    }

    Timeline timeline;
    bool converged = run(folder, timeline);
    if (!keep) {
        std::error_code ignored;
        std::filesystem::remove_all(folder, ignored);
    }
    lumivale::setLogSink(nullptr);
    return converged ? 0 : 1;
}
