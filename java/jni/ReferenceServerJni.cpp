// The native methods of com.lumivale.tessarine.server: the reference server
// (an owned std::shared_ptr<SyncServer>) and its loopback transport. Built
// as a library of its own, tessarine_server_jni, on top of tessarine_jni,
// whose JNI plumbing it uses; applications do not ship it.
#include <jni.h>

#include <memory>
#include <string>

#include "JniSupport.h"
#include "Marshal.h"
#include "NativeCall.h"
#include "platform/Log.h"
#include "server/LoopbackTransport.h"
#include "server/SyncServer.h"

using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::server::LoopbackTransport;
using lumivale::tessarine::server::SyncServer;
using namespace lumivale::tessarine::jni;

namespace {

using SharedServer = std::shared_ptr<SyncServer>;

SyncServer& server(jlong pointer) { return **fromHandle<SharedServer>(pointer); }

// Consumer.accept, looked up by the first attach (on a Java thread, whose
// class loader sees the system classes).
jmethodID consumerAccept(JNIEnv* env) {
    static jmethodID accept = [env] {
        jclass consumer = env->FindClass("java/util/function/Consumer");
        jmethodID id = env->GetMethodID(consumer, "accept", "(Ljava/lang/Object;)V");
        env->DeleteLocalRef(consumer);
        return id;
    }();
    return accept;
}

}  // namespace

extern "C" {

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeCreate(JNIEnv* env, jclass) {
    return nativeCall(env, jlong{0}, [] { return toHandle(new SharedServer(std::make_shared<SyncServer>())); });
}

// The delivery runs under the server's lock: it only hands the bytes to the
// Java consumer, which queues them. An exception it throws is logged and the
// payload is lost to that session, as on a connection that breaks.
JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeAttach(JNIEnv* env, jclass,
                                                                                       jlong pointer,
                                                                                       jobject delivery) {
    return nativeCall(env, jlong{0}, [&] {
        jmethodID accept = consumerAccept(env);
        auto held = std::make_shared<GlobalRef>(env, delivery);
        SyncServer::SessionId session = server(pointer).attach([held, accept](std::vector<unsigned char> payload) {
            JNIEnv* callEnv = lumivale::tessarine::jni::env();
            try {
                LocalFrame frame(callEnv, 4);
                callEnv->CallVoidMethod(held->get(), accept, toJavaBytes(callEnv, payload));
                takeJavaException(callEnv, "a ReferenceServer session's delivery");
            } catch (const std::exception& e) {
                lv_printLog(6, kLogTag, "Could not deliver a server payload: %s", e.what());
            }
        });
        return static_cast<jlong>(session);
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeDetach(JNIEnv* env, jclass,
                                                                                      jlong pointer, jlong session) {
    nativeCall(env, [&] { server(pointer).detach(static_cast<SyncServer::SessionId>(session)); });
}

JNIEXPORT jint JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeReceive(JNIEnv* env, jclass,
                                                                                       jlong pointer, jlong session,
                                                                                       jstring topic,
                                                                                       jbyteArray payload) {
    return nativeCall(env, jint{0}, [&] {
        SyncServer::Receipt receipt = server(pointer).receive(static_cast<SyncServer::SessionId>(session),
                                                              toStdString(env, topic), toBytes(env, payload));
        return static_cast<jint>(receipt.outcome);
    });
}

JNIEXPORT jobject JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeSnapshot(JNIEnv* env, jclass,
                                                                                           jlong pointer,
                                                                                           jstring collectionName) {
    return nativeCall(env, jobject{nullptr}, [&] {
        SyncProtocol::Snapshot snapshot;
        snapshot.collectionName = toStdString(env, collectionName);
        snapshot.objects = server(pointer).objects(snapshot.collectionName);
        snapshot.sequenceNumber = server(pointer).sequenceNumber(snapshot.collectionName);
        return toJava(env, snapshot);
    });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeNewLoopbackTransport(
    JNIEnv* env, jclass, jlong pointer, jlong seed) {
    return nativeCall(env, jlong{0}, [&] {
        std::shared_ptr<SyncProtocol> transport =
            std::make_shared<LoopbackTransport>(*fromHandle<SharedServer>(pointer), static_cast<uint64_t>(seed));
        return toHandle(new std::shared_ptr<SyncProtocol>(std::move(transport)));
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_server_ReferenceServer_nativeRelease(JNIEnv*, jclass,
                                                                                       jlong pointer) {
    delete fromHandle<SharedServer>(pointer);
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_server_LoopbackTransport_nativeConnect(JNIEnv* env, jclass,
                                                                                         jlong pointer, jboolean up) {
    nativeCall(env, [&] {
        auto& transport = static_cast<LoopbackTransport&>(**fromHandle<std::shared_ptr<SyncProtocol>>(pointer));
        if (up) {
            transport.connect();
        } else {
            transport.disconnect();
        }
    });
}

}  // extern "C"
