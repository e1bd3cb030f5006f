#include "app/urltext.h"

#include <gtest/gtest.h>

#include <string>

using namespace std::string_literals;

namespace {

const struct {
    std::string text;
    std::string decoded;
} CASES[] = {
    {"", ""},
    {"plain", "plain"},
    {"a+b%3Dc", "a b=c"},
    {"+", " "},
    {"++a++", "  a  "},
    {"%2B", "+"},
    {"%2b+%2B", "+ +"},
    {"%41%4a%4A%5a", "AJJZ"},
    {"%aF%Fa", "\xaf\xfa"},
    {"%0D%0a", "\r\n"},
    {"%ff%80", "\xff\x80"},
    // One pass: what a decoded byte begins is not decoded again.
    {"%2541", "%41"},
    {"%25%34%31", "%41"},
    {"%252B", "%2B"},
    // A "%" without two digits stays.
    {"%", "%"},
    {"a%", "a%"},
    {"%4", "%4"},
    {"%4z", "%4z"},
    {"%z4", "%z4"},
    {"%g1%1G", "%g1%1G"},
    {"%%41", "%A"},
    {"%4%41", "%4A"},
    {"%+1", "% 1"},
    {"%4+", "%4 "},
    {"100%", "100%"},
    {"% 41", "% 41"},
    {"%-1", "%-1"},
    {"%0x41", "%0x41"},
    {"\xc3\xa9+%C3%A9", "\xc3\xa9 \xc3\xa9"},
    {"a=b&c=d", "a=b&c=d"},
};

std::string UpToNul(const std::string& text) {
    return text.c_str();
}

}  // namespace

TEST(DecodeUrlText, Decodes) {
    for (const auto& c : CASES) {
        EXPECT_EQ(DecodeUrlText(c.text), UpToNul(c.decoded)) << c.text;
    }
}

TEST(DecodeUrlText, DecodesInPlace) {
    for (const auto& c : CASES) {
        std::string buffer = c.text + '\0' + "behind";
        DecodeUrlTextInPlace(buffer.data());
        EXPECT_STREQ(buffer.c_str(), UpToNul(c.decoded).c_str()) << c.text;
        EXPECT_EQ(buffer.substr(c.text.size() + 1), "behind") << c.text;
    }
}

TEST(DecodeUrlText, DecodedNulEndsTheText) {
    for (const char* text : {"ab%00cd", "ab%00", "ab%00%00c"}) {
        EXPECT_EQ(DecodeUrlText(text), "ab") << text;
        std::string buffer = text;
        DecodeUrlTextInPlace(buffer.data());
        EXPECT_STREQ(buffer.c_str(), "ab") << text;
    }
    EXPECT_EQ(DecodeUrlText("%00"), "");
    EXPECT_EQ(DecodeUrlText("ab\0cd"s), "ab");
}

TEST(DecodeUrlText, BytesKeepTheNul) {
    EXPECT_EQ(DecodeUrlBytes("ab%00c+d"), "ab\0c d"s);
    EXPECT_EQ(DecodeUrlBytes("%00"), "\0"s);
    EXPECT_EQ(DecodeUrlBytes("a\0b"s), "a\0b"s);
    EXPECT_EQ(DecodeUrlBytes(""), "");
}

TEST(DecodeUrlText, EveryByteComesFromBothSpellings) {
    constexpr char UPPER[] = "0123456789ABCDEF";
    constexpr char LOWER[] = "0123456789abcdef";
    for (int byte = 0; byte < 256; ++byte) {
        for (const char* digits : {UPPER, LOWER}) {
            const std::string text{'%', digits[byte / 16], digits[byte % 16]};
            EXPECT_EQ(DecodeUrlBytes(text), std::string(1, static_cast<char>(byte))) << text;
        }
    }
}
