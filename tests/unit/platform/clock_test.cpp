#include "platform/clock.h"

#include <gtest/gtest.h>

namespace {

class HandClock : public oxClock {
public:
    std::time_t Now() const override { return 1000000000; }
    std::int64_t MonotonicSeconds() const override { return seconds; }
    std::int64_t seconds = 5;
};

}  // namespace

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
    HandClock clock;
    oxTimeStamp stamp(clock);
    EXPECT_EQ(0, stamp.Seconds());
    stamp.Touch();
    EXPECT_EQ(5, stamp.Seconds());
    clock.seconds = 9;
    EXPECT_EQ(5, stamp.Seconds());
    stamp.Touch();
    EXPECT_EQ(9, stamp.Seconds());
}
