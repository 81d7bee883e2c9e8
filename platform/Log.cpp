#include "platform/Log.h"

#include <cstdarg>
#include <cstdio>
#include <memory>
#include <mutex>
#include <vector>

// On Android lines go to the Android log. TESSARINE_ANDROID_LOG takes that
// path in a host build too, linked to a host liblog, to test it.
#if defined(__ANDROID__) || defined(TESSARINE_ANDROID_LOG)
#define TESSARINE_LOG_TO_ANDROID 1
#include <android/log.h>
#endif

namespace {

// The sink is replaced rarely and read on every line, so readers take a
// shared_ptr copy under the lock and call it after releasing the lock: a
// sink that logs, or a setLogSink racing a log line, cannot deadlock.
std::mutex& sinkMutex() {
    static std::mutex mutex;
    return mutex;
}

std::shared_ptr<const lumivale::LogSink>& sinkSlot() {
    static std::shared_ptr<const lumivale::LogSink> sink;
    return sink;
}

std::shared_ptr<const lumivale::LogSink> currentSink() {
    std::lock_guard<std::mutex> lock(sinkMutex());
    return sinkSlot();
}

std::string formatMessage(const char* format, va_list args) {
    va_list measure;
    va_copy(measure, args);
    int length = std::vsnprintf(nullptr, 0, format, measure);
    va_end(measure);
    if (length < 0) return format;
    std::vector<char> buffer(static_cast<size_t>(length) + 1);
    std::vsnprintf(buffer.data(), buffer.size(), format, args);
    return std::string(buffer.data(), static_cast<size_t>(length));
}

#ifndef TESSARINE_LOG_TO_ANDROID
char priorityLetter(int priority) {
    static const char letters[] = "VDIWEF";
    return priority >= 2 && priority <= 7 ? letters[priority - 2] : '?';
}

void writeToStandardError(int priority, const char* tag, const std::string& message) {
    std::string line;
    line.reserve(message.size() + 16);
    line += priorityLetter(priority);
    line += '/';
    line += tag;
    line += ": ";
    line += message;
    line += '\n';
    // One write per line keeps lines from different threads whole.
    std::fwrite(line.data(), 1, line.size(), stderr);
}
#endif

}  // namespace

extern "C" void lv_vprintLog(int priority, const char* tag, const char* format, va_list args) {
    if (tag == nullptr) tag = "";
    if (format == nullptr) format = "";
    std::shared_ptr<const lumivale::LogSink> sink = currentSink();
    if (sink) {
        (*sink)(priority, tag, formatMessage(format, args));
        return;
    }
#ifdef TESSARINE_LOG_TO_ANDROID
    __android_log_vprint(priority, tag, format, args);
#else
    writeToStandardError(priority, tag, formatMessage(format, args));
#endif
}

extern "C" void lv_printLog(int priority, const char* tag, const char* format, ...) {
    va_list args;
    va_start(args, format);
    lv_vprintLog(priority, tag, format, args);
    va_end(args);
}

namespace lumivale {

void setLogSink(LogSink sink) {
    std::shared_ptr<const LogSink> replacement;
    if (sink) replacement = std::make_shared<const LogSink>(std::move(sink));
    std::lock_guard<std::mutex> lock(sinkMutex());
    sinkSlot().swap(replacement);
    // The previous sink is released here, after the swap; a line being
    // written through it keeps its own copy alive until it returns.
}

}  // namespace lumivale
