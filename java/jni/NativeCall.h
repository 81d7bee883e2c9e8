// The frame of every native method: runs its body and turns whatever the
// body throws into a pending Java exception (jni::throwToJava), returning
// the given failure value instead. No exception crosses into the JVM.
#pragma once

#include <jni.h>

#include <cstdint>

#include "JniSupport.h"

namespace lumivale {
namespace tessarine {
namespace jni {

template <typename Result, typename Body>
Result nativeCall(JNIEnv* env, Result failed, Body body) noexcept {
    try {
        return body();
    } catch (...) {
        throwToJava(env);
        return failed;
    }
}

template <typename Body>
void nativeCall(JNIEnv* env, Body body) noexcept {
    try {
        body();
    } catch (...) {
        throwToJava(env);
    }
}

// Native objects travel to Java as a long; through intptr_t, so that 32-bit
// ABIs convert between sizes explicitly.
template <typename T>
T* fromHandle(jlong pointer) {
    return reinterpret_cast<T*>(static_cast<std::intptr_t>(pointer));
}

template <typename T>
jlong toHandle(T* pointer) {
    return static_cast<jlong>(reinterpret_cast<std::intptr_t>(pointer));
}

}  // namespace jni
}  // namespace tessarine
}  // namespace lumivale
