// The native methods of com.lumivale.tessarine.mqtt.MqttTransport: makes the
// native MQTT transport, owned as a heap-allocated
// std::shared_ptr<SyncProtocol> by the Java object (NativeTransport), and
// takes its connection down and up. Built as a library of its own,
// tessarine_mqtt_jni, on top of tessarine_jni, so that an app without MQTT
// ships neither it nor libmosquitto.
#include <jni.h>

#include <memory>

#include "JniSupport.h"
#include "NativeCall.h"
#include "tessarine/mqtt/MqttTransport.h"

using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::mqtt::MqttTransport;
using namespace lumivale::tessarine::jni;

namespace {

MqttTransport& transport(jlong pointer) {
    return static_cast<MqttTransport&>(**fromHandle<std::shared_ptr<SyncProtocol>>(pointer));
}

}  // namespace

extern "C" {

// Options the native side cannot use (an unreadable CA file, say) throw
// TessarineException; negative numbers are refused by the Java side.
JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_mqtt_MqttTransport_nativeCreate(
    JNIEnv* env, jclass, jstring host, jint port, jstring username, jstring password, jstring caFile,
    jint keepAliveSeconds, jint minReconnectDelaySeconds, jint maxReconnectDelaySeconds) {
    return nativeCall(env, jlong{0}, [&] {
        MqttTransport::Options options;
        options.host = toStdString(env, host);
        options.port = port;
        options.username = toStdString(env, username);
        options.password = toStdString(env, password);
        options.caFile = toStdString(env, caFile);
        options.keepAliveSeconds = keepAliveSeconds;
        options.minReconnectDelaySeconds = static_cast<unsigned>(minReconnectDelaySeconds);
        options.maxReconnectDelaySeconds = static_cast<unsigned>(maxReconnectDelaySeconds);
        std::shared_ptr<SyncProtocol> made = std::make_shared<MqttTransport>(options);
        return toHandle(new std::shared_ptr<SyncProtocol>(std::move(made)));
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_mqtt_MqttTransport_nativeConnect(JNIEnv* env, jclass,
                                                                                   jlong pointer, jboolean up) {
    nativeCall(env, [&] {
        if (up) {
            transport(pointer).connect();
        } else {
            transport(pointer).disconnect();
        }
    });
}

JNIEXPORT jboolean JNICALL Java_com_lumivale_tessarine_mqtt_MqttTransport_nativeIsConnected(JNIEnv* env, jclass,
                                                                                           jlong pointer) {
    return nativeCall(env, jboolean{JNI_FALSE}, [&] {
        return transport(pointer).isConnected() ? jboolean{JNI_TRUE} : jboolean{JNI_FALSE};
    });
}

}  // extern "C"
