// Text from a client, made safe for a log line.
#pragma once

#include <string>
#include <string_view>

// Control bytes (below 0x20, and 0x7f) become `\xNN` with lower-case digits, so that one request is always one line and
// no line can be forged. Everything else, the backslash included, stays.
std::string LogText(std::string_view text);

// As LogText, and the double quote becomes `\x22`: for the fields of the access log, which it delimits.
std::string AccessLogText(std::string_view text);
