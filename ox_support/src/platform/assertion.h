// Assertions of programming errors that hold in every build type.
#pragma once

// Prints the C library's assertion line ("program: file:line: function: Assertion `text' failed.") on standard error
// and ends the process by SIGABRT, which no signal mask holds back.
[[noreturn]] void oxAssertionFailed(const char* text, const char* file, unsigned line, const char* function) noexcept;

// Says where and what in fixed words: administrators and scripts know these lines, so they do not follow the source.
#define OX_ASSERT_AT(condition, text, file, line, function) \
    ((condition) ? static_cast<void>(0) : oxAssertionFailed(text, file, line, function))
