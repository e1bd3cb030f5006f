#include "platform/text.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cstdio>
#include <cstring>

bool IsControl(char c) {
    constexpr char DELETE = 0x7f;
    return static_cast<unsigned char>(c) < ' ' || c == DELETE;
}

char ToLower(char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

std::string ToLower(std::string_view text) {
    std::string lower(text);
    for (char& c : lower)
        c = ToLower(c);
    return lower;
}

bool EqualNoCase(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(),
                      [](char left, char right) { return ToLower(left) == ToLower(right); });
}

bool StartsWithNoCase(std::string_view text, std::string_view prefix) {
    return EqualNoCase(text.substr(0, prefix.size()), prefix);
}

std::string IntToText(std::int64_t value, int radix) {
    constexpr int LOWEST_RADIX = 2;
    constexpr int HIGHEST_RADIX = 36;
    constexpr std::size_t MOST_CHARACTERS = 65;  // a sign and 64 binary digits
    if (radix < LOWEST_RADIX || radix > HIGHEST_RADIX)
        return {};
    std::array<char, MOST_CHARACTERS> digits;
    const auto result = std::to_chars(digits.data(), digits.data() + digits.size(), value, radix);
    return std::string(digits.data(), result.ptr);
}

bool CopyText(char* to, std::size_t size, std::string_view text) {
    if (size == 0)
        return text.empty();
    const std::size_t length = std::min(size - 1, text.size());
    std::memcpy(to, text.data(), length);
    to[length] = '\0';
    return length == text.size();
}

const char* GetLastErrorText(int errorNumber) {
    if (const char* text = strerrordesc_np(errorNumber))
        return text;
    constexpr std::size_t BUFFER_BYTES = 32;
    thread_local std::array<char, BUFFER_BYTES> unknown;
    std::snprintf(unknown.data(), unknown.size(), "Unknown error %d", errorNumber);
    return unknown.data();
}
