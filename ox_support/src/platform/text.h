// Small text helpers that do not depend on the locale.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

// ASCII only, as for protocol words and option names.
char ToLower(char c);
std::string ToLower(std::string_view text);
bool EqualNoCase(std::string_view a, std::string_view b);
bool StartsWithNoCase(std::string_view text, std::string_view prefix);

// An ASCII control character: below the blank, or DEL.
bool IsControl(char c);

// Signed, with lower-case digits. The radix is 2 to 36; any other gives the empty text.
std::string IntToText(std::int64_t value, int radix = 10);

// Copies as much of the text as fits `size` bytes with the terminating NUL, which is always written (unless size is
// 0). False when the text was cut.
bool CopyText(char* to, std::size_t size, std::string_view text);

// The C library's text for an error number, without its locks: safe after fork and in handlers.
const char* GetLastErrorText(int errorNumber);
