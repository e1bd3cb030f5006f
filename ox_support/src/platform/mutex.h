// The platform's plain mutex, condition variable and counting semaphore over pthreads.
#pragma once

#include <pthread.h>

#include <chrono>
#include <mutex>

// A plain, non-recursive mutex. It meets the standard Lockable requirements, so std::scoped_lock and
// std::unique_lock hold it; locking it twice on one thread is a programming error. Constant-initialised and
// trivially destroyed (the C library's plain mutex holds nothing): a static MMutex may be used by constructors
// and destructors of other static objects.
class MMutex {
public:
    constexpr MMutex() = default;
    ~MMutex() = default;
    MMutex(const MMutex&) = delete;
    MMutex& operator=(const MMutex&) = delete;

    void lock();
    void unlock();
    bool try_lock();
    // Gives up after the time; for handlers that must not hang on a lock that their own thread may hold.
    bool try_lock_for(std::chrono::milliseconds limit);

    // For code that a cancelled thread may leave in the middle, where no guard object may stand.
    pthread_mutex_t* Native() { return &m_mutex; }

private:
    friend class MCondVar;
    pthread_mutex_t m_mutex = PTHREAD_MUTEX_INITIALIZER;
};

// A condition variable on the monotonic clock: a step of the wall clock neither shortens nor lengthens a wait.
// Waits may wake without cause; callers test their condition in a loop or pass it as the predicate.
class MCondVar {
public:
    MCondVar();
    ~MCondVar();
    MCondVar(const MCondVar&) = delete;
    MCondVar& operator=(const MCondVar&) = delete;

    void Signal();
    void Broadcast();
    void Wait(std::unique_lock<MMutex>& lock);
    // False when the time passed without a wake-up. A time of 0 or less returns false at once.
    bool WaitFor(std::unique_lock<MMutex>& lock, std::chrono::milliseconds limit);

    template <typename Predicate>
    void Wait(std::unique_lock<MMutex>& lock, Predicate done) {
        while (!done())
            Wait(lock);
    }
    // The predicate's value at the end.
    template <typename Predicate>
    bool WaitFor(std::unique_lock<MMutex>& lock, std::chrono::milliseconds limit, Predicate done) {
        const auto start = std::chrono::steady_clock::now();
        while (!done()) {
            const auto passed = std::chrono::floor<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start);
            const auto left = limit - passed;
            if (left.count() <= 0)
                return done();
            WaitFor(lock, left);
        }
        return true;
    }

    pthread_cond_t* Native() { return &m_cond; }  // as the mutex's; its timed waits are on CLOCK_MONOTONIC

private:
    pthread_cond_t m_cond;
};

// A counting semaphore. Counts up to MAX_COUNT.
class MSemaphore {
public:
    static constexpr unsigned MAX_COUNT = 2147483647;

    explicit MSemaphore(unsigned initial = 0);
    MSemaphore(const MSemaphore&) = delete;
    MSemaphore& operator=(const MSemaphore&) = delete;

    // Waits, through interruptions, until the count is above 0, and takes one.
    void Wait();
    // As Wait, but gives up after the time (monotonic); true when one was taken.
    bool WaitFor(std::chrono::milliseconds limit);
    // Gives one back. False when the count already is MAX_COUNT.
    bool Signal();

private:
    MMutex m_mutex;
    MCondVar m_cond;
    unsigned m_count;
};
