// Logging for the whole library.
//
// lv_printLog formats like printf and writes one line at an Android log
// priority (2 verbose ... 7 fatal; lumivale::LogPriority names them). On Android it goes to the Android log;
// elsewhere it goes to standard error as "<letter>/<tag>: <message>", with the
// letters V D I W E F for the priorities 2 to 7.
//
// lumivale::setLogSink routes every line to an application function instead
// (on Android too); an empty function restores the default. The sink may be
// called from any thread, several at once, and may itself log. Safe to call
// from any thread.
#pragma once

#include <stdarg.h>

#ifdef __cplusplus
#include <functional>
#include <string>
extern "C" {
#endif

void lv_printLog(int priority, const char* tag, const char* format, ...)
#if defined(__GNUC__) || defined(__clang__)
    __attribute__((format(printf, 3, 4)))
#endif
    ;

// The same with the arguments already collected, for other variadic loggers.
void lv_vprintLog(int priority, const char* tag, const char* format, va_list args);

#ifdef __cplusplus
}  // extern "C"

namespace lumivale {

// The Android log priorities, as lv_printLog takes them.
namespace LogPriority {
constexpr int kVerbose = 2;
constexpr int kDebug = 3;
constexpr int kInfo = 4;
constexpr int kWarn = 5;
constexpr int kError = 6;
constexpr int kFatal = 7;
}  // namespace LogPriority

using LogSink = std::function<void(int priority, const std::string& tag, const std::string& message)>;

void setLogSink(LogSink sink);

}  // namespace lumivale
#endif
