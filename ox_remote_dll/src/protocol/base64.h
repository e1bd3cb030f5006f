// Base64 with the alphabet of RFC 2045.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

class oxBase64 {
public:
    static const char base_64_encode_table[65];
    // The alphabet position of a byte; NOT_BASE64 for every byte outside the alphabet.
    static const std::uint32_t base64_decode_table[256];
    static constexpr std::uint32_t NOT_BASE64 = 64;

    static void EncodeBlock(const unsigned char in[3], char out[4]);
    // `out` holds at least 4 * ceil(length / 3) + 1 bytes; the text is zero-terminated.
    static void Encode(const void* in, std::size_t length, char* out);
    static std::string Encode(std::string_view bytes);
    static std::string Encode(const void* in, std::size_t length) {
        return Encode(std::string_view(static_cast<const char*>(in), length));
    }
    // Skips leading blanks and tabs and reads up to the first byte outside the alphabet; nothing is an error. Padding
    // is not needed. The result may hold any byte.
    static std::string Decode(std::string_view text);
};
