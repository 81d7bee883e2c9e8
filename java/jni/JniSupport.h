// The JNI plumbing shared by the binding's native code: the Java VM, threads
// attached to it, references, strings and bytes, and exceptions in both
// directions.
//
// Threads: env() may be called on any thread. A thread the JVM does not know
// (the store's worker, a native transport's delivery thread) is attached, as
// a daemon, on its first call and detached when it ends, by a thread-local
// guard; threads the JVM attached itself are left alone.
//
// References: every jobject a function here returns is a local reference of
// the calling frame; callers that make references in a loop wrap each turn
// in a LocalFrame. GlobalRef owns one global reference and deletes it in its
// destructor, on whatever thread that runs.
//
// Exceptions: Java to native, takeJavaException() clears a pending Java
// exception and logs it (priority 5, tag "tessarine_jni"); rethrowAsNative()
// then throws JavaCallbackError, so that the store treats a throwing Java
// callback as it treats a throwing native one. Native to Java,
// throwToJava() turns the exception being handled into a pending Java
// exception: TessarineException for the library's own errors,
// IllegalArgumentException for std::invalid_argument (a null string, an
// unknown status number), OutOfMemoryError for std::bad_alloc.
#pragma once

#include <jni.h>

#include <cstddef>
#include <stdexcept>
#include <string>
#include <vector>

namespace lumivale {
namespace tessarine {
namespace jni {

constexpr const char* kLogTag = "tessarine_jni";
constexpr jint kJniVersion = JNI_VERSION_1_8;

// setJavaVm is called once from JNI_OnLoad, releaseClasses from
// JNI_OnUnload; env() is valid in between.
void setJavaVm(JavaVM* vm);
void releaseClasses(JNIEnv* env);
JNIEnv* env();

// A Java exception thrown by application code that the binding called.
class JavaCallbackError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

// True when an exception was pending; it is logged with what and cleared.
bool takeJavaException(JNIEnv* env, const char* what);
// takeJavaException, then JavaCallbackError when there was one.
void rethrowAsNative(JNIEnv* env, const char* what);
// For a catch (...) block of a native method: makes the exception being
// handled the pending Java exception.
void throwToJava(JNIEnv* env) noexcept;
void throwJava(JNIEnv* env, const char* className, const std::string& message) noexcept;

class GlobalRef {
public:
    GlobalRef(JNIEnv* env, jobject object);
    ~GlobalRef();
    GlobalRef(const GlobalRef&) = delete;
    GlobalRef& operator=(const GlobalRef&) = delete;

    jobject get() const { return object; }
    jclass asClass() const { return static_cast<jclass>(object); }

private:
    jobject object;
};

// PushLocalFrame on construction, PopLocalFrame on destruction: every local
// reference made in between is released, except the one passed to keep(),
// which pops the frame early and returns that object as a reference of the
// enclosing frame.
class LocalFrame {
public:
    LocalFrame(JNIEnv* env, jint capacity);
    ~LocalFrame();
    LocalFrame(const LocalFrame&) = delete;
    LocalFrame& operator=(const LocalFrame&) = delete;

    jobject keep(jobject result);

private:
    JNIEnv* env;
    bool popped = false;
};

// Java strings cross as UTF-8 (bytes that are not valid UTF-8 arrive as
// U+FFFD). A null jstring is rejected with std::invalid_argument.
std::string toStdString(JNIEnv* env, jstring text);
jstring toJavaString(JNIEnv* env, const std::string& text);
std::vector<unsigned char> toBytes(JNIEnv* env, jbyteArray bytes);
jbyteArray toJavaBytes(JNIEnv* env, const unsigned char* data, std::size_t size);
jbyteArray toJavaBytes(JNIEnv* env, const std::vector<unsigned char>& bytes);
std::vector<std::string> toStdStrings(JNIEnv* env, jobjectArray strings);

// Loads a class through the class loader of the library's own classes (only
// valid during JNI_OnLoad) and keeps a global reference to it until
// releaseClasses.
jclass findClass(JNIEnv* env, const char* name);

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
