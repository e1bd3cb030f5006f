#include "platform/mutex.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <type_traits>
#include <vector>

using std::chrono::milliseconds;
using std::chrono::steady_clock;

namespace {

constinit MMutex g_constantInitialised;
static_assert(std::is_trivially_destructible_v<MMutex>);

constexpr milliseconds SHORT(30);
constexpr milliseconds LONG(60000);

}  // namespace

TEST(MMutex, ExcludesOtherThreads) {
    constexpr int THREADS = 4;
    constexpr int ROUNDS = 5000;
    MMutex mutex;
    int counter = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < THREADS; ++i) {
        threads.emplace_back([&] {
            for (int round = 0; round < ROUNDS; ++round) {
                const std::scoped_lock lock(mutex);
                ++counter;
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(THREADS * ROUNDS, counter);
}

TEST(MMutex, TryLockFailsWhileHeldAndSucceedsAfter) {
    g_constantInitialised.lock();
    bool whileHeld = true;
    std::thread([&] { whileHeld = g_constantInitialised.try_lock(); }).join();
    EXPECT_FALSE(whileHeld);
    g_constantInitialised.unlock();
    EXPECT_TRUE(g_constantInitialised.try_lock());
    g_constantInitialised.unlock();
}

TEST(MMutex, TryLockForGivesUpAfterTheTime) {
    MMutex mutex;
    const std::scoped_lock lock(mutex);
    bool taken = true;
    steady_clock::duration passed{};
    std::thread([&] {
        const auto start = steady_clock::now();
        taken = mutex.try_lock_for(SHORT);
        passed = steady_clock::now() - start;
    }).join();
    EXPECT_FALSE(taken);
    EXPECT_GE(passed, SHORT);
}

TEST(MMutex, TryLockForTakesALockThatBecomesFree) {
    MMutex mutex;
    int guarded = 0;
    mutex.lock();
    std::atomic<bool> started{false};
    std::thread waiter([&] {
        started = true;
        if (mutex.try_lock_for(LONG)) {
            ++guarded;
            mutex.unlock();
        }
    });
    while (!started)
        std::this_thread::yield();
    ++guarded;
    mutex.unlock();
    waiter.join();
    EXPECT_EQ(2, guarded);
}

TEST(MCondVar, SignalWakesAWaiter) {
    MMutex mutex;
    MCondVar cond;
    bool ready = false;
    bool seen = false;
    std::thread waiter([&] {
        std::unique_lock lock(mutex);
        cond.Wait(lock, [&] { return ready; });
        seen = ready;
    });
    {
        const std::scoped_lock lock(mutex);
        ready = true;
        cond.Signal();
    }
    waiter.join();
    EXPECT_TRUE(seen);
}

TEST(MCondVar, BroadcastWakesEveryWaiter) {
    constexpr int WAITERS = 4;
    MMutex mutex;
    MCondVar cond;
    MCondVar arrived;
    bool ready = false;
    int waiting = 0;
    int woken = 0;
    std::vector<std::thread> waiters;
    for (int i = 0; i < WAITERS; ++i) {
        waiters.emplace_back([&] {
            std::unique_lock lock(mutex);
            ++waiting;
            arrived.Signal();
            cond.Wait(lock, [&] { return ready; });
            ++woken;
        });
    }
    {
        std::unique_lock lock(mutex);
        arrived.Wait(lock, [&] { return waiting == WAITERS; });
        ready = true;
        cond.Broadcast();
    }
    for (std::thread& waiter : waiters)
        waiter.join();
    EXPECT_EQ(WAITERS, woken);
}

TEST(MCondVar, WaitForIsFalseAfterTheTime) {
    MMutex mutex;
    MCondVar cond;
    std::unique_lock lock(mutex);
    const auto start = steady_clock::now();
    while (cond.WaitFor(lock, SHORT)) {
        // woken without cause
    }
    EXPECT_GE(steady_clock::now() - start, SHORT);
    EXPECT_TRUE(lock.owns_lock());
}

TEST(MCondVar, WaitForWithoutTimeIsFalseAtOnce) {
    MMutex mutex;
    MCondVar cond;
    std::unique_lock lock(mutex);
    EXPECT_FALSE(cond.WaitFor(lock, milliseconds(0)));
    EXPECT_FALSE(cond.WaitFor(lock, milliseconds(-5)));
    EXPECT_FALSE(cond.WaitFor(lock, milliseconds::min()));
}

TEST(MCondVar, WaitForGivesThePredicatesValue) {
    MMutex mutex;
    MCondVar cond;
    std::unique_lock lock(mutex);
    const auto start = steady_clock::now();
    EXPECT_FALSE(cond.WaitFor(lock, SHORT, [] { return false; }));
    EXPECT_GE(steady_clock::now() - start, SHORT);
    EXPECT_TRUE(cond.WaitFor(lock, milliseconds(0), [] { return true; }));
}

TEST(MCondVar, LongestTimeDoesNotOverflow) {
    MMutex mutex;
    MCondVar cond;
    bool ready = false;
    std::thread waker([&] {
        const std::scoped_lock lock(mutex);
        ready = true;
        cond.Signal();
    });
    {
        std::unique_lock lock(mutex);
        EXPECT_TRUE(cond.WaitFor(lock, milliseconds::max(), [&] { return ready; }));
    }
    waker.join();
}

TEST(MSemaphore, GivesAsManyAsItHas) {
    MSemaphore semaphore(2);
    EXPECT_TRUE(semaphore.WaitFor(milliseconds(0)));
    semaphore.Wait();
    EXPECT_FALSE(semaphore.WaitFor(milliseconds(0)));
    EXPECT_TRUE(semaphore.Signal());
    EXPECT_TRUE(semaphore.WaitFor(milliseconds(0)));
}

TEST(MSemaphore, WaitForGivesUpAfterTheTime) {
    MSemaphore semaphore;
    const auto start = steady_clock::now();
    EXPECT_FALSE(semaphore.WaitFor(SHORT));
    EXPECT_GE(steady_clock::now() - start, SHORT);
}

TEST(MSemaphore, SignalFailsAtTheHighestCount) {
    MSemaphore semaphore(MSemaphore::MAX_COUNT);
    EXPECT_FALSE(semaphore.Signal());
    semaphore.Wait();
    EXPECT_TRUE(semaphore.Signal());
    EXPECT_FALSE(semaphore.Signal());
}

TEST(MSemaphore, NeverAdmitsMoreThanItsCount) {
    constexpr int PLACES = 3;
    constexpr int THREADS = 8;
    constexpr int ROUNDS = 500;
    MSemaphore semaphore(PLACES);
    std::atomic<int> inside{0};
    std::atomic<int> most{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < THREADS; ++i) {
        threads.emplace_back([&] {
            for (int round = 0; round < ROUNDS; ++round) {
                semaphore.Wait();
                const int now = ++inside;
                int before = most.load();
                while (before < now && !most.compare_exchange_weak(before, now)) {
                }
                --inside;
                semaphore.Signal();
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_LE(most.load(), PLACES);
    for (int i = 0; i < PLACES; ++i)
        EXPECT_TRUE(semaphore.WaitFor(milliseconds(0)));
    EXPECT_FALSE(semaphore.WaitFor(milliseconds(0)));
}
