#include "protocol/base64.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>

using namespace std::string_view_literals;

namespace {
// Decodes from a block of exactly the text's bytes, so that a sanitizer sees every read behind them.
std::string DecodeExact(std::string_view text) {
    const auto block = std::make_unique<char[]>(text.size());
    std::copy(text.begin(), text.end(), block.get());
    return oxBase64::Decode(std::string_view(block.get(), text.size()));
}

std::string AllBytes() {
    std::string bytes;
    for (int byte = 0; byte < 256; ++byte)
        bytes += static_cast<char>(byte);
    return bytes;
}
}  // namespace

TEST(OxBase64, TablesAreEachOthersInverse) {
    EXPECT_STREQ("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/", oxBase64::base_64_encode_table);
    for (unsigned byte = 0; byte < 256; ++byte) {
        const auto* at = byte == 0 ? nullptr : std::strchr(oxBase64::base_64_encode_table, static_cast<int>(byte));
        const auto expected = at == nullptr ? 64u : static_cast<std::uint32_t>(at - oxBase64::base_64_encode_table);
        EXPECT_EQ(expected, oxBase64::base64_decode_table[byte]) << byte;
    }
}

TEST(OxBase64, EncodeBlockTakesSixBitsEach) {
    static const struct {
        unsigned char in[3];
        const char* out;
    } CASES[] = {
        {{0, 0, 0}, "AAAA"},
        {{255, 255, 255}, "////"},
        {{'a', 'b', 'c'}, "YWJj"},
        {{0x04, 0x20, 0xc4}, "BCDE"},
    };
    for (const auto& c : CASES) {
        char out[5] = "";
        oxBase64::EncodeBlock(c.in, out);
        EXPECT_STREQ(c.out, out);
    }
}

TEST(OxBase64, EncodeFillsTheLastGroup) {
    static const struct {
        std::string_view bytes;
        std::string_view text;
    } CASES[] = {
        {"", ""},
        {"a", "YQ=="},
        {"ab", "YWI="},
        {"abc", "YWJj"},
        {"abcd", "YWJjZA=="},
        {"user:pass", "dXNlcjpwYXNz"},
        {":", "Og=="},
        {"Aladdin:open sesame", "QWxhZGRpbjpvcGVuIHNlc2FtZQ=="},
        {"\0"sv, "AA=="},
        {"\xff\xfe"sv, "//4="},
        {"\xfb\xef\xbe"sv, "++++"},
    };
    for (const auto& c : CASES) {
        EXPECT_EQ(c.text, oxBase64::Encode(c.bytes));
        const void* const bytes = c.bytes.data();
        EXPECT_EQ(c.text, oxBase64::Encode(bytes, c.bytes.size()));
        const std::size_t room = 4 * ((c.bytes.size() + 2) / 3) + 1;
        const auto out = std::make_unique<char[]>(room);
        std::memset(out.get(), '#', room);
        oxBase64::Encode(c.bytes.data(), c.bytes.size(), out.get());
        EXPECT_EQ(c.text, out.get());
        EXPECT_EQ(room - 1, std::strlen(out.get()));
    }
}

TEST(OxBase64, DecodeReadsToTheFirstForeignByte) {
    static const struct {
        std::string_view text;
        std::string_view bytes;
    } CASES[] = {
        {"", ""},
        {"=", ""},
        {"====", ""},
        {"  \t ", ""},
        {"!YWJj", ""},
        {"\nYWJj", ""},
        // Whole groups.
        {"YWJj", "abc"},
        {" \t YWJj", "abc"},
        {"YWJjZGVm", "abcdef"},
        {"YWJj\r\nZGVm", "abc"},
        {"YWJj ZGVm", "abc"},
        {"YWJj=ZGVm", "abc"},
        {"YWJj\0ZGVm"sv, "abc"},
        {"AAAA", "\0\0\0"sv},
        {"////", "\xff\xff\xff"},
        // Two characters over: one byte, with and without padding.
        {"YQ==", "a"},
        {"YQ", "a"},
        {"YQ=", "a"},
        {"YQ\r\n", "a"},
        {"YQ\0xx"sv, "a"},
        {"QWxhZGRpbjpvcGVuIHNlc2FtZQ==", "Aladdin:open sesame"},
        {"QWxhZGRpbjpvcGVuIHNlc2FtZQ", "Aladdin:open sesame"},
        // Three characters over: two bytes.
        {"YWI=", "ab"},
        {"YWI", "ab"},
        {"YWI\n", "ab"},
        {"YWJjZGU=", "abcde"},
        {"YWJjZGU", "abcde"},
        // One character over: one byte, into which the mark of the missing second one reaches.
        {"A", "\x04"},
        {"Q", "\x44"},
        {"Q=", "\x44"},
        {"Q==", "\x44"},
        {"Q===", "\x44"},
        {"/", "\xfc"},
        {"YWJjQ", "abc\x44"},
        // Bytes behind the stop belong to the last group: a character in the third place makes it two bytes.
        {"Q=A", "\x44\x00"sv},
        {"Q=B=", "\x44\x00"sv},
        {"Q=/=", "\x44\x0f"},
        {"QQ=A", "A"},
        {"Q A", "\x44\x00"sv},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(c.bytes, DecodeExact(c.text)) << c.text;
}

TEST(OxBase64, EveryLengthComesBackWithAndWithoutPadding) {
    const std::string all = AllBytes();
    for (std::size_t length = 0; length <= all.size(); ++length) {
        const std::string bytes = all.substr(all.size() - length);
        std::string text = oxBase64::Encode(bytes);
        EXPECT_EQ(bytes, DecodeExact(text)) << length;
        while (text.ends_with('='))
            text.pop_back();
        EXPECT_EQ(bytes, DecodeExact(text)) << length;
    }
}
