#include "support/logtext.h"

#include "platform/text.h"

namespace {
std::string Escape(std::string_view text, bool quotes) {
    static constexpr char DIGITS[] = "0123456789abcdef";
    std::string safe;
    safe.reserve(text.size());
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        if (IsControl(c) || (quotes && c == '"')) {
            safe += "\\x";
            safe += DIGITS[byte >> 4];
            safe += DIGITS[byte & 15];
        } else {
            safe += c;
        }
    }
    return safe;
}
}  // namespace

std::string LogText(std::string_view text) {
    return Escape(text, false);
}

std::string AccessLogText(std::string_view text) {
    return Escape(text, true);
}
