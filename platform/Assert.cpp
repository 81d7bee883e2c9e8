#include "platform/Assert.h"

#include <cstdarg>
#include <cstdlib>

#include "platform/Log.h"

namespace lumivale {

void assertInternal(const char* format, ...) {
    va_list args;
    va_start(args, format);
    lv_vprintLog(LogPriority::kFatal, "tessarine", format, args);
    va_end(args);
    std::abort();
}

}  // namespace lumivale
