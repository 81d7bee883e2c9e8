// The native methods of the transport side of the Java API: TransportEvents
// (a Java transport reporting into its store), NativeTransport (the owned
// std::shared_ptr of a native transport) and Wire (the wire payloads).
#include <jni.h>

#include <memory>
#include <string>

#include "JavaTransport.h"
#include "JniSupport.h"
#include "Marshal.h"
#include "NativeCall.h"
#include "tessarine/Protocol.h"

using lumivale::tessarine::SyncProtocol;
namespace protocol = lumivale::tessarine::protocol;
using namespace lumivale::tessarine::jni;

namespace {

// Hands one event to the transport's registries, unless the transport is gone.
template <typename Deliver>
void report(JNIEnv* env, jlong events, Deliver deliver) {
    nativeCall(env, [&] {
        std::shared_ptr<SyncProtocol> transport = fromHandle<TransportEventsTarget>(events)->lock();
        if (transport) deliver(*transport);
    });
}

}  // namespace

extern "C" {

// --- TransportEvents -----------------------------------------------------------

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeConnectionEstablished(JNIEnv* env, jclass,
                                                                                               jlong events) {
    report(env, events, [](SyncProtocol& transport) { transport.onConnectionEstablished(); });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeSubscriptionResponseReceived(
    JNIEnv* env, jclass, jlong events, jstring collectionName, jlong sequenceNumber) {
    report(env, events, [&](SyncProtocol& transport) {
        SyncProtocol::SubscriptionResponse response;
        response.collectionName = toStdString(env, collectionName);
        response.sequenceNumber = static_cast<uint64_t>(sequenceNumber);
        transport.onSubscriptionResponseReceived(response);
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeDeltasReceived(JNIEnv* env, jclass,
                                                                                        jlong events,
                                                                                        jobjectArray deltas) {
    report(env, events, [&](SyncProtocol& transport) { transport.onDeltaReceived(deltasFromJava(env, deltas)); });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeDeltaStatusUpdated(JNIEnv* env, jclass,
                                                                                            jlong events,
                                                                                            jobject delta,
                                                                                            jint status) {
    report(env, events, [&](SyncProtocol& transport) {
        SyncProtocol::DeltaStatusUpdate update;
        update.delta = deltaFromJava(env, delta);
        update.status = deltaStatusFromJava(status);
        transport.onDeltaStatusUpdated(update);
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeSnapshotReceived(JNIEnv* env, jclass,
                                                                                         jlong events,
                                                                                         jobject snapshot) {
    report(env, events, [&](SyncProtocol& transport) { transport.onSnapshotReceived(snapshotFromJava(env, snapshot)); });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_TransportEvents_nativeRelease(JNIEnv*, jclass, jlong events) {
    delete fromHandle<TransportEventsTarget>(events);
}

// --- NativeTransport -------------------------------------------------------------

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_NativeTransport_nativeRelease(JNIEnv*, jclass, jlong transport) {
    delete fromHandle<std::shared_ptr<SyncProtocol>>(transport);
}

// --- Wire ------------------------------------------------------------------------

JNIEXPORT jstring JNICALL Java_com_lumivale_tessarine_Wire_nativeTopic(JNIEnv* env, jclass, jint which) {
    return nativeCall(env, jstring{nullptr}, [&] {
        const char* topics[] = {protocol::TOPIC_CHANGE_RECORD, protocol::TOPIC_SUBSCRIBE_COLLECTION,
                                protocol::TOPIC_SNAPSHOT};
        return toJavaString(env, topics[which]);
    });
}

JNIEXPORT jbyteArray JNICALL Java_com_lumivale_tessarine_Wire_nativeChangeRecord(JNIEnv* env, jclass, jobject delta) {
    return nativeCall(env, jbyteArray{nullptr},
                      [&] { return toJavaBytes(env, protocol::makePayloadForSendDelta(deltaFromJava(env, delta))); });
}

JNIEXPORT jbyteArray JNICALL Java_com_lumivale_tessarine_Wire_nativeSubscription(JNIEnv* env, jclass,
                                                                                 jobject request) {
    return nativeCall(env, jbyteArray{nullptr}, [&] {
        return toJavaBytes(env, protocol::makePayloadForSubscription(subscriptionFromJava(env, request)));
    });
}

JNIEXPORT jbyteArray JNICALL Java_com_lumivale_tessarine_Wire_nativeSnapshotRequest(JNIEnv* env, jclass,
                                                                                    jstring collectionName,
                                                                                    jstring clientId) {
    return nativeCall(env, jbyteArray{nullptr}, [&] {
        return toJavaBytes(env, protocol::makePayloadForSnapshotRequest(toStdString(env, collectionName),
                                                                        toStdString(env, clientId)));
    });
}

JNIEXPORT jobject JNICALL Java_com_lumivale_tessarine_Wire_nativeReadServerPayload(JNIEnv* env, jclass,
                                                                                  jbyteArray payload) {
    return nativeCall(env, jobject{nullptr}, [&]() -> jobject {
        const JavaClasses& classes = javaClasses();
        SyncProtocol::ServerPayload message = protocol::deserializeServerPayload(toBytes(env, payload));
        if (message.type == SyncProtocol::PayloadType::SNAPSHOT) {
            jobject snapshot = toJava(env, protocol::deserializeSnapshot(message.data));
            return env->NewObject(classes.serverMessage, classes.serverMessageInit, nullptr, snapshot);
        }
        jobjectArray deltas = toJava(env, protocol::deserializeDeltaList(message.data));
        return env->NewObject(classes.serverMessage, classes.serverMessageInit, deltas, nullptr);
    });
}

}  // extern "C"
