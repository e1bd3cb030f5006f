#include "http/loginlockout.h"

#include <algorithm>
#include <mutex>

namespace {

std::string Key(const std::string& user) {
    return user.size() <= oxLoginLockout::MAX_NAME ? user : std::string();
}

}  // namespace

oxLoginLockout::oxLoginLockout(const oxClock& clock) : m_clock(clock), m_nextSweep(clock.MonotonicSeconds()) {}

void oxLoginLockout::Record(const std::string& user) {
    const std::string key = Key(user);
    const std::scoped_lock lock(m_mutex);
    const std::int64_t now = m_clock.MonotonicSeconds();
    auto record = m_records.find(key);
    if (record == m_records.end()) {
        if (m_records.size() >= MAX_RECORDS)
            MakeRoom(now);
        record = Add(key);
    }
    Failures& failures = record->second;
    Queue& before = QueueFor(failures.count);
    failures.count = IsOver(failures, now) ? 1 : failures.count + 1;
    failures.last = now;
    Queue& after = QueueFor(failures.count);
    after.splice(after.end(), before, failures.place);
    if (m_records.size() > SWEEP_ABOVE && now >= m_nextSweep)
        SweepRecords(now);
}

bool oxLoginLockout::IsLockedOut(const std::string& user) {
    const std::string key = Key(user);
    const std::scoped_lock lock(m_mutex);
    const auto record = m_records.find(key);
    if (record == m_records.end() || record->second.count < m_maxFailures)
        return false;
    if (!IsOver(record->second, m_clock.MonotonicSeconds()))
        return true;
    Forget(record);
    return false;
}

void oxLoginLockout::Sweep() {
    const std::scoped_lock lock(m_mutex);
    SweepRecords(m_clock.MonotonicSeconds());
}

std::size_t oxLoginLockout::Count() {
    const std::scoped_lock lock(m_mutex);
    return m_records.size();
}

// Whether the period after the last failure has passed.
bool oxLoginLockout::IsOver(const Failures& failures, std::int64_t now) const {
    return failures.last + m_period <= now;
}

oxLoginLockout::Queue& oxLoginLockout::QueueFor(std::int32_t count) {
    return m_queues[static_cast<std::size_t>(std::clamp(count, 1, MAX_FAILURES) - 1)];
}

// A record without failures, which counts as over.
oxLoginLockout::Records::iterator oxLoginLockout::Add(const std::string& key) {
    Queue place(1);  // allocated first: nothing below the map's own insertion can fail
    const auto record = m_records.try_emplace(key).first;
    record->second.place = place.begin();
    place.front() = record;
    QueueFor(0).splice(QueueFor(0).end(), place);
    return record;
}

void oxLoginLockout::Forget(Records::iterator record) {
    QueueFor(record->second.count).erase(record->second.place);
    m_records.erase(record);
}

// A record whose period ends at this very second stays until the next sweep; it locks nobody out any more.
void oxLoginLockout::SweepRecords(std::int64_t now) {
    m_nextSweep = now + m_period;
    for (auto next = m_records.begin(); next != m_records.end();) {
        const auto record = next++;
        if (record->second.last + m_period < now)
            Forget(record);
    }
}

void oxLoginLockout::MakeRoom(std::int64_t now) {
    const auto holdsOver = [&](const Queue& queue) { return !queue.empty() && IsOver(queue.front()->second, now); };
    auto queue = std::find_if(m_queues.begin(), m_queues.end(), holdsOver);
    if (queue == m_queues.end())
        queue = std::find_if(m_queues.begin(), m_queues.end(), [](const Queue& one) { return !one.empty(); });
    if (queue != m_queues.end())
        Forget(queue->front());
}
