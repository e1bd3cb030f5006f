// A clock that tests move by hand.
#pragma once

#include <atomic>

#include "platform/clock.h"

class ManualClock : public oxClock {
public:
    explicit ManualClock(std::time_t now = 784111777) : m_now(now) {}
    std::time_t Now() const override { return static_cast<std::time_t>(m_now.load()); }
    std::int64_t MonotonicSeconds() const override { return m_monotonic.load(); }
    void Advance(std::int64_t seconds) {
        m_now += seconds;
        m_monotonic += seconds;
    }

private:
    std::atomic<std::int64_t> m_now;
    std::atomic<std::int64_t> m_monotonic{1000};
};
