#include "app/urltext.h"

#include <algorithm>
#include <cstddef>
#include <cstring>

namespace {

constexpr int NO_DIGIT = -1;

int HexValue(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return NO_DIGIT;
}

// Writes the decoded text, which is never longer, and gives its length. `to` may be the text itself.
std::size_t Decode(std::string_view text, char* to) {
    std::size_t length = 0;
    for (std::size_t i = 0; i < text.size(); ++i) {
        char c = text[i] == '+' ? ' ' : text[i];
        if (c == '%' && text.size() - i > 2) {
            const int high = HexValue(text[i + 1]);
            const int low = HexValue(text[i + 2]);
            if (high != NO_DIGIT && low != NO_DIGIT) {
                c = static_cast<char>(high * 16 + low);
                i += 2;
            }
        }
        to[length++] = c;
    }
    return length;
}

}  // namespace

std::string DecodeUrlText(std::string_view text) {
    std::string decoded = DecodeUrlBytes(text);
    decoded.resize(std::min(decoded.size(), decoded.find('\0')));
    return decoded;
}

void DecodeUrlTextInPlace(char* text) {
    text[Decode(std::string_view(text, std::strlen(text)), text)] = '\0';
}

std::string DecodeUrlBytes(std::string_view text) {
    std::string decoded(text.size(), '\0');
    decoded.resize(Decode(text, decoded.data()));
    return decoded;
}
