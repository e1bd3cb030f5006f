#include "support/logtext.h"

#include <gtest/gtest.h>

using namespace std::string_view_literals;

TEST(LogText, ControlBytesAreWrittenOut) {
    static const struct {
        std::string_view text;
        std::string_view log;
        std::string_view access;
    } CASES[] = {
        {"", "", ""},
        {"plain text", "plain text", "plain text"},
        {"domain\\account", "domain\\account", "domain\\account"},
        {"\\x0a", "\\x0a", "\\x0a"},
        {"x\n1.2.3.4 - root", "x\\x0a1.2.3.4 - root", "x\\x0a1.2.3.4 - root"},
        {"\r\n\t\x1b[31m", "\\x0d\\x0a\\x09\\x1b[31m", "\\x0d\\x0a\\x09\\x1b[31m"},
        {"a\0b"sv, "a\\x00b", "a\\x00b"},
        {"\x1f \x7e\x7f", "\\x1f ~\\x7f", "\\x1f ~\\x7f"},
        {"say \"GET\"", "say \"GET\"", "say \\x22GET\\x22"},
        {"\x80\xff\xc3\xa9", "\x80\xff\xc3\xa9", "\x80\xff\xc3\xa9"},
    };
    for (const auto& c : CASES) {
        EXPECT_EQ(c.log, LogText(c.text));
        EXPECT_EQ(c.access, AccessLogText(c.text));
    }
}

TEST(LogText, EveryByteHasItsForm) {
    for (int byte = 0; byte < 256; ++byte) {
        const std::string text(1, static_cast<char>(byte));
        char escape[8];
        std::snprintf(escape, sizeof escape, "\\x%02x", static_cast<unsigned>(byte));
        const bool isControl = byte < 32 || byte == 127;
        EXPECT_EQ(isControl ? escape : text, LogText(text)) << byte;
        EXPECT_EQ(isControl || byte == '"' ? escape : text, AccessLogText(text)) << byte;
    }
}
