#include "platform/thread.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <iterator>
#include <stdexcept>
#include <thread>
#include <vector>

#include "testing/waiting.h"

using std::chrono::milliseconds;

namespace {

constexpr milliseconds LONG(60000);

// A body that runs until it is told to end.
struct Gate {
    static void* Body(void* argument) {
        static_cast<Gate*>(argument)->end.Wait();
        return nullptr;
    }
    MSemaphore end;
};

void* CountUp(void* argument) {
    ++*static_cast<std::atomic<int>*>(argument);
    return nullptr;
}

std::size_t ThreadsOfProcess() {
    // A sanitizer starts a thread of its own with the first of the program's.
    static const bool begun = [] {
        std::thread([] {}).join();
        return true;
    }();
    static_cast<void>(begun);
    const std::filesystem::directory_iterator tasks("/proc/self/task");
    return static_cast<std::size_t>(std::distance(begin(tasks), end(tasks)));
}

}  // namespace

TEST(MThreadError, IsTrueForFailuresAndHasTheSystemsText) {
    EXPECT_FALSE(MThreadError());
    EXPECT_EQ(0, MThreadError().Code());
    const MThreadError error(EAGAIN);
    EXPECT_TRUE(error);
    EXPECT_EQ(EAGAIN, error.Code());
    EXPECT_EQ("Resource temporarily unavailable", error.Text());
}

TEST(MThread, BeforeTheFirstStartNothingRuns) {
    MThread thread;
    EXPECT_FALSE(thread.IsRunning());
    EXPECT_EQ(0u, thread.Id());
    EXPECT_TRUE(thread.Wait());
    EXPECT_TRUE(thread.Wait(milliseconds(0)));
    thread.Detach();
    EXPECT_EQ(ESRCH, thread.LastError().Code());
}

TEST(MThread, PriorityIsOnlyRecorded) {
    EXPECT_EQ(MThread::Priority::Normal, MThread().GetPriority());
    EXPECT_EQ(MThread::Priority::High, MThread(MThread::Priority::High).GetPriority());
}

TEST(MThread, WaitReturnsAfterTheBody) {
    std::atomic<int> count{0};
    MThread thread;
    ASSERT_TRUE(thread.Create(CountUp, &count));
    EXPECT_TRUE(thread.Wait());
    EXPECT_EQ(1, count.load());
    EXPECT_FALSE(thread.IsRunning());
    EXPECT_TRUE(thread.Wait()) << "as often as asked";
    EXPECT_EQ(0, thread.LastError().Code());
}

TEST(MThread, IdIsTheKernelsAndKnownToBodyAndCreator) {
    struct Ids {
        MThread thread;
        unsigned asked = 0;
        unsigned current = 0;
        pid_t kernel = 0;
    } ids;
    ASSERT_TRUE(ids.thread.Create(
        [](void* argument) -> void* {
            auto* const self = static_cast<Ids*>(argument);
            self->asked = self->thread.Id();
            self->current = MThread::CurrentId();
            self->kernel = gettid();
            return nullptr;
        },
        &ids));
    const unsigned id = ids.thread.Id();
    EXPECT_TRUE(ids.thread.Wait());
    EXPECT_NE(0u, id);
    EXPECT_NE(MThread::CurrentId(), id);
    EXPECT_EQ(id, ids.asked);
    EXPECT_EQ(id, ids.current);
    EXPECT_EQ(id, static_cast<unsigned>(ids.kernel));
    EXPECT_EQ(id, ids.thread.Id()) << "kept after the end";
}

TEST(MThread, CreateOfARunningThreadFails) {
    Gate gate;
    MThread thread;
    ASSERT_TRUE(thread.Create(Gate::Body, &gate));
    EXPECT_TRUE(thread.IsRunning());
    EXPECT_FALSE(thread.Create(Gate::Body, &gate));
    EXPECT_EQ(EBUSY, thread.LastError().Code());
    EXPECT_TRUE(thread.IsRunning());
    gate.end.Signal();
    EXPECT_TRUE(thread.Wait());
    EXPECT_EQ(0, thread.LastError().Code());
}

TEST(MThread, TimedWaitGivesUpAndLaterSucceeds) {
    Gate gate;
    MThread thread;
    ASSERT_TRUE(thread.Create(Gate::Body, &gate));
    EXPECT_FALSE(thread.Wait(milliseconds(0)));
    EXPECT_FALSE(thread.Wait(milliseconds(20)));
    EXPECT_EQ(ETIMEDOUT, thread.LastError().Code());
    gate.end.Signal();
    EXPECT_TRUE(thread.Wait(LONG));
    EXPECT_TRUE(thread.Wait(milliseconds(0)));
}

TEST(MThread, WaitFromTheThreadItselfReturnsAtOnce) {
    struct Self {
        MThread thread;
        bool waited = true;
        bool waitedFor = true;
        int error = 0;
    } self;
    ASSERT_TRUE(self.thread.Create(
        [](void* argument) -> void* {
            auto* const object = static_cast<Self*>(argument);
            object->waited = object->thread.Wait();
            object->waitedFor = object->thread.Wait(LONG);
            object->error = object->thread.LastError().Code();
            return nullptr;
        },
        &self));
    // Not by Wait, which would clear the error that the body reads.
    while (self.thread.IsRunning())
        std::this_thread::yield();
    EXPECT_TRUE(self.thread.Wait());
    EXPECT_FALSE(self.waited);
    EXPECT_FALSE(self.waitedFor);
    EXPECT_EQ(EDEADLK, self.error);
}

TEST(MThread, DetachThenWaitStillWaitsForTheBody) {
    struct Detached {
        MThread thread;
        MSemaphore end;
        bool ended = false;
    } detached;
    ASSERT_TRUE(detached.thread.Create(
        [](void* argument) -> void* {
            auto* const self = static_cast<Detached*>(argument);
            self->thread.Detach();
            self->end.Wait();
            self->ended = true;
            return nullptr;
        },
        &detached));
    EXPECT_FALSE(detached.thread.Wait(milliseconds(20)));
    detached.end.Signal();
    EXPECT_TRUE(detached.thread.Wait());
    EXPECT_TRUE(detached.ended);
    detached.thread.Detach();
    EXPECT_EQ(EINVAL, detached.thread.LastError().Code()) << "marked already";
}

TEST(MThread, DestructorWaitsForTheBody) {
    struct Body {
        MSemaphore end;
        std::atomic<bool> ended{false};
    } body;
    auto thread = std::make_unique<MThread>();
    ASSERT_TRUE(thread->Create(
        [](void* argument) -> void* {
            auto* const self = static_cast<Body*>(argument);
            self->end.Wait();
            self->ended = true;
            return nullptr;
        },
        &body));
    thread->Detach();
    MSemaphore destroyed;
    bool endedBefore = false;
    std::thread destroyer([&] {
        thread.reset();
        endedBefore = body.ended;
        destroyed.Signal();
    });
    EXPECT_FALSE(destroyed.WaitFor(milliseconds(20)));
    body.end.Signal();
    destroyer.join();
    EXPECT_TRUE(endedBefore);
}

TEST(MThread, DestroyedByItsOwnBodyLeavesNoThread) {
    struct Owned {
        MThread* thread = nullptr;
        MSemaphore go;
        MSemaphore done;
    } owned;
    const std::size_t before = ThreadsOfProcess();
    auto thread = std::make_unique<MThread>();
    owned.thread = thread.get();
    ASSERT_TRUE(thread->Create(
        [](void* argument) -> void* {
            auto* const self = static_cast<Owned*>(argument);
            self->go.Wait();
            const std::unique_ptr<MThread> mine(std::exchange(self->thread, nullptr));
            self->done.Signal();
            return nullptr;
        },
        &owned));
    static_cast<void>(thread.release());  // the body's now
    owned.go.Signal();
    EXPECT_TRUE(owned.done.WaitFor(LONG));
    EXPECT_TRUE(Eventually([&] { return ThreadsOfProcess() <= before; }));
    EXPECT_EQ(nullptr, owned.thread);
}

TEST(MThread, ThousandRunsOfOneObjectLeaveNoThread) {
    constexpr int ROUNDS = 1000;
    const std::size_t before = ThreadsOfProcess();
    std::atomic<int> count{0};
    MThread thread;
    for (int round = 1; round <= ROUNDS; ++round) {
        ASSERT_TRUE(thread.Create(CountUp, &count));
        if (round % 3 == 0)
            thread.Detach();
        ASSERT_TRUE(thread.Wait());
        ASSERT_EQ(round, count.load());
    }
    EXPECT_TRUE(Eventually([&] { return ThreadsOfProcess() <= before; }));
}

TEST(MThread, CreateJoinsAnEarlierRunThatNobodyWaitedFor) {
    constexpr int ROUNDS = 200;
    std::atomic<int> count{0};
    MThread thread;
    for (int round = 1; round <= ROUNDS; ++round) {
        while (thread.IsRunning())
            std::this_thread::yield();
        ASSERT_TRUE(thread.Create(CountUp, &count));
    }
    EXPECT_TRUE(thread.Wait());
    EXPECT_EQ(ROUNDS, count.load());
}

TEST(MThread, SeveralThreadsMayWaitAtTheSameTime) {
    constexpr int ROUNDS = 100;
    constexpr int WAITERS = 4;
    for (int round = 0; round < ROUNDS; ++round) {
        struct Shared {
            MSemaphore end;
            bool ended = false;  // read after Wait without any lock
        } shared;
        MThread thread;
        ASSERT_TRUE(thread.Create(
            [](void* argument) -> void* {
                auto* const self = static_cast<Shared*>(argument);
                self->end.Wait();
                self->ended = true;
                return nullptr;
            },
            &shared));
        std::atomic<int> sawTheEnd{0};
        std::vector<std::thread> waiters;
        for (int i = 0; i < WAITERS; ++i) {
            waiters.emplace_back([&, i] {
                const bool ended = i % 2 == 0 ? thread.Wait() : thread.Wait(LONG);
                if (ended && shared.ended)
                    ++sawTheEnd;
            });
        }
        shared.end.Signal();
        EXPECT_TRUE(thread.Wait());
        for (std::thread& waiter : waiters)
            waiter.join();
        ASSERT_EQ(WAITERS, sawTheEnd.load());
    }
}

TEST(MThread, CancelAsksAndCreateTakesTheRequestBack) {
    struct Cancelled {
        MThread thread;
        bool atStart = true;
    } cancelled;
    const MThread::Entry body = [](void* argument) -> void* {
        auto* const self = static_cast<Cancelled*>(argument);
        self->atStart = self->thread.IsCancelled();
        while (!self->thread.IsCancelled())
            std::this_thread::yield();
        return nullptr;
    };
    for (int round = 0; round < 2; ++round) {
        ASSERT_TRUE(cancelled.thread.Create(body, &cancelled));
        cancelled.thread.Cancel();
        EXPECT_TRUE(cancelled.thread.Wait());
        EXPECT_TRUE(cancelled.thread.IsCancelled());
    }
}

namespace {
// A body that pauses once and says how the pause ended.
struct Pausing {
    static void* Body(void* argument) {
        auto* const self = static_cast<Pausing*>(argument);
        const auto start = std::chrono::steady_clock::now();
        self->inPause = true;
        self->passed = self->thread.Pause(self->time);
        self->took = std::chrono::steady_clock::now() - start;
        return nullptr;
    }
    explicit Pausing(milliseconds pause) : time(pause) {}

    const milliseconds time;
    MThread thread;
    std::atomic<bool> inPause{false};
    bool passed = false;
    std::chrono::steady_clock::duration took{};
};
}  // namespace

TEST(MThread, APauseLastsItsTime) {
    for (const milliseconds time : {milliseconds(-1), milliseconds(0), milliseconds(30)}) {
        Pausing pausing(time);
        ASSERT_TRUE(pausing.thread.Create(&Pausing::Body, &pausing));
        EXPECT_TRUE(pausing.thread.Wait());
        EXPECT_TRUE(pausing.passed);
        EXPECT_GE(pausing.took, time);
    }
}

TEST(MThread, CancelEndsAPauseAtOnce) {
    constexpr int ROUNDS = 50;
    for (int round = 0; round < ROUNDS; ++round) {
        Pausing pausing(LONG);
        ASSERT_TRUE(pausing.thread.Create(&Pausing::Body, &pausing));
        // Some are cancelled before the pause begins.
        if (round % 2 == 0) {
            ASSERT_TRUE(Eventually([&] { return pausing.inPause.load(); }));
        }
        pausing.thread.Cancel();
        ASSERT_TRUE(pausing.thread.Wait(LONG / 2)) << "no wake-up is lost";
        EXPECT_FALSE(pausing.passed);
    }
}

TEST(MThread, PausesOfACancelledThreadAreOverUntilItIsCreatedAgain) {
    Pausing pausing(milliseconds(1));
    pausing.thread.Cancel();
    EXPECT_FALSE(pausing.thread.Pause(LONG));
    EXPECT_FALSE(pausing.thread.Pause(milliseconds(0)));
    ASSERT_TRUE(pausing.thread.Create(&Pausing::Body, &pausing));
    EXPECT_TRUE(pausing.thread.Wait());
    EXPECT_TRUE(pausing.passed);
}

TEST(MThread, StartsWithTheCallersSignalMask) {
    sigset_t blocked;
    sigset_t before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGUSR2);
    ASSERT_EQ(0, pthread_sigmask(SIG_BLOCK, &blocked, &before));
    sigset_t seen;
    sigemptyset(&seen);
    MThread thread;
    ASSERT_TRUE(thread.Create(
        [](void* argument) -> void* {
            pthread_sigmask(SIG_SETMASK, nullptr, static_cast<sigset_t*>(argument));
            return nullptr;
        },
        &seen));
    EXPECT_TRUE(thread.Wait());
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    EXPECT_EQ(1, sigismember(&seen, SIGUSR2));
}

TEST(MThread, StackIsAtLeastTheStatedSizeAndGuarded) {
    struct Stack {
        std::size_t size = 0;
        std::size_t guard = 0;
    } stack;
    MThread thread;
    ASSERT_TRUE(thread.Create(
        [](void* argument) -> void* {
            auto* const self = static_cast<Stack*>(argument);
            pthread_attr_t attributes;
            if (pthread_getattr_np(pthread_self(), &attributes) == 0) {
                pthread_attr_getstacksize(&attributes, &self->size);
                pthread_attr_getguardsize(&attributes, &self->guard);
                pthread_attr_destroy(&attributes);
            }
            return nullptr;
        },
        &stack));
    EXPECT_TRUE(thread.Wait());
    EXPECT_GE(stack.size, MThread::STACK_BYTES);
    EXPECT_GT(stack.guard, 0u);
}

TEST(MThread, OnceRunsOnceAndTheOthersWait) {
    constexpr int THREADS = 8;
    std::once_flag flag;
    int runs = 0;  // without a lock: the others must see it done
    std::atomic<int> sawIt{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < THREADS; ++i) {
        threads.emplace_back([&] {
            MThread::Once(flag, [&] { ++runs; });
            if (runs == 1)
                ++sawIt;
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(THREADS, sawIt.load());
}

TEST(MThreadDeathTest, ExceptionThatLeavesTheBodyEndsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            std::set_terminate([] { _exit(7); });
            MThread thread;
            thread.Create([](void*) -> void* { throw std::runtime_error("left"); }, nullptr);
            thread.Wait();
        },
        testing::ExitedWithCode(7), "");
}
