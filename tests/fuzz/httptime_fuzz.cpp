// HTTP dates: any text is read without harm; a date that was written is read as itself.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>

#include "protocol/httptime.h"

namespace {
constexpr std::int64_t MAX_VALUE = std::numeric_limits<std::int32_t>::max();

void Require(bool holds) {
    if (!holds)
        std::abort();
}

void CheckWritten(std::time_t value) {
    std::string text;
    oxHttpTime(value).Format(text);
    Require(text.size() == std::strlen("Sun, 06 Nov 1994 08:49:37 GMT"));
    Require(oxHttpTime(text).Value() == value);
    Require(oxHttpTime(text.substr(0, text.size() - 1)).Value() == 0);
}

void CheckText(const std::string& text) {
    const oxHttpTime time(text);
    Require(oxHttpTime(text.c_str()).Value() == time.Value());
    if (text.size() < 23)
        Require(time.Value() == 0);
    char buffer[oxHttpTime::FORMAT_BYTES];
    Require(time.Format(buffer) == std::strlen(buffer));
    if (time.Value() >= 0 && time.Value() <= MAX_VALUE)
        CheckWritten(time.Value());

    const int day = oxHttpTime::DayFromName(text.c_str());
    const int month = oxHttpTime::MonthFromName(text.c_str());
    Require(day >= 0 && day <= 7);
    Require((month >= 0 && month <= 11) || month == 13);
}
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    CheckText(std::string(reinterpret_cast<const char*>(data), size));
    std::uint32_t number = 0;
    std::memcpy(&number, data, std::min(size, sizeof number));
    CheckWritten(static_cast<std::time_t>(number & static_cast<std::uint32_t>(MAX_VALUE)));
    return 0;
}
