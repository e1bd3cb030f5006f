#include "protocol/httptime.h"

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <limits>
#include <string_view>

#include "platform/text.h"

std::atomic<bool> oxHttpTime::m_bTZSET{false};

namespace {
constexpr std::size_t NAME_LENGTH = 3;
constexpr std::size_t MIN_ASCTIME_LENGTH = 23;
constexpr std::size_t MIN_RFC_LENGTH = 29;
constexpr int MAX_DAY = 31;
constexpr int MAX_MONTH = 11;
constexpr int NO_DAY = 7;
constexpr int NO_MONTH = 13;
constexpr int FIRST_YEAR = 1900;    // year 0 of a broken-down time
constexpr int LAST_YEAR_2000 = 69;  // two-digit years up to here belong to the 2000s
constexpr int LAST_SHORT_YEAR = 99;

constexpr std::string_view DAYS[] = {"sun", "mon", "tue", "wed", "thu", "fri", "sat"};
constexpr std::string_view MONTHS[] = {"jan", "feb", "mar", "apr", "may", "jun",
                                       "jul", "aug", "sep", "oct", "nov", "dec"};

template <std::size_t SIZE>
int FindName(std::string_view text, const std::string_view (&names)[SIZE], int none) {
    const auto* found = std::find_if(std::begin(names), std::end(names), [text](std::string_view name) {
        return EqualNoCase(text.substr(0, NAME_LENGTH), name);
    });
    return found == std::end(names) ? none : static_cast<int>(found - names);
}

// A zero-terminated text, read by position. Behind its end every position reads as the terminator.
class DateText {
public:
    explicit DateText(const char* text) : m_text(text) {}

    std::size_t Length() const { return m_text.size(); }
    const char* At(std::size_t position) const { return m_text.data() + std::min(position, m_text.size()); }
    bool IsBlank(std::size_t position) const { return *At(position) == ' '; }
    bool IsDigit(std::size_t position) const { return *At(position) >= '0' && *At(position) <= '9'; }
    // The position behind the next blank; the end when there is none.
    std::size_t BehindBlank(std::size_t position) const {
        const std::size_t blank = m_text.find(' ', position);
        return blank == std::string_view::npos ? m_text.size() : blank + 1;
    }
    // 32 bits whatever the machine's long; what does not fit is the nearest number that does.
    int Number(std::size_t position) const {
        const std::int64_t value = std::strtol(At(position), nullptr, 10);
        return static_cast<int>(
            std::clamp<std::int64_t>(value, std::numeric_limits<int>::min(), std::numeric_limits<int>::max()));
    }

private:
    std::string_view m_text;
};

// "Nov  6 08:49:37 1994" at the position. The year stands last and is read with the clock time.
bool ReadAsctimeDate(const DateText& text, std::size_t at, std::tm& time, std::size_t& clock) {
    if (text.Length() < MIN_ASCTIME_LENGTH)
        return false;
    time.tm_mon = oxHttpTime::MonthFromName(text.At(at));
    if (time.tm_mon > MAX_MONTH)
        return false;
    at += 4;
    if (text.IsBlank(at))
        ++at;
    time.tm_mday = text.Number(at);
    clock = at + 2;
    if (text.IsBlank(clock))
        ++clock;
    return time.tm_mday <= MAX_DAY;
}

// "06 Nov 1994 08:49:37 GMT" or "06-Nov-94 08:49:37 GMT" at the position.
bool ReadRfcDate(const DateText& text, std::size_t at, std::tm& time, std::size_t& clock) {
    if (text.Length() < MIN_RFC_LENGTH)
        return false;
    time.tm_mday = text.Number(at);
    time.tm_mon = oxHttpTime::MonthFromName(text.At(at + 3));
    if (time.tm_mday > MAX_DAY || time.tm_mon > MAX_MONTH)
        return false;
    const int year = text.Number(at + 7);
    if (year <= LAST_YEAR_2000)
        time.tm_year = year + 100;
    else if (year <= LAST_SHORT_YEAR)
        time.tm_year = year;
    else if (year >= FIRST_YEAR)
        time.tm_year = year - FIRST_YEAR;
    else
        return false;
    clock = text.BehindBlank(at + 8);
    return true;
}

// Only too large numbers are refused, here and above: a negative one counts back.
bool ReadClock(const DateText& text, std::size_t clock, std::tm& time) {
    time.tm_hour = text.Number(clock);
    time.tm_min = text.Number(clock + 3);
    time.tm_sec = text.Number(clock + 6);
    return time.tm_hour < 24 && time.tm_min < 60 && time.tm_sec < 60;
}
}  // namespace

oxHttpTime::oxHttpTime() {
    SetZone();
    m_value = std::time(nullptr);
}

oxHttpTime::oxHttpTime(const char* text) {
    SetZone();
    Parse(text);
}

oxHttpTime::oxHttpTime(const std::string& text) : oxHttpTime(text.c_str()) {}

oxHttpTime::oxHttpTime(std::tm* brokenDown) : m_value(std::mktime(brokenDown)) {}

void oxHttpTime::Format(std::string& text) const {
    char buffer[FORMAT_BYTES];
    text.append(buffer, Format(buffer));
}

std::size_t oxHttpTime::Format(char* buffer) const {
    std::tm time{};
    buffer[0] = '\0';
    if (::gmtime_r(&m_value, &time) == nullptr)  // a year that no int holds
        return 0;
    return std::strftime(buffer, FORMAT_BYTES, "%a, %d %b %Y %H:%M:%S GMT", &time);
}

int oxHttpTime::DayFromName(const char* text) {
    return FindName(text, DAYS, NO_DAY);
}

int oxHttpTime::MonthFromName(const char* text) {
    return FindName(text, MONTHS, NO_MONTH);
}

void oxHttpTime::Parse(const char* textToParse) {
    const DateText text(textToParse);
    std::tm time{};
    time.tm_wday = DayFromName(textToParse);

    std::size_t at = text.BehindBlank(0);
    if (text.IsBlank(at))
        ++at;
    const bool isAsctime = !text.IsDigit(at);
    std::size_t clock = 0;
    if (!(isAsctime ? ReadAsctimeDate(text, at, time, clock) : ReadRfcDate(text, at, time, clock)))
        return;
    if (!ReadClock(text, clock, time))
        return;
    if (isAsctime) {
        const int year = text.Number(clock + 9);
        if (year < FIRST_YEAR)
            return;
        time.tm_year = year - FIRST_YEAR;
    }
    errno = 0;
    const std::time_t value = ::timegm(&time);
    if (value != -1 || errno == 0)  // -1 is a second of 1969, too
        m_value = value;
}

void oxHttpTime::SetZone() {
    if (!m_bTZSET.exchange(true))
        ::tzset();
}
