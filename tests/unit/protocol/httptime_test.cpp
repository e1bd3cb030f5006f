#include "protocol/httptime.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <thread>
#include <vector>

namespace {
// The process's time zone, put back at the end. Only while no other thread runs.
class ZoneGuard {
public:
    explicit ZoneGuard(const char* zone) {
        if (const char* before = std::getenv("TZ"))
            m_before = before;
        ::setenv("TZ", zone, 1);
        ::tzset();
    }
    ~ZoneGuard() {
        if (m_before)
            ::setenv("TZ", m_before->c_str(), 1);
        else
            ::unsetenv("TZ");
        ::tzset();
    }
    ZoneGuard(const ZoneGuard&) = delete;
    ZoneGuard& operator=(const ZoneGuard&) = delete;

private:
    std::optional<std::string> m_before;
};

// Parses from a block of exactly the text and its terminator, so that a sanitizer sees every read behind it.
std::time_t ParseExact(const std::string& text) {
    const auto block = std::make_unique<char[]>(text.size() + 1);
    std::copy_n(text.c_str(), text.size() + 1, block.get());
    return oxHttpTime(block.get()).Value();
}

constexpr const char* ZONES[] = {"UTC0",          "EST5EDT,M3.2.0,M11.1.0",     "XXX3:30", "XXX-5:30", "MSK-3",
                                 "Europe/Moscow", "NZST-12NZDT,M9.5.0,M4.1.0/3"};

const struct {
    const char* text;
    std::int64_t value;
} DATES[] = {
    // The three forms.
    {"Sun, 06 Nov 1994 08:49:37 GMT", 784111777},
    {"Sunday, 06-Nov-94 08:49:37 GMT", 784111777},
    {"Sun Nov  6 08:49:37 1994", 784111777},
    {"Sun Nov 16 08:49:37 1994", 784975777},
    {"Sun Nov   6 08:49:37 1994", 784111777},  // the clock time stands one further, too
    {"Tue Nov  6 08:49:37 1900", -2182259423},
    {"Thu, 01 Jan 1970 00:00:00 GMT", 0},
    {"Thu, 01 Jan 1970 00:00:01 GMT", 1},
    {"Sun, 01 Jul 2012 12:00:00 GMT", 1341144000},
    {"Tue, 19 Jan 2038 03:14:07 GMT", 2147483647},
    {"Thu, 31 Dec 2037 23:59:59 GMT", 2145916799},
    {"Wed, 31 Dec 1969 23:59:59 GMT", -1},
    {"Tue, 06 Nov 1900 08:49:37 GMT", -2182259423},
    // The weekday, the letters' case and the zone text do not matter.
    {"Xyz, 06 Nov 1994 08:49:37 GMT", 784111777},
    {"sun, 06 nOV 1994 08:49:37 EST", 784111777},
    {", 06 Nov 1994 08:49:37 +0100 xx", 784111777},
    {"Sun,  06 Nov 1994 08:49:37 GMT", 784111777},
    {"Sun, 06 Nov  1994 08:49:37 GMT", 784111777},
    {"x November 6 1994 08:49:37 GMT", 0},
    {"Sun, 06 November 1994 08:49:37 GMT", 0},
    {"Sun, 06 Xyz 1994 08:49:37 GMT", 0},
    {"Sun Xyz  6 08:49:37 1994", 0},
    // Two-digit and other years.
    {"Saturday, 05-Nov-05 08:49:37 GMT", 1131180577},
    {"Wednesday, 06-Nov-69 08:49:37 GMT", 3150953377},
    {"Friday, 06-Nov-70 08:49:37 GMT", 26729377},
    {"Saturday, 06-Nov-99 08:49:37 GMT", 941878177},
    {"Saturday, 06-Nov-100 08:49:37 GMT", 0},
    {"Saturday, 06-Nov-1899 08:49:37 GMT", 0},
    {"Sun Nov  6 08:49:37 1899", 0},
    {"Sun Nov  6 08:49:37 94  ", 0},
    {"Sun Nov  6 08:49:37    ", 0},
    // Lengths.
    {"Sun, 06 Nov 1994 08:49:37 GM", 0},
    {"Sun, 6 Nov 1994 08:49:37 GMT", 0},
    {"Sun, 06 Nov 1994 08:49:37    ", 784111777},
    {"x Nov  6 08:49:37 1994", 0},
    {"xy Nov  6 08:49:37 1994", 784111777},
    // Upper bounds.
    {"Sun, 31 Feb 1994 08:49:37 GMT", 762684577},
    {"Sun, 32 Nov 1994 08:49:37 GMT", 0},
    {"Sun, 00 Nov 1994 08:49:37 GMT", 783593377},
    {"Sun, 06 Nov 1994 24:00:00 GMT", 0},
    {"Sun, 06 Nov 1994 08:60:00 GMT", 0},
    {"Sun, 06 Nov 1994 08:49:60 GMT", 0},
    {"Sun Nov 32 08:49:37 1994", 0},
    {"Sun Nov  6 24:49:37 1994", 0},
    {"Sun Nov  6 08:60:37 1994", 0},
    {"Sun Nov  6 08:49:60 1994", 0},
    // Negative numbers pass.
    {"Sun, 06 Nov 1994 -8:49:37 GMT", 784054177},
    {"Sun, 06 Nov 1994 08:-9:00 GMT", 784108260},
    // Numbers are read at fixed places: a short hour shifts the minutes and the seconds.
    {"Sun, 06 Nov 1994 8:49:37  GMT", 784080000 + 8 * 3600 + 9 * 60 + 7},
    // What is missing reads as nothing.
    {"Sun, 06 Nov 1994-08:49:37-GMT", 784080000},
    {"Sun, 06 Nov 1994 08:49       ", 784111740},
    {"Sun, 06 Nov 1994            ", 0},
    {"Sun, 06 Nov 1994             ", 784080000},
    {"Sunday,06-Nov-94-08:49:37-GMT-", 0},
    {"", 0},
    {" ", 0},
    {"                                ", 0},
    {"no date at all, but long enough for one", 0},
    // Numbers that no int holds.
    {"Sun, 99999999999999999999 Nov 1994 08:49:37 GMT", 0},
    {"Sun, 06 Nov 1994 99999999999999999999:49:37 GMT", 0},
    {"Sun, 06 Nov -9999999999 -9999999999 GMT", 0},
};
}  // namespace

TEST(OxHttpTime, ParsesInEveryZone) {
    for (const char* zone : ZONES) {
        const ZoneGuard guard(zone);
        for (const auto& c : DATES) {
            EXPECT_EQ(c.value, static_cast<std::int64_t>(ParseExact(c.text))) << zone << ": " << c.text;
            EXPECT_EQ(c.value, static_cast<std::int64_t>(oxHttpTime(std::string(c.text)).Value())) << c.text;
        }
    }
}

TEST(OxHttpTime, TextCutAnywhereIsReadWithinItsEnd) {
    for (const auto& c : DATES) {
        const std::string text = c.text;
        for (std::size_t length = 0; length < text.size(); ++length) {
            const std::time_t value = ParseExact(text.substr(0, length));
            if (length < 23) {
                EXPECT_EQ(0, value) << text.substr(0, length);
            }
        }
    }
}

TEST(OxHttpTime, ZeroByteEndsAString) {
    std::string text = "Sun, 06 Nov 1994 08:49:37 GMT";
    text[20] = '\0';
    EXPECT_EQ(0, oxHttpTime(text).Value());
}

TEST(OxHttpTime, FormatsInEveryZone) {
    static const struct {
        std::int64_t value;
        const char* text;
    } CASES[] = {
        {0, "Thu, 01 Jan 1970 00:00:00 GMT"},         {784111777, "Sun, 06 Nov 1994 08:49:37 GMT"},
        {951782400, "Tue, 29 Feb 2000 00:00:00 GMT"}, {2147483647, "Tue, 19 Jan 2038 03:14:07 GMT"},
        {-1, "Wed, 31 Dec 1969 23:59:59 GMT"},
    };
    for (const char* zone : ZONES) {
        const ZoneGuard guard(zone);
        for (const auto& c : CASES) {
            const oxHttpTime time(static_cast<std::time_t>(c.value));
            EXPECT_EQ(c.value, static_cast<std::int64_t>(time.Value()));
            std::string text = "Date: ";
            time.Format(text);
            EXPECT_EQ(std::string("Date: ") + c.text, text) << zone;
            char buffer[oxHttpTime::FORMAT_BYTES];
            EXPECT_EQ(29u, time.Format(buffer));
            EXPECT_STREQ(c.text, buffer);
            EXPECT_EQ(c.value, static_cast<std::int64_t>(ParseExact(buffer))) << zone;
        }
    }
}

TEST(OxHttpTime, YearThatCannotBeWrittenGivesNoText) {
    if (sizeof(std::time_t) < 8)
        GTEST_SKIP() << "every value of this time_t has a year";
    const oxHttpTime time(std::numeric_limits<std::time_t>::max());
    char buffer[oxHttpTime::FORMAT_BYTES];
    EXPECT_EQ(0u, time.Format(buffer));
    EXPECT_STREQ("", buffer);
    std::string text = "x";
    time.Format(text);
    EXPECT_EQ("x", text);
}

// In a process of its own, where nothing has read the zone yet.
TEST(OxHttpTimeDeathTest, TheFirstClockOrTextTakesTheZoneAndNoLaterOneDoes) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    static constexpr long UNREAD = 3600;
    static constexpr long READ = 18000;
    static const auto zoneAfter = [](const char* zone, auto&& make) {
        ::setenv("TZ", zone, 1);
        make();
        return ::timezone;
    };
    static const std::function<void()> TAKERS[] = {
        [] { oxHttpTime(); },
        [] { oxHttpTime("x"); },
        [] { oxHttpTime(std::string("x")); },
    };
    for (const auto& taker : TAKERS) {
        const auto rounds = [&taker] {
            ::setenv("TZ", "AAA1", 1);
            ::tzset();
            if (zoneAfter("BBB5", [] { oxHttpTime(std::time_t{0}); }) != UNREAD)
                ::_exit(1);
            if (zoneAfter("BBB5", taker) != READ)
                ::_exit(2);
            for (const auto& later : TAKERS)
                if (zoneAfter("CCC-3", later) != READ)
                    ::_exit(3);
            ::_exit(0);
        };
        EXPECT_EXIT(rounds(), testing::ExitedWithCode(0), "") << &taker - TAKERS;
    }
}

TEST(OxHttpTime, BrokenDownTimeIsLocal) {
    static const struct {
        const char* zone;
        std::time_t value;
    } CASES[] = {{"UTC0", 0}, {"EST5", 18000}, {"XXX-1", -3600}, {"XXX3:30", 12600}};
    for (const auto& c : CASES) {
        const ZoneGuard guard(c.zone);
        std::tm start{};
        start.tm_year = 70;
        start.tm_mday = 1;
        EXPECT_EQ(c.value, oxHttpTime(&start).Value()) << c.zone;
    }
}

TEST(OxHttpTime, NowIsTheClock) {
    const std::time_t before = std::time(nullptr);
    const std::time_t now = oxHttpTime().Value();
    EXPECT_LE(before, now);
    EXPECT_GE(std::time(nullptr), now);
    const oxHttpTime copy = oxHttpTime(before);
    EXPECT_EQ(before, copy.Value());
}

TEST(OxHttpTime, NamesAreTheirFirstThreeLetters) {
    static const struct {
        const char* text;
        int day;
        int month;
    } CASES[] = {
        {"sun", 0, 13}, {"Mon", 1, 13},  {"TUE", 2, 13},    {"wednesday", 3, 13}, {"thu,", 4, 13}, {"fRi", 5, 13},
        {"Sat", 6, 13}, {"su", 7, 13},   {"", 7, 13},       {" sun", 7, 13},      {"Jan", 7, 0},   {"feb", 7, 1},
        {"MAR", 7, 2},  {"april", 7, 3}, {"May", 7, 4},     {"jun", 7, 5},        {"July", 7, 6},  {"aug", 7, 7},
        {"Sept", 7, 8}, {"oct", 7, 9},   {"Nov-94", 7, 10}, {"dEC", 7, 11},       {"De", 7, 13},   {"xyz", 7, 13},
        {"Ma", 7, 13},  {"mai", 7, 13},
    };
    for (const auto& c : CASES) {
        EXPECT_EQ(c.day, oxHttpTime::DayFromName(c.text)) << c.text;
        EXPECT_EQ(c.month, oxHttpTime::MonthFromName(c.text)) << c.text;
    }
}

TEST(OxHttpTime, ThreadsDoNotMixTheirTexts) {
    constexpr int THREADS = 8;
    std::vector<int> wrong(THREADS, 0);
    std::vector<std::thread> threads;
    for (int number = 0; number < THREADS; ++number)
        threads.emplace_back([number, &wrong] {
            const std::time_t value = 100000000 * number;
            for (int round = 0; round < 500; ++round) {
                std::string text;
                oxHttpTime(value).Format(text);
                if (oxHttpTime(text).Value() != value)
                    ++wrong[static_cast<std::size_t>(number)];
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(std::vector<int>(THREADS, 0), wrong);
}
