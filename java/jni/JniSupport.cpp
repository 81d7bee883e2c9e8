#include "JniSupport.h"

#include <cstdint>
#include <new>

#include "platform/Assert.h"
#include "platform/Log.h"

namespace lumivale {
namespace tessarine {
namespace jni {

namespace {

JavaVM* javaVm = nullptr;

// Detaches, when its thread ends, a thread that env() attached.
struct AttachedThread {
    bool attached = false;
    ~AttachedThread() {
        if (attached) javaVm->DetachCurrentThread();
    }
};
thread_local AttachedThread attachedThread;

// What the string and exception helpers use, looked up once in JNI_OnLoad.
struct Cache {
    jclass stringClass = nullptr;
    jmethodID stringFromBytes = nullptr;  // String(byte[], String charsetName)
    jmethodID stringGetBytes = nullptr;   // byte[] getBytes(String charsetName)
    jobject utf8Name = nullptr;           // "UTF-8", a global reference
    jmethodID throwableToString = nullptr;
    std::vector<jobject> classes;         // every class findClass kept
};
Cache cache;

// After a JNI call that allocates: a pending exception (OutOfMemoryError,
// or one thrown by a constructor) becomes std::bad_alloc.
void checkAllocation(JNIEnv* env) {
    if (env->ExceptionCheck()) {
        takeJavaException(env, "a JNI allocation");
        throw std::bad_alloc();
    }
}

}  // namespace

void setJavaVm(JavaVM* vm) {
    javaVm = vm;
    JNIEnv* e = env();
    cache.stringClass = findClass(e, "java/lang/String");
    cache.stringFromBytes = e->GetMethodID(cache.stringClass, "<init>", "([BLjava/lang/String;)V");
    cache.stringGetBytes = e->GetMethodID(cache.stringClass, "getBytes", "(Ljava/lang/String;)[B");
    jstring name = e->NewStringUTF("UTF-8");
    cache.utf8Name = e->NewGlobalRef(name);
    e->DeleteLocalRef(name);
    cache.throwableToString = e->GetMethodID(findClass(e, "java/lang/Throwable"), "toString", "()Ljava/lang/String;");
}

void releaseClasses(JNIEnv* env) {
    for (jobject held : cache.classes) env->DeleteGlobalRef(held);
    if (cache.utf8Name != nullptr) env->DeleteGlobalRef(cache.utf8Name);
    cache = Cache();
}

JNIEnv* env() {
    JNIEnv* current = nullptr;
    jint status = javaVm->GetEnv(reinterpret_cast<void**>(&current), kJniVersion);
    if (status == JNI_OK) return current;
    if (status != JNI_EDETACHED) lumivale::assertInternal("JNI GetEnv failed: %d", static_cast<int>(status));
    JavaVMAttachArgs args{kJniVersion, const_cast<char*>("tessarine-native"), nullptr};
    status = javaVm->AttachCurrentThreadAsDaemon(reinterpret_cast<void**>(&current), &args);
    if (status != JNI_OK) lumivale::assertInternal("JNI AttachCurrentThread failed: %d", static_cast<int>(status));
    attachedThread.attached = true;
    return current;
}

jclass findClass(JNIEnv* env, const char* name) {
    jclass local = env->FindClass(name);
    if (local == nullptr) lumivale::assertInternal("JNI class not found: %s", name);
    jobject global = env->NewGlobalRef(local);
    env->DeleteLocalRef(local);
    cache.classes.push_back(global);
    return static_cast<jclass>(global);
}

bool takeJavaException(JNIEnv* env, const char* what) {
    jthrowable thrown = env->ExceptionOccurred();
    if (thrown == nullptr) return false;
    env->ExceptionClear();
    std::string description = "(no description)";
    auto text = static_cast<jstring>(env->CallObjectMethod(thrown, cache.throwableToString));
    if (env->ExceptionCheck()) {
        env->ExceptionClear();
    } else if (text != nullptr) {
        const char* chars = env->GetStringUTFChars(text, nullptr);
        if (chars != nullptr) {
            description = chars;
            env->ReleaseStringUTFChars(text, chars);
        }
        env->DeleteLocalRef(text);
    }
    env->DeleteLocalRef(thrown);
    lv_printLog(5, kLogTag, "%s threw %s", what, description.c_str());
    return true;
}

void rethrowAsNative(JNIEnv* env, const char* what) {
    if (takeJavaException(env, what)) throw JavaCallbackError(std::string(what) + " threw a Java exception");
}

void throwJava(JNIEnv* env, const char* className, const std::string& message) noexcept {
    jclass type = env->FindClass(className);
    if (type == nullptr) return;  // FindClass left its own error pending
    env->ThrowNew(type, message.c_str());
    env->DeleteLocalRef(type);
}

void throwToJava(JNIEnv* env) noexcept {
    if (env->ExceptionCheck()) return;  // a Java exception is already on its way
    try {
        throw;
    } catch (const std::bad_alloc&) {
        throwJava(env, "java/lang/OutOfMemoryError", "out of native memory");
    } catch (const std::invalid_argument& e) {
        throwJava(env, "java/lang/IllegalArgumentException", e.what());
    } catch (const std::exception& e) {
        throwJava(env, "com/lumivale/tessarine/TessarineException", e.what());
    } catch (...) {
        throwJava(env, "com/lumivale/tessarine/TessarineException", "unknown native error");
    }
}

GlobalRef::GlobalRef(JNIEnv* env, jobject theObject) : object(env->NewGlobalRef(theObject)) {
    if (object == nullptr && theObject != nullptr) throw std::bad_alloc();
}

GlobalRef::~GlobalRef() {
    if (object != nullptr) env()->DeleteGlobalRef(object);
}

LocalFrame::LocalFrame(JNIEnv* theEnv, jint capacity) : env(theEnv) {
    if (env->PushLocalFrame(capacity) != 0) {
        env->ExceptionClear();
        throw std::bad_alloc();
    }
}

LocalFrame::~LocalFrame() {
    if (!popped) env->PopLocalFrame(nullptr);
}

jobject LocalFrame::keep(jobject result) {
    popped = true;
    return env->PopLocalFrame(result);
}

std::string toStdString(JNIEnv* env, jstring text) {
    if (text == nullptr) throw std::invalid_argument("a string is null");
    auto bytes = static_cast<jbyteArray>(env->CallObjectMethod(text, cache.stringGetBytes, cache.utf8Name));
    checkAllocation(env);
    std::vector<unsigned char> utf8 = toBytes(env, bytes);
    env->DeleteLocalRef(bytes);
    return std::string(utf8.begin(), utf8.end());
}

jstring toJavaString(JNIEnv* env, const std::string& text) {
    jbyteArray bytes = toJavaBytes(env, reinterpret_cast<const unsigned char*>(text.data()), text.size());
    auto result = static_cast<jstring>(env->NewObject(cache.stringClass, cache.stringFromBytes, bytes, cache.utf8Name));
    checkAllocation(env);
    env->DeleteLocalRef(bytes);
    return result;
}

std::vector<unsigned char> toBytes(JNIEnv* env, jbyteArray bytes) {
    if (bytes == nullptr) throw std::invalid_argument("a byte array is null");
    std::vector<unsigned char> result(static_cast<std::size_t>(env->GetArrayLength(bytes)));
    env->GetByteArrayRegion(bytes, 0, static_cast<jsize>(result.size()), reinterpret_cast<jbyte*>(result.data()));
    return result;
}

jbyteArray toJavaBytes(JNIEnv* env, const unsigned char* data, std::size_t size) {
    if (size > static_cast<std::size_t>(INT32_MAX)) throw std::length_error("blob too large for a Java array");
    jbyteArray result = env->NewByteArray(static_cast<jsize>(size));
    checkAllocation(env);
    if (size != 0) env->SetByteArrayRegion(result, 0, static_cast<jsize>(size), reinterpret_cast<const jbyte*>(data));
    return result;
}

jbyteArray toJavaBytes(JNIEnv* env, const std::vector<unsigned char>& bytes) {
    return toJavaBytes(env, bytes.data(), bytes.size());
}

std::vector<std::string> toStdStrings(JNIEnv* env, jobjectArray strings) {
    std::vector<std::string> result;
    if (strings == nullptr) return result;
    jsize count = env->GetArrayLength(strings);
    result.reserve(static_cast<std::size_t>(count));
    for (jsize i = 0; i < count; ++i) {
        auto element = static_cast<jstring>(env->GetObjectArrayElement(strings, i));
        result.push_back(toStdString(env, element));
        env->DeleteLocalRef(element);
    }
    return result;
}

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
