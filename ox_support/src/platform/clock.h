// Time, handed in, so that tests can move it by hand.
#pragma once

#include <atomic>
#include <cstdint>
#include <ctime>

class oxClock {
public:
    virtual ~oxClock() = default;
    // Seconds since 1970-01-01 00:00:00 UTC, for dates that people and browsers see.
    virtual std::time_t Now() const = 0;
    // Whole seconds of a clock that never steps, for time-outs.
    virtual std::int64_t MonotonicSeconds() const = 0;

    // The machine's clocks; never destroyed.
    static const oxClock& System();
};

// The moment of a last activity in monotonic seconds, 0 when there was none yet. One thread touches it while another
// reads it.
class oxTimeStamp {
public:
    explicit oxTimeStamp(const oxClock& clock) : m_clock(clock) {}
    void Touch() { m_seconds.store(m_clock.MonotonicSeconds(), std::memory_order_relaxed); }
    std::int64_t Seconds() const { return m_seconds.load(std::memory_order_relaxed); }

private:
    const oxClock& m_clock;
    std::atomic<std::int64_t> m_seconds{0};
};
