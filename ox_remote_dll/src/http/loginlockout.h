// The registry of failed logins.
#pragma once

#include <cstdint>
#include <ctime>
#include <map>
#include <string>

#include "platform/clock.h"
#include "platform/mutex.h"

// Counts failed logins for each user name and says who is locked out: after MAX_FAILURES failures that lie less than
// the period apart, until the period after the last of them has passed. A success does not clear the count.
// Thread-safe. Bounded: expired records are swept when there are many.
class oxLoginLockout {
public:
    static constexpr std::int32_t MAX_FAILURES = 4;
    static constexpr std::int32_t LOCKOUT_SECONDS = 60;
    static constexpr std::size_t MAX_NAME = 127;  // longer names share the record of the empty name
    static constexpr std::size_t SWEEP_ABOVE = 1024;

    explicit oxLoginLockout(const oxClock& clock = oxClock::System());

    void Record(const std::string& user);
    bool IsLockedOut(const std::string& user);
    void Sweep();
    std::int32_t Period() const { return m_period; }  // seconds
    std::size_t Count();

private:
    struct Failures {
        std::time_t last;
        std::int32_t count;
    };
    const std::int32_t m_maxFailures = MAX_FAILURES;
    const std::int32_t m_period = LOCKOUT_SECONDS;
    std::map<std::string, Failures> m_records;
    const oxClock& m_clock;
    MMutex m_mutex;
    std::time_t m_lastSweep = 0;
};
