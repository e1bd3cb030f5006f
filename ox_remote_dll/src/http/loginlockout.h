// The registry of failed logins.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <list>
#include <map>
#include <string>

#include "platform/clock.h"
#include "platform/mutex.h"

// Counts failed logins for each user name and says who is locked out: after MAX_FAILURES failures that lie less than
// the period apart, until the period after the last of them has passed. A success does not clear the count. Times are
// those of the clock that never steps, so setting the machine's clock neither ends nor lengthens a lock-out.
//
// Thread-safe. Bounded: expired records are swept when there are more than SWEEP_ABOVE, at most once a period; and
// there are never more than MAX_RECORDS. When a flood of names fills them, room is made by forgetting an expired
// record, else the oldest of those with the fewest failures: a locked-out name is the last to be forgotten, and a name
// that was tried three times outlives names that were tried once.
class oxLoginLockout {
public:
    static constexpr std::int32_t MAX_FAILURES = 4;
    static constexpr std::int32_t LOCKOUT_SECONDS = 60;
    static constexpr std::size_t MAX_NAME = 127;  // longer names share the record of the empty name
    static constexpr std::size_t SWEEP_ABOVE = 1024;
    static constexpr std::size_t MAX_RECORDS = 16384;

    explicit oxLoginLockout(const oxClock& clock = oxClock::System());

    void Record(const std::string& user);
    bool IsLockedOut(const std::string& user);
    void Sweep();
    std::int32_t Period() const { return m_period; }  // seconds
    std::size_t Count();

private:
    static constexpr std::int64_t LONG_AGO = std::numeric_limits<std::int32_t>::min();
    struct Failures;
    using Records = std::map<std::string, Failures>;
    using Queue = std::list<Records::iterator>;  // the oldest last failure first
    struct Failures {
        std::int64_t last = LONG_AGO;  // monotonic seconds
        std::int32_t count = 0;
        Queue::iterator place;
    };
    bool IsOver(const Failures& failures, std::int64_t now) const;
    Queue& QueueFor(std::int32_t count);
    Records::iterator Add(const std::string& key);
    void Forget(Records::iterator record);
    void SweepRecords(std::int64_t now);
    void MakeRoom(std::int64_t now);

    const oxClock& m_clock;
    const std::int32_t m_maxFailures = MAX_FAILURES;
    const std::int32_t m_period = LOCKOUT_SECONDS;
    MMutex m_mutex;  // over all below
    Records m_records;
    std::array<Queue, MAX_FAILURES> m_queues;  // the records with 1, 2, ... failures; the last one: and more
    std::int64_t m_nextSweep;
};
