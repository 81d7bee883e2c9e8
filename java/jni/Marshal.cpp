#include "Marshal.h"

#include <stdexcept>
#include <string>

#include "JniSupport.h"
#include "platform/Assert.h"

namespace lumivale {
namespace tessarine {
namespace jni {

namespace {

JavaClasses classes;

constexpr const char* kPackage = "com/lumivale/tessarine/";
// Every array element conversion runs in a frame of this many references.
constexpr jint kElementFrame = 16;

std::string className(const char* name) { return std::string(kPackage) + name; }

jmethodID method(JNIEnv* env, jclass type, const char* name, const char* signature) {
    jmethodID id = env->GetMethodID(type, name, signature);
    if (id == nullptr) lumivale::assertInternal("JNI method not found: %s%s", name, signature);
    return id;
}

jfieldID field(JNIEnv* env, jclass type, const char* name, const char* signature) {
    jfieldID id = env->GetFieldID(type, name, signature);
    if (id == nullptr) lumivale::assertInternal("JNI field not found: %s", name);
    return id;
}

jclass ours(JNIEnv* env, const char* name) { return findClass(env, className(name).c_str()); }

std::string stringField(JNIEnv* env, jobject object, jfieldID id) {
    auto text = static_cast<jstring>(env->GetObjectField(object, id));
    std::string result = toStdString(env, text);
    env->DeleteLocalRef(text);
    return result;
}

std::vector<unsigned char> bytesField(JNIEnv* env, jobject object, jfieldID id) {
    auto bytes = static_cast<jbyteArray>(env->GetObjectField(object, id));
    std::vector<unsigned char> result = toBytes(env, bytes);
    env->DeleteLocalRef(bytes);
    return result;
}

uint64_t unsignedField(JNIEnv* env, jobject object, jfieldID id) {
    return static_cast<uint64_t>(env->GetLongField(object, id));
}

jlong toJavaLong(uint64_t value) { return static_cast<jlong>(value); }

// A new object; an exception its constructor threw becomes a native one.
template <typename... Args>
jobject construct(JNIEnv* env, jclass type, jmethodID constructor, Args... args) {
    jobject result = env->NewObject(type, constructor, args...);
    rethrowAsNative(env, "a binding class constructor");
    return result;
}

// An array of type whose element i is convert(i), a local reference that is
// released once stored.
template <typename Convert>
jobjectArray makeArray(JNIEnv* env, jclass type, std::size_t count, Convert convert) {
    jobjectArray array = env->NewObjectArray(static_cast<jsize>(count), type, nullptr);
    rethrowAsNative(env, "a new array");
    for (std::size_t i = 0; i < count; ++i) {
        jobject element = convert(i);
        env->SetObjectArrayElement(array, static_cast<jsize>(i), element);
        env->DeleteLocalRef(element);
    }
    return array;
}

}  // namespace

void loadJavaClasses(JNIEnv* env) {
    JavaClasses& c = classes;
    c.change = ours(env, "Change");
    c.changeInit = method(env, c.change, "<init>", "(Ljava/lang/String;ILjava/lang/String;Ljava/lang/String;[BI)V");
    c.changeListenerOnChanges = method(env, ours(env, "ChangeListener"), "onChanges", "(Ljava/util/List;)V");
    c.arrays = findClass(env, "java/util/Arrays");
    c.arraysAsList = env->GetStaticMethodID(c.arrays, "asList", "([Ljava/lang/Object;)Ljava/util/List;");
    c.indexerIndex = method(env, ours(env, "Indexer"), "index",
                            "(Ljava/lang/String;Ljava/lang/String;Ljava/lang/String;[B)Ljava/util/List;");
    c.listToArray = method(env, findClass(env, "java/util/List"), "toArray", "()[Ljava/lang/Object;");
    jclass indexEntry = ours(env, "IndexEntry");
    c.indexEntryField = field(env, indexEntry, "field", "Ljava/lang/String;");
    c.indexEntryValue = field(env, indexEntry, "value", "Ljava/lang/String;");

    c.syncDelta = ours(env, "SyncDelta");
    c.syncDeltaInit = method(env, c.syncDelta, "<init>",
                             "(Ljava/lang/String;Ljava/lang/String;JLjava/lang/String;Ljava/lang/String;I[BJ)V");
    c.syncDeltaClientId = field(env, c.syncDelta, "clientId", "Ljava/lang/String;");
    c.syncDeltaCollectionName = field(env, c.syncDelta, "collectionName", "Ljava/lang/String;");
    c.syncDeltaVersionId = field(env, c.syncDelta, "versionId", "J");
    c.syncDeltaPrimaryKey = field(env, c.syncDelta, "primaryKey", "Ljava/lang/String;");
    c.syncDeltaSortKey = field(env, c.syncDelta, "sortKey", "Ljava/lang/String;");
    c.syncDeltaTypeValue = method(env, c.syncDelta, "typeValue", "()I");
    c.syncDeltaBlob = field(env, c.syncDelta, "blob", "[B");
    c.syncDeltaSequenceNumber = field(env, c.syncDelta, "sequenceNumber", "J");

    c.subscriptionRequest = ours(env, "SubscriptionRequest");
    c.subscriptionRequestInit = method(env, c.subscriptionRequest, "<init>", "([BLjava/lang/String;Ljava/lang/String;J)V");
    c.subscriptionVersion = field(env, c.subscriptionRequest, "version", "[B");
    c.subscriptionCollectionName = field(env, c.subscriptionRequest, "collectionName", "Ljava/lang/String;");
    c.subscriptionClientId = field(env, c.subscriptionRequest, "clientId", "Ljava/lang/String;");
    c.subscriptionSequenceNumber = field(env, c.subscriptionRequest, "sequenceNumber", "J");

    c.snapshot = ours(env, "Snapshot");
    c.snapshotInit = method(env, c.snapshot, "<init>",
                            "(Ljava/lang/String;[Lcom/lumivale/tessarine/SnapshotObject;JJ)V");
    c.snapshotCollectionName = field(env, c.snapshot, "collectionName", "Ljava/lang/String;");
    c.snapshotObjectArray = method(env, c.snapshot, "objectArray", "()[Lcom/lumivale/tessarine/SnapshotObject;");
    c.snapshotSequenceNumber = field(env, c.snapshot, "sequenceNumber", "J");
    c.snapshotVersionId = field(env, c.snapshot, "versionId", "J");
    c.snapshotObject = ours(env, "SnapshotObject");
    c.snapshotObjectInit = method(env, c.snapshotObject, "<init>", "(Ljava/lang/String;Ljava/lang/String;[B)V");
    c.snapshotObjectPrimaryKey = field(env, c.snapshotObject, "primaryKey", "Ljava/lang/String;");
    c.snapshotObjectSortKey = field(env, c.snapshotObject, "sortKey", "Ljava/lang/String;");
    c.snapshotObjectBlob = field(env, c.snapshotObject, "blob", "[B");

    c.serverMessage = ours(env, "Wire$ServerMessage");
    c.serverMessageInit = method(env, c.serverMessage, "<init>",
                                 "([Lcom/lumivale/tessarine/SyncDelta;Lcom/lumivale/tessarine/Snapshot;)V");
    c.transportEvents = ours(env, "TransportEvents");
    c.transportEventsInit = method(env, c.transportEvents, "<init>", "(J)V");
    jclass transport = ours(env, "SyncTransport");
    c.transportStart = method(env, transport, "start", "(Lcom/lumivale/tessarine/TransportEvents;)V");
    c.transportSendSubscriptionRequest =
        method(env, transport, "sendSubscriptionRequest", "(Lcom/lumivale/tessarine/SubscriptionRequest;)V");
    c.transportSendDelta = method(env, transport, "sendDelta", "(Lcom/lumivale/tessarine/SyncDelta;)I");
    c.transportSendSnapshotRequest =
        method(env, transport, "sendSnapshotRequest", "(Ljava/lang/String;Ljava/lang/String;)V");
}

const JavaClasses& javaClasses() { return classes; }

jobject toJava(JNIEnv* env, const SyncProtocol::Delta& delta) {
    LocalFrame frame(env, kElementFrame);
    jobject result = construct(env, classes.syncDelta, classes.syncDeltaInit, toJavaString(env, delta.clientId),
                               toJavaString(env, delta.collectionName), toJavaLong(delta.versionId),
                               toJavaString(env, delta.primaryKey), toJavaString(env, delta.sortKey),
                               static_cast<jint>(delta.type), toJavaBytes(env, delta.blob),
                               toJavaLong(delta.sequenceNumber));
    return frame.keep(result);
}

jobjectArray toJava(JNIEnv* env, const std::vector<SyncProtocol::Delta>& deltas) {
    return makeArray(env, classes.syncDelta, deltas.size(), [&](std::size_t i) { return toJava(env, deltas[i]); });
}

jobject toJava(JNIEnv* env, const SyncProtocol::Snapshot& snapshot) {
    LocalFrame frame(env, kElementFrame);
    jobjectArray objects = makeArray(env, classes.snapshotObject, snapshot.objects.size(), [&](std::size_t i) {
        const SyncProtocol::TessarineObject& object = snapshot.objects[i];
        LocalFrame element(env, kElementFrame);
        return element.keep(construct(env, classes.snapshotObject, classes.snapshotObjectInit,
                                      toJavaString(env, object.primaryKey), toJavaString(env, object.sortKey),
                                      toJavaBytes(env, object.blob)));
    });
    return frame.keep(construct(env, classes.snapshot, classes.snapshotInit, toJavaString(env, snapshot.collectionName),
                                objects, toJavaLong(snapshot.sequenceNumber), toJavaLong(snapshot.versionId)));
}

jobject toJava(JNIEnv* env, const SyncProtocol::SubscriptionRequest& request) {
    LocalFrame frame(env, kElementFrame);
    const auto* version = reinterpret_cast<const unsigned char*>(request.version.data());
    return frame.keep(construct(env, classes.subscriptionRequest, classes.subscriptionRequestInit,
                                toJavaBytes(env, version, request.version.size()),
                                toJavaString(env, request.collectionName), toJavaString(env, request.clientId),
                                toJavaLong(request.sequenceNumber)));
}

jobject changesToJava(JNIEnv* env, const std::vector<Delta>& changes) {
    LocalFrame frame(env, kElementFrame);
    jobjectArray array = makeArray(env, classes.change, changes.size(), [&](std::size_t i) {
        const Delta& change = changes[i];
        LocalFrame element(env, kElementFrame);
        return element.keep(construct(env, classes.change, classes.changeInit, toJavaString(env, change.collectionName),
                                      static_cast<jint>(change.type), toJavaString(env, change.primaryKey),
                                      toJavaString(env, change.sortKey), toJavaBytes(env, change.blob),
                                      static_cast<jint>(change.status)));
    });
    jobject list = env->CallStaticObjectMethod(classes.arrays, classes.arraysAsList, array);
    rethrowAsNative(env, "Arrays.asList");
    return frame.keep(list);
}

SyncProtocol::Delta deltaFromJava(JNIEnv* env, jobject delta) {
    SyncProtocol::Delta result;
    result.clientId = stringField(env, delta, classes.syncDeltaClientId);
    result.collectionName = stringField(env, delta, classes.syncDeltaCollectionName);
    result.versionId = unsignedField(env, delta, classes.syncDeltaVersionId);
    result.primaryKey = stringField(env, delta, classes.syncDeltaPrimaryKey);
    result.sortKey = stringField(env, delta, classes.syncDeltaSortKey);
    result.type = static_cast<SyncProtocol::DeltaType>(env->CallIntMethod(delta, classes.syncDeltaTypeValue));
    rethrowAsNative(env, "SyncDelta.typeValue");
    result.blob = bytesField(env, delta, classes.syncDeltaBlob);
    result.sequenceNumber = unsignedField(env, delta, classes.syncDeltaSequenceNumber);
    return result;
}

std::vector<SyncProtocol::Delta> deltasFromJava(JNIEnv* env, jobjectArray deltas) {
    std::vector<SyncProtocol::Delta> result;
    jsize count = env->GetArrayLength(deltas);
    result.reserve(static_cast<std::size_t>(count));
    for (jsize i = 0; i < count; ++i) {
        LocalFrame frame(env, kElementFrame);
        result.push_back(deltaFromJava(env, env->GetObjectArrayElement(deltas, i)));
    }
    return result;
}

SyncProtocol::Snapshot snapshotFromJava(JNIEnv* env, jobject snapshot) {
    SyncProtocol::Snapshot result;
    result.collectionName = stringField(env, snapshot, classes.snapshotCollectionName);
    result.sequenceNumber = unsignedField(env, snapshot, classes.snapshotSequenceNumber);
    result.versionId = unsignedField(env, snapshot, classes.snapshotVersionId);
    LocalFrame frame(env, kElementFrame);
    auto objects = static_cast<jobjectArray>(env->CallObjectMethod(snapshot, classes.snapshotObjectArray));
    rethrowAsNative(env, "Snapshot.objectArray");
    jsize count = env->GetArrayLength(objects);
    result.objects.reserve(static_cast<std::size_t>(count));
    for (jsize i = 0; i < count; ++i) {
        LocalFrame element(env, kElementFrame);
        jobject object = env->GetObjectArrayElement(objects, i);
        result.objects.push_back({stringField(env, object, classes.snapshotObjectPrimaryKey),
                                  stringField(env, object, classes.snapshotObjectSortKey),
                                  bytesField(env, object, classes.snapshotObjectBlob)});
    }
    return result;
}

SyncProtocol::SubscriptionRequest subscriptionFromJava(JNIEnv* env, jobject request) {
    SyncProtocol::SubscriptionRequest result;
    std::vector<unsigned char> version = bytesField(env, request, classes.subscriptionVersion);
    result.version.assign(version.begin(), version.end());
    result.collectionName = stringField(env, request, classes.subscriptionCollectionName);
    result.clientId = stringField(env, request, classes.subscriptionClientId);
    result.sequenceNumber = unsignedField(env, request, classes.subscriptionSequenceNumber);
    return result;
}

SyncProtocol::DeltaStatus deltaStatusFromJava(int value) {
    if (value < 1 || value > 3) throw std::invalid_argument("unknown status: " + std::to_string(value));
    return static_cast<SyncProtocol::DeltaStatus>(value);
}

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
