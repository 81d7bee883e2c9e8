// The store's SyncProtocol for a transport written in Java: each of the four
// operations calls the matching method of the application's SyncTransport
// object, and the TransportEvents object handed to its start() method feeds
// the events it reports into this transport's registries.
//
// Ownership: holds a global reference to the Java transport for as long as it
// lives. The TransportEvents object holds only a weak pointer to it (a strong
// one would keep it, and through its global reference the Java transport,
// alive forever), so events reported once the store's components are gone
// are dropped.
//
// Threads: the operations run on whichever thread the store calls them on,
// attached to the JVM if needed. A Java exception thrown by the transport is
// logged and cleared; start() then returns (the store's start cannot fail),
// the others throw jni::JavaCallbackError into the store.
#pragma once

#include <jni.h>

#include <memory>
#include <string>

#include "JniSupport.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace jni {

class JavaTransport : public SyncProtocol, public std::enable_shared_from_this<JavaTransport> {
public:
    JavaTransport(JNIEnv* env, jobject transport);

    void start() override;
    void sendSubscriptionRequest(const SubscriptionRequest& request) override;
    int sendDelta(const Delta& delta) override;
    void sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) override;

private:
    GlobalRef transport;
};

// What a TransportEvents object points to.
using TransportEventsTarget = std::weak_ptr<SyncProtocol>;

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
