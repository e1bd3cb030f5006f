#include "protocol/base64.h"

#include <cstring>

const char oxBase64::base_64_encode_table[65] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// clang-format off
const std::uint32_t oxBase64::base64_decode_table[256] = {
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 62, 64, 64, 64, 63,
    52, 53, 54, 55, 56, 57, 58, 59, 60, 61, 64, 64, 64, 64, 64, 64,
    64,  0,  1,  2,  3,  4,  5,  6,  7,  8,  9, 10, 11, 12, 13, 14,
    15, 16, 17, 18, 19, 20, 21, 22, 23, 24, 25, 64, 64, 64, 64, 64,
    64, 26, 27, 28, 29, 30, 31, 32, 33, 34, 35, 36, 37, 38, 39, 40,
    41, 42, 43, 44, 45, 46, 47, 48, 49, 50, 51, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
    64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64, 64,
};
// clang-format on

void oxBase64::EncodeBlock(const unsigned char in[3], char out[4]) {
    out[0] = base_64_encode_table[in[0] >> 2];
    out[1] = base_64_encode_table[(in[0] & 0x03) << 4 | in[1] >> 4];
    out[2] = base_64_encode_table[(in[1] & 0x0f) << 2 | in[2] >> 6];
    out[3] = base_64_encode_table[in[2] & 0x3f];
}

void oxBase64::Encode(const void* in, std::size_t length, char* out) {
    const auto* bytes = static_cast<const unsigned char*>(in);
    for (; length > 2; length -= 3, bytes += 3, out += 4)
        EncodeBlock(bytes, out);
    if (length > 0) {
        unsigned char rest[3] = {};
        std::memcpy(rest, bytes, length);
        EncodeBlock(rest, out);
        std::memset(out + 1 + length, '=', 3 - length);
        out += 4;
    }
    *out = '\0';
}

std::string oxBase64::Encode(std::string_view bytes) {
    std::string text(4 * ((bytes.size() + 2) / 3), '\0');
    Encode(bytes.data(), bytes.size(), text.data());  // its terminator falls on the string's own
    return text;
}

std::string oxBase64::Decode(std::string_view text) {
    text = text.substr(0, text.find('\0'));
    while (text.starts_with(' ') || text.starts_with('\t'))
        text.remove_prefix(1);
    // A last group that is not whole runs into the bytes behind the Base64 text; behind the end there is none.
    const auto value = [text](std::size_t at) {
        return at < text.size() ? base64_decode_table[static_cast<unsigned char>(text[at])] : NOT_BASE64;
    };

    std::size_t count = 0;
    while (value(count) != NOT_BASE64)
        ++count;

    std::string bytes;
    bytes.reserve((count + 3) / 4 * 3);
    std::size_t at = 0;
    for (; at < count; at += 4) {
        const std::uint32_t c1 = value(at), c2 = value(at + 1), c3 = value(at + 2), c4 = value(at + 3);
        bytes += static_cast<char>(static_cast<unsigned char>(c1 << 2 | c2 >> 4));
        bytes += static_cast<char>(static_cast<unsigned char>(c2 << 4 | c3 >> 2));
        bytes += static_cast<char>(static_cast<unsigned char>(c3 << 6 | c4));
    }
    // The third character of a group that is not whole tells one byte from two.
    if (count % 4 != 0)
        bytes.resize(bytes.size() - (value(at - 2) == NOT_BASE64 ? 2 : 1));
    return bytes;
}
