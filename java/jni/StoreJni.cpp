// The native methods of the store's Java classes (Tessarine, Collection,
// Cursor) and the library's JNI_OnLoad. Each Java object owns one native
// object through its handle: a Tessarine*, a Collection*, a Cursor*, made
// here and deleted by the class's nativeRelease.
#include <jni.h>

#include <memory>
#include <string>
#include <thread>
#include <unordered_map>

#include "JavaTransport.h"
#include "JniSupport.h"
#include "Marshal.h"
#include "NativeCall.h"
#include "tessarine/Tessarine.h"

using lumivale::tessarine::Collection;
using lumivale::tessarine::CollectionStorage;
using lumivale::tessarine::Cursor;
using lumivale::tessarine::Delta;
using lumivale::tessarine::SyncProtocol;
using lumivale::tessarine::Tessarine;
using namespace lumivale::tessarine::jni;

namespace {

constexpr jint kCallFrame = 16;

// The store's worker is a plain thread; it attaches to the JVM the first
// time it calls a listener or an indexer and detaches when it ends.
class NativeThreadCreator : public ThreadCreator {
public:
    std::thread createThread(std::function<void()> body) override { return std::thread(std::move(body)); }
};

jlong openStore(JNIEnv* env, jstring path, std::shared_ptr<SyncProtocol> transport) {
    std::string file = toStdString(env, path);
    std::unique_ptr<Tessarine> store =
        Tessarine::open(file, std::move(transport), std::make_shared<NativeThreadCreator>());
    if (!store) throw std::runtime_error("Could not open the store at " + file + " (see the log)");
    return toHandle(store.release());
}

jlong cursorOrThrow(std::unique_ptr<Cursor> cursor, const char* what) {
    if (!cursor) throw std::runtime_error(std::string(what) + " failed (see the log)");
    return toHandle(cursor.release());
}

CollectionStorage::SortDirection toDirection(jint direction) {
    return direction == static_cast<jint>(CollectionStorage::SortDirection::ASCENDING)
               ? CollectionStorage::SortDirection::ASCENDING
               : CollectionStorage::SortDirection::DESCENDING;
}

// The application's Indexer called for one object; its entries become index rows.
std::unordered_multimap<std::string, std::string> callIndexer(jobject indexer, const std::string& collectionName,
                                                              const std::string& primaryKey,
                                                              const std::string& sortKey,
                                                              const std::vector<unsigned char>& blob) {
    JNIEnv* env = lumivale::tessarine::jni::env();
    const JavaClasses& classes = javaClasses();
    LocalFrame frame(env, kCallFrame);
    jobject list = env->CallObjectMethod(indexer, classes.indexerIndex, toJavaString(env, collectionName),
                                         toJavaString(env, primaryKey), toJavaString(env, sortKey),
                                         toJavaBytes(env, blob));
    rethrowAsNative(env, "an Indexer");
    if (list == nullptr) throw JavaCallbackError("an Indexer returned null");
    auto entries = static_cast<jobjectArray>(env->CallObjectMethod(list, classes.listToArray));
    rethrowAsNative(env, "the Indexer's list");
    std::unordered_multimap<std::string, std::string> result;
    jsize count = env->GetArrayLength(entries);
    for (jsize i = 0; i < count; ++i) {
        LocalFrame element(env, kCallFrame);
        jobject entry = env->GetObjectArrayElement(entries, i);
        if (entry == nullptr) throw JavaCallbackError("an Indexer returned a null entry");
        auto field = static_cast<jstring>(env->GetObjectField(entry, classes.indexEntryField));
        auto value = static_cast<jstring>(env->GetObjectField(entry, classes.indexEntryValue));
        result.emplace(toStdString(env, field), toStdString(env, value));
    }
    return result;
}

}  // namespace

extern "C" {

JNIEXPORT jint JNICALL JNI_OnLoad(JavaVM* vm, void*) {
    setJavaVm(vm);
    loadJavaClasses(env());
    return kJniVersion;
}

JNIEXPORT void JNICALL JNI_OnUnload(JavaVM*, void*) { releaseClasses(env()); }

// --- Tessarine ---------------------------------------------------------------

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Tessarine_nativeOpenWithJavaTransport(JNIEnv* env, jclass,
                                                                                          jstring path,
                                                                                          jobject transport) {
    return nativeCall(env, jlong{0}, [&] { return openStore(env, path, std::make_shared<JavaTransport>(env, transport)); });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Tessarine_nativeOpenWithNativeTransport(JNIEnv* env, jclass,
                                                                                            jstring path,
                                                                                            jlong transport) {
    return nativeCall(env, jlong{0},
                      [&] { return openStore(env, path, *fromHandle<std::shared_ptr<SyncProtocol>>(transport)); });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Tessarine_nativeAddChangeListener(JNIEnv* env, jclass,
                                                                                     jlong store, jobject listener) {
    nativeCall(env, [&] {
        auto held = std::make_shared<GlobalRef>(env, listener);
        fromHandle<Tessarine>(store)->addDeltaReceivedCallback([held](const std::vector<Delta>& changes) {
            JNIEnv* callEnv = lumivale::tessarine::jni::env();
            LocalFrame frame(callEnv, kCallFrame);
            callEnv->CallVoidMethod(held->get(), javaClasses().changeListenerOnChanges,
                                    changesToJava(callEnv, changes));
            rethrowAsNative(callEnv, "a ChangeListener");
        });
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Tessarine_nativeSetIndexer(JNIEnv* env, jclass, jlong store,
                                                                              jobject indexer) {
    nativeCall(env, [&] {
        if (indexer == nullptr) {
            fromHandle<Tessarine>(store)->setCollectionIndexerFunction(nullptr);
            return;
        }
        auto held = std::make_shared<GlobalRef>(env, indexer);
        fromHandle<Tessarine>(store)->setCollectionIndexerFunction(
            [held](const std::string& collectionName, const std::string& primaryKey, const std::string& sortKey,
                   const std::vector<unsigned char>& blob) {
                return callIndexer(held->get(), collectionName, primaryKey, sortKey, blob);
            });
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Tessarine_nativeStart(JNIEnv* env, jclass, jlong store) {
    nativeCall(env, [&] { fromHandle<Tessarine>(store)->start(); });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Tessarine_nativeSubscribeCollection(JNIEnv* env, jclass,
                                                                                        jlong store, jstring name) {
    return nativeCall(env, jlong{0}, [&] {
        std::string collectionName = toStdString(env, name);
        std::unique_ptr<Collection> collection = fromHandle<Tessarine>(store)->subscribeCollection(collectionName);
        if (!collection) {
            throw std::runtime_error("Could not subscribe to the collection " + collectionName + " (see the log)");
        }
        return toHandle(collection.release());
    });
}

JNIEXPORT jboolean JNICALL Java_com_lumivale_tessarine_Tessarine_nativeRemove(JNIEnv* env, jclass, jlong store) {
    return nativeCall(env, jboolean{JNI_FALSE}, [&] {
        return fromHandle<Tessarine>(store)->remove() ? jboolean{JNI_TRUE} : jboolean{JNI_FALSE};
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Tessarine_nativeRelease(JNIEnv*, jclass, jlong store) {
    delete fromHandle<Tessarine>(store);
}

// --- Collection --------------------------------------------------------------

JNIEXPORT jboolean JNICALL Java_com_lumivale_tessarine_Collection_nativeSave(JNIEnv* env, jclass, jlong collection,
                                                                             jstring primaryKey, jstring sortKey,
                                                                             jbyteArray blob) {
    return nativeCall(env, jboolean{JNI_FALSE}, [&] {
        bool saved = fromHandle<Collection>(collection)->saveObject(toStdString(env, primaryKey),
                                                                    toStdString(env, sortKey), toBytes(env, blob));
        return saved ? jboolean{JNI_TRUE} : jboolean{JNI_FALSE};
    });
}

JNIEXPORT jboolean JNICALL Java_com_lumivale_tessarine_Collection_nativeDelete(JNIEnv* env, jclass, jlong collection,
                                                                               jstring primaryKey) {
    return nativeCall(env, jboolean{JNI_FALSE}, [&] {
        bool deleted = fromHandle<Collection>(collection)->deleteObject(toStdString(env, primaryKey));
        return deleted ? jboolean{JNI_TRUE} : jboolean{JNI_FALSE};
    });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Collection_nativeGet(JNIEnv* env, jclass, jlong collection,
                                                                         jstring primaryKey) {
    return nativeCall(env, jlong{0}, [&] {
        return cursorOrThrow(fromHandle<Collection>(collection)->getObject(toStdString(env, primaryKey)), "get");
    });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Collection_nativeQuery(JNIEnv* env, jclass, jlong collection,
                                                                           jstring sortKey, jint limit,
                                                                           jint direction) {
    return nativeCall(env, jlong{0}, [&] {
        return cursorOrThrow(
            fromHandle<Collection>(collection)->query(toStdString(env, sortKey), limit, toDirection(direction)),
            "query");
    });
}

JNIEXPORT jlong JNICALL Java_com_lumivale_tessarine_Collection_nativeQueryWithIndex(
    JNIEnv* env, jclass, jlong collection, jstring indexQuery, jobjectArray args, jstring sortFieldName,
    jint direction, jint limit) {
    return nativeCall(env, jlong{0}, [&] {
        Collection* target = fromHandle<Collection>(collection);
        std::string query = toStdString(env, indexQuery);
        std::vector<std::string> arguments = toStdStrings(env, args);
        if (sortFieldName == nullptr) {
            return cursorOrThrow(target->queryWithIndex(query, arguments, limit), "queryWithIndex");
        }
        return cursorOrThrow(target->queryWithIndexSorted(query, arguments, toStdString(env, sortFieldName),
                                                          toDirection(direction), limit),
                             "queryWithIndex");
    });
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Collection_nativeRelease(JNIEnv*, jclass, jlong collection) {
    delete fromHandle<Collection>(collection);
}

// --- Cursor ------------------------------------------------------------------
// The Java class checks that a row is current before reading a field.

JNIEXPORT jboolean JNICALL Java_com_lumivale_tessarine_Cursor_nativeNext(JNIEnv*, jclass, jlong cursor) {
    return fromHandle<Cursor>(cursor)->step() ? JNI_TRUE : JNI_FALSE;
}

JNIEXPORT jstring JNICALL Java_com_lumivale_tessarine_Cursor_nativeString(JNIEnv* env, jclass, jlong cursor,
                                                                          jint field) {
    return nativeCall(env, jstring{nullptr}, [&] {
        Cursor* current = fromHandle<Cursor>(cursor);
        return toJavaString(env, field == 0 ? current->getPrimaryKey() : current->getSortKey());
    });
}

JNIEXPORT jbyteArray JNICALL Java_com_lumivale_tessarine_Cursor_nativeBlob(JNIEnv* env, jclass, jlong cursor) {
    return nativeCall(env, jbyteArray{nullptr}, [&] {
        auto blob = fromHandle<Cursor>(cursor)->getBlob();
        return toJavaBytes(env, blob.first, blob.second);
    });
}

JNIEXPORT jint JNICALL Java_com_lumivale_tessarine_Cursor_nativeStatus(JNIEnv*, jclass, jlong cursor) {
    return fromHandle<Cursor>(cursor)->getStatus();
}

JNIEXPORT void JNICALL Java_com_lumivale_tessarine_Cursor_nativeRelease(JNIEnv*, jclass, jlong cursor) {
    delete fromHandle<Cursor>(cursor);
}

}  // extern "C"
