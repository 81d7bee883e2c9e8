#include "JavaTransport.h"

#include "Marshal.h"
#include "NativeCall.h"
#include "platform/Log.h"

namespace lumivale {
namespace tessarine {
namespace jni {

namespace {
constexpr jint kCallFrame = 8;
}

JavaTransport::JavaTransport(JNIEnv* env, jobject theTransport) : transport(env, theTransport) {}

void JavaTransport::start() {
    JNIEnv* env = jni::env();
    try {
        LocalFrame frame(env, kCallFrame);
        auto target = std::make_unique<TransportEventsTarget>(shared_from_this());
        jobject events = env->NewObject(javaClasses().transportEvents, javaClasses().transportEventsInit,
                                        toHandle(target.get()));
        if (env->ExceptionCheck()) {
            takeJavaException(env, "new TransportEvents");
            return;
        }
        target.release();  // the TransportEvents object owns it now
        env->CallVoidMethod(transport.get(), javaClasses().transportStart, events);
        takeJavaException(env, "SyncTransport.start");
    } catch (const std::exception& e) {
        lv_printLog(6, kLogTag, "Could not start the Java transport: %s", e.what());
    }
}

void JavaTransport::sendSubscriptionRequest(const SubscriptionRequest& request) {
    JNIEnv* env = jni::env();
    LocalFrame frame(env, kCallFrame);
    env->CallVoidMethod(transport.get(), javaClasses().transportSendSubscriptionRequest, toJava(env, request));
    rethrowAsNative(env, "SyncTransport.sendSubscriptionRequest");
}

int JavaTransport::sendDelta(const Delta& delta) {
    JNIEnv* env = jni::env();
    LocalFrame frame(env, kCallFrame);
    jint result = env->CallIntMethod(transport.get(), javaClasses().transportSendDelta, toJava(env, delta));
    rethrowAsNative(env, "SyncTransport.sendDelta");
    return result;
}

void JavaTransport::sendSnapshotRequest(const std::string& collectionName, const std::string& clientId) {
    JNIEnv* env = jni::env();
    LocalFrame frame(env, kCallFrame);
    env->CallVoidMethod(transport.get(), javaClasses().transportSendSnapshotRequest,
                        toJavaString(env, collectionName), toJavaString(env, clientId));
    rethrowAsNative(env, "SyncTransport.sendSnapshotRequest");
}

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
