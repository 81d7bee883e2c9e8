// Reporting of broken internal invariants.
//
// lumivale::assertInternal formats its message like printf, logs it at
// priority 7 (fatal) with the tag "tessarine" and aborts the process. It is
// only for conditions that no input from the application or the wire can
// cause; bad input gets an error instead. Safe to call from any thread.
//
// LV_ASSERT_FAIL(source, format, ...) is how the library calls it: the
// message becomes "Assert (<source>:<line>): <message>", with the line of the
// call.
#pragma once

#define LV_ASSERT_FAIL(source, format, ...) \
    ::lumivale::assertInternal("Assert (%s:%d): " format, source, __LINE__, ##__VA_ARGS__)

namespace lumivale {

[[noreturn]] void assertInternal(const char* format, ...)
#if defined(__GNUC__) || defined(__clang__)
    __attribute__((format(printf, 1, 2)))
#endif
    ;

}  // namespace lumivale
