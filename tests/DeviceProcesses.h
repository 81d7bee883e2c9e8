// The store processes of a networked test (tessarine_sync_device, one per
// tag), each writing its own objects through a broker, and what they report
// through their state files: the rows they hold once done writing, and the
// changes they were told PERSISTED. One test thread drives it; the
// destructor kills and reaps whatever still runs (ChildProcess).
#pragma once

#include <gtest/gtest.h>
#include <signal.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ChildProcess.h"
#include "TestSupport.h"

namespace testsupport {

class DeviceProcesses {
public:
    explicit DeviceProcesses(const TempDir& theDir) : dir(theDir) {}

    // Starts store tag on the broker at port: writes changes, pauseMs apart.
    void start(const std::string& tag, int port, int writes, int pauseMs) {
        processes.push_back(std::make_unique<ChildProcess>(
            TESSARINE_SYNC_DEVICE,
            std::vector<std::string>{dir.file(tag + ".db"), std::to_string(port), tag, std::to_string(writes),
                                     std::to_string(pauseMs), dir.file(tag + ".state")},
            TESSARINE_TEST_EMULATOR));
        tags.push_back(tag);
    }
    // "done" then the objects, once a store is done writing (see sync_device.cpp).
    std::vector<std::string> rows(const std::string& tag) const { return fileLines(dir.file(tag + ".state")); }
    // Every store done writing and holding exactly serverRows, all PERSISTED.
    bool allHold(std::vector<std::string> serverRows) const {
        if (serverRows.empty()) return false;
        serverRows.insert(serverRows.begin(), "done");
        for (const std::string& tag : tags) {
            if (rows(tag) != serverRows) return false;
        }
        return true;
    }
    // One line per store, for failure messages.
    std::string describe() const {
        std::string text;
        for (const std::string& tag : tags) {
            text += "device " + tag + ":";
            for (const std::string& row : rows(tag)) text += " " + row;
            text += "\n";
        }
        return text;
    }
    // check(tag, "<primary key> <blob>") for every change a store was told
    // PERSISTED; every store must have had some.
    void forEachPersisted(const std::function<void(const std::string&, const std::string&)>& check) const {
        for (const std::string& tag : tags) {
            std::vector<std::string> persisted = fileLines(dir.file(tag + ".state.persisted"));
            EXPECT_FALSE(persisted.empty()) << tag;
            for (const std::string& line : persisted) check(tag, line);
        }
    }
    // SIGTERM to each; each must end cleanly.
    void stop() {
        for (auto& process : processes) process->kill(SIGTERM);
        for (auto& process : processes) {
            int status = process->wait();
            EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << describeWaitStatus(status);
        }
    }
    size_t size() const { return tags.size(); }

private:
    const TempDir& dir;
    std::vector<std::unique_ptr<ChildProcess>> processes;
    std::vector<std::string> tags;
};

}  // namespace testsupport
