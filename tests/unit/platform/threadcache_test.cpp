#include "platform/threadcache.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <latch>
#include <set>
#include <thread>
#include <vector>

#include "platform/thread.h"
#include "testing/waiting.h"

namespace {

std::atomic<int> started;

int StartCounted(void* (*entry)(void*), void* argument) {
    ++started;
    std::thread([entry, argument] { entry(argument); }).detach();
    return 0;
}

// Never destroyed, as its users do it: threads may still wait in it.
MThreadCache& NewCache() {
    static auto& caches = *new std::vector<MThreadCache*>;
    started = 0;
    return *caches.emplace_back(new MThreadCache(&StartCounted));
}

// Does the work and waits until its thread is kept again.
void DoAndKeep(MThreadCache& cache, const MThreadCache::Work& work) {
    std::atomic<bool> done{false};
    ASSERT_EQ(cache.Start([&] {
        work();
        done = true;
    }),
              0);
    ASSERT_TRUE(Eventually([&] { return done && cache.IdleCount() > 0; }));
}

TEST(MThreadCache, WorkThatComesAfterWorkIsDoneByTheSameThread) {
    MThreadCache& cache = NewCache();
    std::set<unsigned> ids;
    for (int i = 0; i < 100; ++i)
        DoAndKeep(cache, [&] { ids.insert(MThread::CurrentId()); });
    EXPECT_EQ(ids.size(), static_cast<std::size_t>(started));
    EXPECT_LT(started, 100);
}

TEST(MThreadCache, KeptThreadsEndAfterTheIdleTime) {
    MThreadCache& cache = NewCache();
    DoAndKeep(cache, [] {});
    EXPECT_TRUE(Eventually([&] { return cache.IdleCount() == 0; }));
    DoAndKeep(cache, [] {});
    EXPECT_EQ(started, 2);
}

TEST(MThreadCache, NoMoreThanTheLimitAreKept) {
    MThreadCache& cache = NewCache();
    constexpr int WORKS = static_cast<int>(MThreadCache::MAX_IDLE) + 20;
    std::latch all(WORKS);
    std::atomic<int> done{0};
    for (int i = 0; i < WORKS; ++i)
        ASSERT_EQ(cache.Start([&] {
            all.arrive_and_wait();
            ++done;
        }),
                  0);
    EXPECT_EQ(started, WORKS);
    std::size_t most = 0;
    EXPECT_TRUE(Eventually([&] {
        most = std::max(most, cache.IdleCount());
        return done == WORKS && cache.IdleCount() == 0;
    }));
    EXPECT_LE(most, MThreadCache::MAX_IDLE);
}

TEST(MThreadCache, FailureToStartIsReturnedAndTheWorkIsNotDone) {
    MThreadCache cache([](void* (*)(void*), void*) { return EAGAIN; });
    bool done = false;
    EXPECT_EQ(cache.Start([&] { done = true; }), EAGAIN);
    EXPECT_FALSE(done);
}

TEST(MThreadCache, ManyThreadsStartWorkAtOnce) {
    MThreadCache& cache = NewCache();
    constexpr int STARTERS = 4;
    constexpr int WORKS = 2000;
    std::atomic<int> done{0};
    std::vector<std::thread> starters;
    for (int s = 0; s < STARTERS; ++s) {
        starters.emplace_back([&] {
            for (int i = 0; i < WORKS; ++i) {
                while (cache.Start([&] { ++done; }) != 0) {
                }
            }
        });
    }
    for (auto& starter : starters)
        starter.join();
    EXPECT_TRUE(Eventually([&] { return done == STARTERS * WORKS; }));
    EXPECT_TRUE(Eventually([&] { return cache.IdleCount() == 0; }));
}

TEST(MThreadWithKeptThreads, BehavesAsAnyOther) {
    std::atomic<int> runs{0};
    MThread thread(MThread::Priority::Normal, MThread::Kept::Yes);
    for (int i = 0; i < 1000; ++i) {
        ASSERT_TRUE(thread.Create(
            [](void* argument) -> void* {
                ++*static_cast<std::atomic<int>*>(argument);
                return nullptr;
            },
            &runs));
        ASSERT_NE(thread.Id(), 0u);
        ASSERT_TRUE(thread.Wait());
        ASSERT_FALSE(thread.IsRunning());
        ASSERT_EQ(runs, i + 1);
    }
}

TEST(MThreadWithKeptThreads, ExceptionEndsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            std::set_terminate([] { _exit(7); });
            MThread thread(MThread::Priority::Normal, MThread::Kept::Yes);
            thread.Create([](void*) -> void* { throw 1; }, nullptr);
            thread.Wait();
        },
        "");
}

}  // namespace
