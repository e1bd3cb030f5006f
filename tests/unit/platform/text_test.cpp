#include "platform/text.h"

#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <limits>

TEST(Text, ToLowerTouchesAsciiOnly) {
    EXPECT_EQ('a', ToLower('A'));
    EXPECT_EQ('z', ToLower('Z'));
    EXPECT_EQ('@', ToLower('@'));
    EXPECT_EQ('[', ToLower('['));
    EXPECT_EQ('\xC4', ToLower('\xC4'));
    EXPECT_EQ("abc-\xC4 09", ToLower("aBC-\xC4 09"));
    EXPECT_EQ("", ToLower(""));
}

TEST(Text, EqualNoCase) {
    struct Case {
        std::string_view a;
        std::string_view b;
        bool equal;
    };
    constexpr Case CASES[] = {
        {"", "", true},    {"start", "START", true}, {"start", "starts", false}, {"starts", "start", false},
        {"a", "b", false}, {"\xE4", "\xC4", false},  {"@", "`", false},          {"[", "{", false},
    };
    for (const Case& c : CASES)
        EXPECT_EQ(c.equal, EqualNoCase(c.a, c.b)) << c.a << " " << c.b;
}

TEST(Text, StartsWithNoCase) {
    struct Case {
        std::string_view text;
        std::string_view prefix;
        bool starts;
    };
    constexpr Case CASES[] = {
        {"STARTNOW", "start", true}, {"start", "START", true}, {"star", "start", false},
        {"", "start", false},        {"x", "", true},          {"xstart", "start", false},
    };
    for (const Case& c : CASES)
        EXPECT_EQ(c.starts, StartsWithNoCase(c.text, c.prefix)) << c.text << " " << c.prefix;
}

TEST(Text, IntToText) {
    struct Case {
        std::int64_t value;
        int radix;
        const char* text;
    };
    constexpr Case CASES[] = {
        {0, 10, "0"},
        {-1, 10, "-1"},
        {255, 16, "ff"},
        {-255, 16, "-ff"},
        {5, 2, "101"},
        {35, 36, "z"},
        {1, 1, ""},
        {1, 37, ""},
        {1, 0, ""},
        {1, -10, ""},
        {std::numeric_limits<std::int64_t>::max(), 10, "9223372036854775807"},
        {std::numeric_limits<std::int64_t>::min(), 10, "-9223372036854775808"},
    };
    for (const Case& c : CASES)
        EXPECT_EQ(c.text, IntToText(c.value, c.radix)) << c.value << " " << c.radix;
    EXPECT_EQ("-1" + std::string(63, '0'), IntToText(std::numeric_limits<std::int64_t>::min(), 2));
    EXPECT_EQ("42", IntToText(42));
}

TEST(Text, CopyTextAlwaysEndsTheTextAndTellsWhetherItWasCut) {
    struct Case {
        std::size_t size;
        std::string_view text;
        const char* copied;
        bool whole;
    };
    constexpr Case CASES[] = {
        {8, "abc", "abc", true}, {4, "abc", "abc", true}, {3, "abc", "ab", false},
        {1, "abc", "", false},   {1, "", "", true},
    };
    for (const Case& c : CASES) {
        std::array<char, 9> buffer;
        buffer.fill('#');
        EXPECT_EQ(c.whole, CopyText(buffer.data(), c.size, c.text)) << c.size << c.text;
        EXPECT_STREQ(c.copied, buffer.data());
        EXPECT_EQ('#', buffer[c.size]) << "nothing behind the end is touched";
    }
    char untouched = '#';
    EXPECT_FALSE(CopyText(&untouched, 0, "a"));
    EXPECT_TRUE(CopyText(&untouched, 0, ""));
    EXPECT_EQ('#', untouched);
}

TEST(Text, GetLastErrorText) {
    EXPECT_STREQ("Success", GetLastErrorText(0));
    EXPECT_STREQ("No such file or directory", GetLastErrorText(ENOENT));
    EXPECT_STREQ("Permission denied", GetLastErrorText(EACCES));
    EXPECT_STREQ("Unknown error 99999", GetLastErrorText(99999));
    EXPECT_STREQ("Unknown error -1", GetLastErrorText(-1));
    EXPECT_STREQ("Unknown error -2147483648", GetLastErrorText(std::numeric_limits<int>::min()));
}

TEST(Text, ControlCharactersAreThoseBelowTheBlankAndDelete) {
    for (int byte = 0; byte < 256; ++byte)
        EXPECT_EQ(IsControl(static_cast<char>(byte)), byte < 32 || byte == 127) << byte;
}
