// Reporting of broken internal invariants.
//
// lumivale::assertInternal formats its message like printf, logs it at
// priority 7 (fatal) with the tag "tessarine" and aborts the process. It is
// only for conditions that no input from the application or the wire can
// cause; bad input gets an error instead. Safe to call from any thread.
#pragma once

namespace lumivale {

[[noreturn]] void assertInternal(const char* format, ...)
#if defined(__GNUC__) || defined(__clang__)
    __attribute__((format(printf, 1, 2)))
#endif
    ;

}  // namespace lumivale
