// The times that travel in HTTP headers.
#pragma once

#include <atomic>
#include <cstddef>
#include <ctime>
#include <string>

// Seconds since 1970-01-01 00:00:00 UTC; 0 for a text that is no date. Reads the RFC 1123, RFC 850 and asctime forms,
// writes the first. Any thread may use it.
class oxHttpTime {
public:
    oxHttpTime();  // now
    explicit oxHttpTime(const char* text);
    explicit oxHttpTime(const std::string& text);
    explicit oxHttpTime(std::time_t value) : m_value(value) {}
    // Local time, as mktime takes it.
    explicit oxHttpTime(std::tm* brokenDown);

    std::time_t Value() const { return m_value; }

    // Appends "Sun, 06 Nov 1994 08:49:37 GMT".
    void Format(std::string& text) const;
    // The same into a buffer of at least FORMAT_BYTES; the count of characters.
    std::size_t Format(char* buffer) const;
    static constexpr std::size_t FORMAT_BYTES = 128;

    // 0 for Sunday to 6, from the first three letters in any case; 7 for no day's name.
    static int DayFromName(const char* text);
    // 0 for January to 11; 13 for no month's name.
    static int MonthFromName(const char* text);

private:
    void Parse(const char* text);
    static void SetZone();

    std::time_t m_value = 0;
    static std::atomic<bool> m_bTZSET;
};
