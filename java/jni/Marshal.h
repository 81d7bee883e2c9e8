// Converts the store's records to the binding's Java classes and back, and
// holds the classes, methods and fields of the com.lumivale.tessarine
// package that the native code uses, looked up once in JNI_OnLoad.
//
// Every function returns local references of the calling frame, making and
// releasing the per-element references itself. The Java classes check their
// fields for null in their constructors, so a record read from Java has none;
// a conversion fails with std::invalid_argument (an unknown enum number) or
// std::bad_alloc. Call only on a thread with a JNIEnv (jni::env()).
#pragma once

#include <jni.h>

#include <vector>

#include "tessarine/Delta.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {
namespace jni {

struct JavaClasses {
    jclass change;
    jmethodID changeInit;
    jmethodID changeListenerOnChanges;
    jclass arrays;
    jmethodID arraysAsList;
    jmethodID indexerIndex;
    jmethodID listToArray;
    jfieldID indexEntryField;
    jfieldID indexEntryValue;
    jclass syncDelta;
    jmethodID syncDeltaInit;
    jfieldID syncDeltaClientId;
    jfieldID syncDeltaCollectionName;
    jfieldID syncDeltaVersionId;
    jfieldID syncDeltaPrimaryKey;
    jfieldID syncDeltaSortKey;
    jmethodID syncDeltaTypeValue;
    jfieldID syncDeltaBlob;
    jfieldID syncDeltaSequenceNumber;
    jclass subscriptionRequest;
    jmethodID subscriptionRequestInit;
    jfieldID subscriptionVersion;
    jfieldID subscriptionCollectionName;
    jfieldID subscriptionClientId;
    jfieldID subscriptionSequenceNumber;
    jclass snapshot;
    jmethodID snapshotInit;
    jfieldID snapshotCollectionName;
    jmethodID snapshotObjectArray;
    jfieldID snapshotSequenceNumber;
    jfieldID snapshotVersionId;
    jclass snapshotObject;
    jmethodID snapshotObjectInit;
    jfieldID snapshotObjectPrimaryKey;
    jfieldID snapshotObjectSortKey;
    jfieldID snapshotObjectBlob;
    jclass serverMessage;
    jmethodID serverMessageInit;
    jclass transportEvents;
    jmethodID transportEventsInit;
    jmethodID transportStart;
    jmethodID transportSendSubscriptionRequest;
    jmethodID transportSendDelta;
    jmethodID transportSendSnapshotRequest;
};

// Looks everything up; assertInternal when the jar and the library differ.
void loadJavaClasses(JNIEnv* env);
const JavaClasses& javaClasses();

jobject toJava(JNIEnv* env, const SyncProtocol::Delta& delta);
jobjectArray toJava(JNIEnv* env, const std::vector<SyncProtocol::Delta>& deltas);
jobject toJava(JNIEnv* env, const SyncProtocol::Snapshot& snapshot);
jobject toJava(JNIEnv* env, const SyncProtocol::SubscriptionRequest& request);
// A java.util.List<Change>.
jobject changesToJava(JNIEnv* env, const std::vector<Delta>& changes);

SyncProtocol::Delta deltaFromJava(JNIEnv* env, jobject delta);
std::vector<SyncProtocol::Delta> deltasFromJava(JNIEnv* env, jobjectArray deltas);
SyncProtocol::Snapshot snapshotFromJava(JNIEnv* env, jobject snapshot);
SyncProtocol::SubscriptionRequest subscriptionFromJava(JNIEnv* env, jobject request);
SyncProtocol::DeltaStatus deltaStatusFromJava(int value);

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
