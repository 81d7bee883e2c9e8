// A store connected to a shared SyncServer through a LoopbackTransport, as
// an application opens one, and the objects it holds, for the tests that sync
// several stores.
#pragma once

#include <cstdio>
#include <map>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "FakeTransport.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"
#include "tessarine/Collection.h"
#include "tessarine/Cursor.h"
#include "tessarine/Tessarine.h"

namespace testsupport {

inline std::string hex(const unsigned char* bytes, size_t size) {
    std::string text;
    char digits[3];
    for (size_t i = 0; i < size; ++i) {
        std::snprintf(digits, sizeof digits, "%02x", bytes[i]);
        text += digits;
    }
    return text;
}

// "primaryKey@sortKey=blob-in-hex#status", one per object, in sort-key order.
inline std::vector<std::string> objectRows(lumivale::tessarine::Collection& collection) {
    std::vector<std::string> rows;
    auto cursor = collection.query("", -1, lumivale::tessarine::CollectionStorage::SortDirection::ASCENDING);
    while (cursor && cursor->step()) {
        auto blob = cursor->getBlob();
        rows.push_back(cursor->getPrimaryKey() + "@" + cursor->getSortKey() + "=" + hex(blob.first, blob.second) + "#" +
                       std::to_string(cursor->getStatus()));
    }
    return rows;
}

// The server's objects in the same form, as a store holds them once nothing
// of its own is outstanding (status 3).
inline std::vector<std::string> serverRows(const lumivale::tessarine::server::SyncServer& server,
                                           const std::string& collection) {
    std::vector<std::string> rows;
    for (const auto& object : server.objects(collection)) {
        rows.push_back(object.primaryKey + "@" + object.sortKey + "=" + hex(object.blob.data(), object.blob.size()) +
                       "#3");
    }
    return rows;
}

struct SyncDevice {
    SyncDevice(std::shared_ptr<lumivale::tessarine::server::SyncServer> theServer, std::string thePath, uint64_t seed)
        : server(std::move(theServer)), path(std::move(thePath)) {
        open(seed);
    }

    // Opens the store on a new transport, starts it and subscribes to every
    // collection subscribed before.
    void open(uint64_t seed) {
        transport = std::make_shared<lumivale::tessarine::server::LoopbackTransport>(server, seed);
        store = lumivale::tessarine::Tessarine::open(path, transport, threadCreator);
        if (!store) throw std::runtime_error("cannot open " + path);
        store->start();
        for (auto& entry : collections) entry.second = store->subscribeCollection(entry.first);
    }

    // Closes the store as an application does when it ends: handles first,
    // then the store, then the transport.
    void close() {
        for (auto& entry : collections) entry.second.reset();
        store.reset();
        transport.reset();
    }

    lumivale::tessarine::Collection& collection(const std::string& name) {
        auto& handle = collections[name];
        if (!handle) handle = store->subscribeCollection(name);
        if (!handle) throw std::runtime_error("cannot subscribe to " + name);
        return *handle;
    }

    std::shared_ptr<lumivale::tessarine::server::SyncServer> server;
    std::string path;
    std::shared_ptr<CountingThreadCreator> threadCreator = std::make_shared<CountingThreadCreator>();
    std::shared_ptr<lumivale::tessarine::server::LoopbackTransport> transport;
    std::unique_ptr<lumivale::tessarine::Tessarine> store;
    std::map<std::string, std::unique_ptr<lumivale::tessarine::Collection>> collections;
};

}  // namespace testsupport
