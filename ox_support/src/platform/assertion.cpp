#include "platform/assertion.h"

#undef NDEBUG  // the C library declares its function only without it
#include <cassert>

void oxAssertionFailed(const char* text, const char* file, unsigned line, const char* function) noexcept {
    __assert_fail(text, file, line, function);
}
