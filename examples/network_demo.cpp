// The sync demo over the network: a mosquitto broker on a free loopback
// port, tessarine-server with its SQLite file, and each device a process of
// its own with its own store file and an MqttTransport; see usage(). It
// exits 0 only when every device ends with the server's notes, all PERSISTED.
//
// The same program is each device (run with --device): it takes commands on
// standard input, prints what it does and what its change callbacks see on
// standard output, and keeps a state file with its notes that the demo reads.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <sqlite3.h>

#include "examples/DemoNotes.h"
#include "platform/Log.h"
#include "server/LoopbackPort.h"
#include "sqlite/Database.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Tessarine.h"
#include "tessarine/ThreadCreator.h"
#include "tessarine/mqtt/MqttTransport.h"

extern char** environ;

namespace {

using demo::Note;
using demo::statusName;

namespace ts = lumivale::tessarine;

const char* const kCollection = "demo:notes";
constexpr std::chrono::seconds kStepDeadline(30);
constexpr std::chrono::milliseconds kPollPeriod(10);

void usage(const char* program) {
    std::printf(
        "usage: %s [--verbose] [--server PATH] [FOLDER]\n"
        "\n"
        "Starts a mosquitto broker on a free port of 127.0.0.1 and tessarine-server with its\n"
        "file, then runs a phone and a tablet as separate processes, each with its own store\n"
        "file, syncing through the broker and the server, and prints a timeline of what each\n"
        "application's change callbacks see and each note's status (PENDING, SENT, PERSISTED):\n"
        "  1. the phone writes two notes offline (PENDING);\n"
        "  2. it reconnects: its notes become SENT and PERSISTED, the tablet receives them;\n"
        "  3. both edit the same note offline and reconnect one after the other: the edit\n"
        "     the server accepts last wins on both devices;\n"
        "  4. the tablet deletes a note and the phone sees it go;\n"
        "  5. the phone's process ends with changes still queued; a new process on its file\n"
        "     sends them;\n"
        "  6. a third device, a laptop, joins and gets everything through a snapshot.\n"
        "It ends with a table of every device's notes and the server's side by side, and exits\n"
        "0 only when all devices hold the server's notes, all PERSISTED; 1 otherwise.\n"
        "\n"
        "The files go to a fresh temporary folder that is removed at the end, or to FOLDER,\n"
        "which is kept (it must be new or empty).\n"
        "  --server PATH   the tessarine-server program (default: the one built beside this)\n"
        "  --emulator CMD  runs the server and the devices through CMD (words separated by\n"
        "                  blanks), as a cross build's tests run its programs\n"
        "  --verbose       also print the library's debug log lines\n",
        program);
}

int64_t nowMs() {
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::system_clock::now().time_since_epoch())
        .count();
}

// Timeline lines from every process, timed from the demo's start.
void say(int64_t startMs, const std::string& who, const std::string& what) {
    std::printf("[%7.3fs] %-7s %s\n", (nowMs() - startMs) / 1000.0, who.c_str(), what.c_str());
    std::fflush(stdout);
}

// ---------------------------------------------------------------- device --

// One device process: a store on its file, synced through the broker.
class DeviceProcess {
public:
    DeviceProcess(std::string theName, std::string path, int port, std::string theStatePath, int64_t theStartMs)
        : name(std::move(theName)), statePath(std::move(theStatePath)), startMs(theStartMs) {
        ts::mqtt::MqttTransport::Options options;
        options.port = port;
        options.maxReconnectDelaySeconds = 2;
        transport = std::make_shared<ts::mqtt::MqttTransport>(options);
        store = ts::Tessarine::open(path, transport, std::make_shared<StdThreadCreator>());
        if (!store) throw std::runtime_error("cannot open " + path);
        store->addDeltaReceivedCallback([this](const std::vector<ts::Delta>& deltas) { onDeltas(deltas); });
        store->start();
        notes = store->subscribeCollection(kCollection);
        if (!notes) throw std::runtime_error("cannot subscribe to the notes");
    }

    // Runs commands from standard input until "quit" or its end.
    void run() {
        int commandsRun = 0;
        writeState(commandsRun);
        for (std::string line; std::getline(std::cin, line);) {
            std::istringstream words(line);
            std::string command, key;
            words >> command >> key;
            std::string text;
            std::getline(words >> std::ws, text);
            if (command == "quit") break;
            if (command == "save") {
                say(startMs, name, "saves " + key + " \"" + text + "\"");
                notes->saveObject(key, key, std::vector<unsigned char>(text.begin(), text.end()));
            } else if (command == "delete") {
                say(startMs, name, "deletes " + key);
                notes->deleteObject(key);
            } else if (command == "offline") {
                transport->disconnect();
                say(startMs, name, "goes offline");
            } else if (command == "online") {
                say(startMs, name, "comes back online");
                transport->connect();
            } else if (command == "show") {
                show();
            }
            writeState(++commandsRun);
        }
        notes.reset();
        store.reset();
        transport.reset();
    }

private:
    void onDeltas(const std::vector<ts::Delta>& deltas) {
        for (const ts::Delta& delta : deltas) {
            bool isDelete = delta.type == ts::SyncProtocol::DeltaType::DELETE;
            std::string content = isDelete ? "" : "\"" + std::string(delta.blob.begin(), delta.blob.end()) + "\"";
            char line[256];
            std::snprintf(line, sizeof line, "callback: %-6s %-7s %-22s %s", isDelete ? "DELETE" : "SAVE",
                          delta.primaryKey.c_str(), content.c_str(), statusName(static_cast<int>(delta.status)).c_str());
            say(startMs, name, line);
        }
        std::lock_guard<std::mutex> lock(stateMutex);
        writeStateLocked();
    }

    std::vector<Note> objects() {
        std::vector<Note> result;
        auto cursor = notes->query("", -1, ts::CollectionStorage::SortDirection::ASCENDING);
        while (cursor && cursor->step()) {
            auto blob = cursor->getBlob();
            result.push_back({cursor->getPrimaryKey(), std::string(blob.first, blob.first + blob.second),
                              cursor->getStatus()});
        }
        return result;
    }

    void show() {
        std::string line = "holds:";
        for (const Note& note : objects()) line += " " + note.key + "=\"" + note.text + "\"(" + statusName(note.status) + ")";
        say(startMs, name, line == "holds:" ? line + " nothing" : line);
    }

    void writeState(int commandsDone) {
        std::lock_guard<std::mutex> lock(stateMutex);
        done = commandsDone;
        writeStateLocked();
    }

    // "done N", then one "key<TAB>status<TAB>text" line per note; replaced whole.
    void writeStateLocked() {
        if (!notes) return;
        std::string temporary = statePath + ".tmp";
        {
            std::ofstream out(temporary, std::ios::trunc);
            out << "done " << done << "\n";
            for (const Note& note : objects()) out << note.key << "\t" << note.status << "\t" << note.text << "\n";
        }
        std::rename(temporary.c_str(), statePath.c_str());
    }

    const std::string name;
    const std::string statePath;
    const int64_t startMs;
    std::shared_ptr<ts::mqtt::MqttTransport> transport;
    std::unique_ptr<ts::Tessarine> store;
    std::unique_ptr<ts::Collection> notes;
    std::mutex stateMutex;
    int done = 0;
};

// ------------------------------------------------------------ processes --

// A child process, killed (if still running) and reaped when the object goes.
// With a command pipe, the child's standard input is the read end.
class Child {
public:
    Child(const std::vector<std::string>& arguments, bool withInput) {
        std::vector<std::string> all = arguments;
        std::vector<char*> argv;
        for (std::string& argument : all) argv.push_back(argument.data());
        argv.push_back(nullptr);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        int pipeFds[2] = {-1, -1};
        if (withInput) {
            if (pipe(pipeFds) != 0) throw std::runtime_error("cannot make a pipe");
            posix_spawn_file_actions_adddup2(&actions, pipeFds[0], 0);
            posix_spawn_file_actions_addclose(&actions, pipeFds[1]);
        }
        int rc = posix_spawnp(&pid, argv[0], &actions, nullptr, argv.data(), environ);
        posix_spawn_file_actions_destroy(&actions);
        if (withInput) {
            close(pipeFds[0]);
            input = pipeFds[1];
        }
        if (rc != 0) throw std::runtime_error("cannot start " + arguments[0]);
    }
    ~Child() {
        if (input >= 0) close(input);
        if (pid > 0) {
            kill(pid, SIGTERM);
            waitpid(pid, nullptr, 0);
        }
    }
    Child(const Child&) = delete;
    Child& operator=(const Child&) = delete;

    void send(const std::string& line) {
        std::string text = line + "\n";
        if (write(input, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
            throw std::runtime_error("a device stopped listening");
        }
    }
    // Waits until the child ends by itself.
    void join() {
        waitpid(pid, nullptr, 0);
        pid = -1;
    }

private:
    pid_t pid = -1;
    int input = -1;
};

// ------------------------------------------------------------------ demo --

struct Setup {
    std::string folder;
    std::string serverProgram;
    std::string selfProgram;
    bool verbose = false;
    int port = 0;
    int64_t startMs = 0;
    std::vector<std::string> emulator;  // prefixed to the server's and the devices' command lines

    // arguments, run through the emulator if there is one.
    std::vector<std::string> emulated(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin(), emulator.begin(), emulator.end());
        return arguments;
    }
};

// A device as the demo drives it: its process and its state file.
class Device {
public:
    Device(std::string theName, const Setup& theSetup) : name(std::move(theName)), setup(theSetup) {}

    void start() {
        commands = 0;
        std::filesystem::remove(statePath());
        std::vector<std::string> arguments{setup.selfProgram, "--device", name, setup.folder + "/" + name + ".db",
                                           std::to_string(setup.port), statePath(), std::to_string(setup.startMs)};
        if (setup.verbose) arguments.push_back("--verbose");
        process = std::make_unique<Child>(setup.emulated(arguments), true);
    }
    // Ends the process as an application ends: its store is closed.
    void quit() {
        process->send("quit");
        process->join();
        process.reset();
    }
    // Sends a command and waits until the device has carried it out.
    bool command(const std::string& line) {
        process->send(line);
        ++commands;
        return waitFor("the " + name + " has done \"" + line + "\"", [&] { return done() >= commands; });
    }

    std::vector<Note> notes() const {
        std::vector<Note> result;
        std::ifstream in(statePath());
        std::string line;
        std::getline(in, line);
        while (std::getline(in, line)) {
            std::istringstream fields(line);
            Note note;
            std::string status;
            std::getline(fields, note.key, '\t');
            std::getline(fields, status, '\t');
            std::getline(fields, note.text);
            note.status = std::atoi(status.c_str());
            result.push_back(note);
        }
        return result;
    }
    int statusOf(const std::string& key) const {
        for (const Note& note : notes()) {
            if (note.key == key) return note.status;
        }
        return 0;
    }

    bool waitFor(const std::string& what, const std::function<bool()>& condition) const {
        auto deadline = std::chrono::steady_clock::now() + kStepDeadline;
        while (!condition()) {
            if (std::chrono::steady_clock::now() > deadline) {
                say(setup.startMs, "demo", "FAILED: gave up waiting until " + what);
                return false;
            }
            std::this_thread::sleep_for(kPollPeriod);
        }
        return true;
    }

    const std::string name;

private:
    std::string statePath() const { return setup.folder + "/" + name + ".state"; }
    int done() const {
        std::ifstream in(statePath());
        std::string word;
        int count = -1;
        in >> word >> count;
        return word == "done" ? count : -1;
    }

    const Setup& setup;
    std::unique_ptr<Child> process;
    int commands = 0;
};

// The server's notes, read from its file, as a device holds them once nothing
// of its own is outstanding.
std::vector<Note> serverNotes(const Setup& setup) {
    std::vector<Note> result;
    try {
        lumivale::sqlite::Database database(setup.folder + "/server.db", SQLITE_OPEN_READONLY);
        auto statement = database.prepare(
            "SELECT primary_key, blob FROM objects WHERE collection = ? ORDER BY sort_key, primary_key");
        statement.bind(1, std::string(kCollection));
        while (statement.step()) {
            auto blob = statement(1).getBlobDirectBuffer();
            result.push_back({statement(0).getText(), std::string(blob.first, blob.first + blob.second), 3});
        }
    } catch (const std::exception&) {
        // Not made yet: no notes.
    }
    return result;
}

void printTable(const std::vector<Device*>& devices, const Setup& setup) {
    std::vector<std::string> names;
    std::vector<std::vector<demo::Note>> columns;
    for (const Device* device : devices) {
        names.push_back(device->name);
        columns.push_back(device->notes());
    }
    columns.push_back(serverNotes(setup));
    demo::printNotesTable(names, columns);
}

void heading(const std::string& title) {
    std::printf("\n== %s\n", title.c_str());
    std::fflush(stdout);
}

// The story; true when every device converged on the server's notes.
bool story(const Setup& setup) {
    Device phone("phone", setup), tablet("tablet", setup), laptop("laptop", setup);
    auto holdsServerNotes = [&](const Device& device) { return device.notes() == serverNotes(setup); };
    auto serverCount = [&] { return serverNotes(setup).size(); };

    heading("Two devices, each a process with its own store file, connect through the broker");
    phone.start();
    tablet.start();

    heading("1. The phone goes offline and writes two notes: they wait, PENDING");
    if (!phone.command("offline") || !phone.command("save note-1 Buy milk") || !phone.command("save note-2 Call Ana") ||
        !phone.command("show")) {
        return false;
    }

    heading("2. The phone reconnects: its notes become SENT, then PERSISTED; the tablet receives them");
    if (!phone.command("online")) return false;
    if (!phone.waitFor("both devices hold the server's two notes",
                       [&] { return serverCount() == 2 && holdsServerNotes(phone) && holdsServerNotes(tablet); })) {
        return false;
    }
    if (!phone.command("show") || !tablet.command("show")) return false;

    heading("3. Both edit note-1 offline, then reconnect one after the other");
    if (!phone.command("offline") || !tablet.command("offline") || !phone.command("save note-1 Buy oat milk") ||
        !tablet.command("save note-1 Buy milk and eggs") || !phone.command("show") || !tablet.command("show") ||
        !phone.command("online")) {
        return false;
    }
    if (!phone.waitFor("the phone's edit is PERSISTED", [&] { return phone.statusOf("note-1") == 3; })) return false;
    if (!tablet.command("online")) return false;
    if (!phone.waitFor("both devices hold the server's notes",
                       [&] { return holdsServerNotes(phone) && holdsServerNotes(tablet) &&
                                    tablet.statusOf("note-1") == 3; })) {
        return false;
    }
    say(setup.startMs, "demo", "the tablet heard of the phone's edit while its own was pending and kept its own;");
    say(setup.startMs, "demo", "the server accepted the tablet's edit last, so both devices now hold it:");
    if (!phone.command("show") || !tablet.command("show")) return false;

    heading("4. The tablet deletes note-2; the phone sees it go");
    if (!tablet.command("delete note-2")) return false;
    if (!phone.waitFor("note-2 is gone everywhere",
                       [&] { return serverCount() == 1 && holdsServerNotes(phone) && holdsServerNotes(tablet); })) {
        return false;
    }
    if (!phone.command("show")) return false;

    heading("5. The phone, offline, writes two notes and its process ends with them queued; a new one sends them");
    if (!phone.command("offline") || !phone.command("save note-3 Water the plants") ||
        !phone.command("save note-4 Book the train") || !phone.command("show")) {
        return false;
    }
    phone.quit();
    say(setup.startMs, "phone", "process ended with 2 changes queued; starting a new one on " + setup.folder + "/phone.db");
    phone.start();
    if (!phone.command("show")) return false;
    if (!phone.waitFor("both devices hold the phone's new notes",
                       [&] { return serverCount() == 3 && holdsServerNotes(phone) && holdsServerNotes(tablet); })) {
        return false;
    }
    if (!tablet.command("show")) return false;

    heading("6. A third device, the laptop, joins and gets everything in one snapshot");
    laptop.start();
    if (!laptop.waitFor("the laptop holds the server's notes", [&] { return holdsServerNotes(laptop); })) return false;
    if (!laptop.command("show")) return false;

    heading("Every device's notes and the server's, side by side");
    std::vector<Device*> devices{&phone, &tablet, &laptop};
    printTable(devices, setup);
    bool converged = true;
    for (const Device* device : devices) converged = converged && holdsServerNotes(*device);
    std::printf("\n%s\n", converged ? "CONVERGED: every device holds the server's notes, all PERSISTED."
                                    : "NOT CONVERGED: the devices differ (see the table).");
    std::fflush(stdout);
    for (Device* device : devices) device->quit();
    return converged;
}

// Starts the broker and the server, runs the story, stops them.
bool runDemo(Setup& setup) {
    setup.port = ts::server::freeLoopbackPort();
    std::string config = setup.folder + "/mosquitto.conf";
    {
        std::ofstream out(config);
        out << "listener " << setup.port << " 127.0.0.1\nallow_anonymous true\nset_tcp_nodelay true\nlog_type error\n";
        // As root, mosquitto would otherwise switch to a user that may not
        // read the folder.
        if (geteuid() == 0) out << "user root\n";
    }
    Child broker({"mosquitto", "-c", config}, false);
    auto deadline = std::chrono::steady_clock::now() + kStepDeadline;
    while (!ts::server::acceptsLoopbackConnections(setup.port)) {
        if (std::chrono::steady_clock::now() > deadline) {
            std::fprintf(stderr, "the broker did not start (is mosquitto installed? scripts/setup.sh)\n");
            return false;
        }
        std::this_thread::sleep_for(kPollPeriod);
    }
    say(setup.startMs, "demo", "broker: mosquitto on 127.0.0.1:" + std::to_string(setup.port));
    Child server(setup.emulated({setup.serverProgram, "--broker-port", std::to_string(setup.port), "--data",
                                 setup.folder + "/server.db"}),
                 false);
    say(setup.startMs, "demo", "server: tessarine-server with " + setup.folder + "/server.db");
    return story(setup);
}

std::string makeTemporaryFolder() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tessarine-network-demo-XXXXXX").string();
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (mkdtemp(buffer.data()) == nullptr) return "";
    return buffer.data();
}

void routeLog(bool verbose, const std::string& who) {
    lumivale::setLogSink([verbose, who](int priority, const std::string& tag, const std::string& message) {
        if (priority >= 5 || verbose) {
            std::fprintf(stderr, "  log %s %d/%s: %s\n", who.c_str(), priority, tag.c_str(), message.c_str());
        }
    });
}

// --device NAME DATABASE PORT STATE START_MS [--verbose]
int deviceMain(int argc, char** argv) {
    if (argc < 7) return 2;
    routeLog(argc > 7, argv[2]);
    try {
        DeviceProcess device(argv[2], argv[3], std::atoi(argv[4]), argv[5], std::atoll(argv[6]));
        device.run();
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s\n", argv[2], e.what());
        return 1;
    }
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::string(argv[1]) == "--device") return deviceMain(argc, argv);

    Setup setup;
    setup.serverProgram = TESSARINE_SERVER_PROGRAM;
    setup.selfProgram = std::filesystem::canonical("/proc/self/exe").string();
    for (int i = 1; i < argc; ++i) {
        std::string argument = argv[i];
        if (argument == "--help" || argument == "-h") {
            usage(argv[0]);
            return 0;
        }
        if (argument == "--verbose") {
            setup.verbose = true;
        } else if (argument == "--server" && i + 1 < argc) {
            setup.serverProgram = argv[++i];
        } else if (argument == "--emulator" && i + 1 < argc) {
            std::istringstream words(argv[++i]);
            for (std::string word; words >> word;) setup.emulator.push_back(word);
        } else if (!argument.empty() && argument[0] != '-' && setup.folder.empty()) {
            setup.folder = argument;
        } else {
            std::fprintf(stderr, "%s: unexpected argument \"%s\" (see --help)\n", argv[0], argument.c_str());
            return 2;
        }
    }
    routeLog(setup.verbose, "demo");
    // A device that ended early must not end the demo with it.
    signal(SIGPIPE, SIG_IGN);

    bool keep = !setup.folder.empty();
    if (keep) {
        std::error_code error;
        std::filesystem::create_directories(setup.folder, error);
        if (!std::filesystem::is_empty(setup.folder, error)) {
            std::fprintf(stderr, "%s: %s is not empty; give a new or empty folder\n", argv[0], setup.folder.c_str());
            return 2;
        }
    } else {
        setup.folder = makeTemporaryFolder();
    }
    if (setup.folder.empty() || !std::filesystem::is_directory(setup.folder)) {
        std::fprintf(stderr, "%s: cannot make a folder for the files\n", argv[0]);
        return 2;
    }
    setup.startMs = nowMs();
    bool converged = false;
    try {
        converged = runDemo(setup);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s\n", argv[0], e.what());
    }
    if (!keep) {
        std::error_code ignored;
        std::filesystem::remove_all(setup.folder, ignored);
    }
    lumivale::setLogSink(nullptr);
    return converged ? 0 : 1;
}
