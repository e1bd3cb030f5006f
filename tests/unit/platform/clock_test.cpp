#include "platform/clock.h"

#include <gtest/gtest.h>

#include "testing/manualclock.h"

TEST(oxClock, SystemGivesTheMachinesClocks) {
    const std::time_t before = std::time(nullptr);
    const std::time_t now = oxClock::System().Now();
    EXPECT_LE(before, now);
    EXPECT_LE(now, std::time(nullptr));

    timespec uptime{};
    ASSERT_EQ(0, clock_gettime(CLOCK_MONOTONIC, &uptime));
    const std::int64_t seconds = oxClock::System().MonotonicSeconds();
    EXPECT_LE(static_cast<std::int64_t>(uptime.tv_sec), seconds);
    EXPECT_GE(oxClock::System().MonotonicSeconds(), seconds);
    EXPECT_EQ(&oxClock::System(), &oxClock::System());
}

TEST(oxTimeStamp, IsZeroUntilTouched) {
    ManualClock clock;
    const std::int64_t begin = clock.MonotonicSeconds();
    oxTimeStamp stamp(clock);
    EXPECT_EQ(0, stamp.Seconds());
    stamp.Touch();
    EXPECT_EQ(begin, stamp.Seconds());
    clock.Advance(4);
    EXPECT_EQ(begin, stamp.Seconds());
    stamp.Touch();
    EXPECT_EQ(begin + 4, stamp.Seconds());
}
