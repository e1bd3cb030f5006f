#include "platform/mutex.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>

// ThreadSanitizer (of gcc 12) does not see pthread_mutex_clocklock take a lock, so under it the wall clock serves.
#if defined(__SANITIZE_THREAD__)
#define OX_WALL_CLOCK_LOCKS 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define OX_WALL_CLOCK_LOCKS 1
#endif
#endif

namespace {

constexpr long MILLISECONDS_PER_SECOND = 1000;
constexpr long NANOSECONDS_PER_MILLISECOND = 1000000;
constexpr long NANOSECONDS_PER_SECOND = 1000000000;
// Far more than any wait, and small enough for the sum with the clock.
constexpr std::chrono::milliseconds LONGEST_WAIT = std::chrono::hours(24 * 365);

// These calls fail only when a mutex or condition variable is misused or its memory was overwritten.
void MustSucceed(int error, const char* call) {
    if (error == 0)
        return;
    std::fprintf(stderr, "%s failed: %d\n", call, error);
    std::abort();
}

timespec Deadline(clockid_t clock, std::chrono::milliseconds limit) {
    const auto wait = std::clamp(limit, std::chrono::milliseconds(0), LONGEST_WAIT);
    timespec deadline{};
    clock_gettime(clock, &deadline);
    deadline.tv_sec += static_cast<time_t>(wait.count() / MILLISECONDS_PER_SECOND);
    deadline.tv_nsec += static_cast<long>(wait.count() % MILLISECONDS_PER_SECOND) * NANOSECONDS_PER_MILLISECOND;
    if (deadline.tv_nsec >= NANOSECONDS_PER_SECOND) {
        deadline.tv_nsec -= NANOSECONDS_PER_SECOND;
        ++deadline.tv_sec;
    }
    return deadline;
}

}  // namespace

void MMutex::lock() {
    MustSucceed(pthread_mutex_lock(&m_mutex), "pthread_mutex_lock");
}

void MMutex::unlock() {
    MustSucceed(pthread_mutex_unlock(&m_mutex), "pthread_mutex_unlock");
}

bool MMutex::try_lock() {
    const int error = pthread_mutex_trylock(&m_mutex);
    if (error == EBUSY)
        return false;
    MustSucceed(error, "pthread_mutex_trylock");
    return true;
}

bool MMutex::try_lock_for(std::chrono::milliseconds limit) {
#ifdef OX_WALL_CLOCK_LOCKS
    const timespec deadline = Deadline(CLOCK_REALTIME, limit);
    const int error = pthread_mutex_timedlock(&m_mutex, &deadline);
#else
    const timespec deadline = Deadline(CLOCK_MONOTONIC, limit);
    const int error = pthread_mutex_clocklock(&m_mutex, CLOCK_MONOTONIC, &deadline);
#endif
    if (error == ETIMEDOUT)
        return false;
    MustSucceed(error, "timed pthread_mutex lock");
    return true;
}

MCondVar::MCondVar() {
    pthread_condattr_t attributes;
    MustSucceed(pthread_condattr_init(&attributes), "pthread_condattr_init");
    MustSucceed(pthread_condattr_setclock(&attributes, CLOCK_MONOTONIC), "pthread_condattr_setclock");
    MustSucceed(pthread_cond_init(&m_cond, &attributes), "pthread_cond_init");
    pthread_condattr_destroy(&attributes);
}

MCondVar::~MCondVar() {
    pthread_cond_destroy(&m_cond);
}

void MCondVar::Signal() {
    MustSucceed(pthread_cond_signal(&m_cond), "pthread_cond_signal");
}

void MCondVar::Broadcast() {
    MustSucceed(pthread_cond_broadcast(&m_cond), "pthread_cond_broadcast");
}

void MCondVar::Wait(std::unique_lock<MMutex>& lock) {
    MustSucceed(pthread_cond_wait(&m_cond, &lock.mutex()->m_mutex), "pthread_cond_wait");
}

bool MCondVar::WaitFor(std::unique_lock<MMutex>& lock, std::chrono::milliseconds limit) {
    if (limit.count() <= 0)
        return false;
    const timespec deadline = Deadline(CLOCK_MONOTONIC, limit);
    const int error = pthread_cond_timedwait(&m_cond, &lock.mutex()->m_mutex, &deadline);
    if (error == ETIMEDOUT)
        return false;
    MustSucceed(error, "pthread_cond_timedwait");
    return true;
}

MSemaphore::MSemaphore(unsigned initial) : m_count(std::min(initial, MAX_COUNT)) {}

void MSemaphore::Wait() {
    std::unique_lock lock(m_mutex);
    m_cond.Wait(lock, [this] { return m_count > 0; });
    --m_count;
}

bool MSemaphore::WaitFor(std::chrono::milliseconds limit) {
    std::unique_lock lock(m_mutex);
    if (!m_cond.WaitFor(lock, limit, [this] { return m_count > 0; }))
        return false;
    --m_count;
    return true;
}

bool MSemaphore::Signal() {
    const std::scoped_lock lock(m_mutex);
    if (m_count == MAX_COUNT)
        return false;
    ++m_count;
    // Under the lock, so that a waiter may destroy the semaphore as soon as it has its turn.
    m_cond.Signal();
    return true;
}
