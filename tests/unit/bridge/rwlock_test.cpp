#include "rwlock.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <functional>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "bridge/support_failures.h"
#include "testing/waiting.h"

namespace {
using std::chrono::milliseconds;
using Operation = int (*)(RWLock&);

static_assert(RWLock::RWLOCK_VALID == 16435934);

int ReadLock(RWLock& lock) {
    return lock.ReadLock();
}
int ReadTryLock(RWLock& lock) {
    return lock.ReadTryLock();
}
int ReadUnlock(RWLock& lock) {
    return lock.ReadUnlock();
}
int WriteLock(RWLock& lock) {
    return lock.WriteLock();
}
int WriteTryLock(RWLock& lock) {
    return lock.WriteTryLock();
}
int WriteUnlock(RWLock& lock) {
    return lock.WriteUnlock();
}

bool Never() {
    return false;
}
bool AtOnce() {
    return true;
}

// A thread that can be cancelled at the operation, which must not return then.
class Waiter {
public:
    Waiter(RWLock& lock, Operation operation) : m_lock(lock), m_operation(operation) {
        if (pthread_create(&m_thread, nullptr, &Main, this) != 0)
            std::abort();
    }
    Waiter(const Waiter&) = delete;
    Waiter& operator=(const Waiter&) = delete;
    ~Waiter() { Join(); }

    void Cancel() { pthread_cancel(m_thread); }
    // True when the thread was cancelled.
    bool Join() {
        if (!std::exchange(m_joined, true))
            pthread_join(m_thread, &m_end);
        return m_end == PTHREAD_CANCELED;
    }
    bool Returned() const { return m_returned; }

private:
    static void* Main(void* argument) {
        auto* const self = static_cast<Waiter*>(argument);
        self->m_operation(self->m_lock);
        // What comes after the wait is not to be cancelled: the lock is held.
        pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr);
        self->m_returned = true;
        return nullptr;
    }

    RWLock& m_lock;
    const Operation m_operation;
    pthread_t m_thread{};
    std::atomic<bool> m_returned{false};
    bool m_joined = false;
    void* m_end = nullptr;
};

enum class Held { Free, OneReader, TwoReaders, Writer };

void Take(RWLock& lock, Held held) {
    if (held == Held::Writer) {
        ASSERT_EQ(0, lock.WriteLock());
    }
    if (held == Held::OneReader || held == Held::TwoReaders) {
        ASSERT_EQ(0, lock.ReadLock());
    }
    if (held == Held::TwoReaders) {
        ASSERT_EQ(0, lock.ReadLock());
    }
}

void Release(RWLock& lock, Held held) {
    if (held == Held::Writer) {
        ASSERT_EQ(0, lock.WriteUnlock());
    }
    if (held == Held::OneReader || held == Held::TwoReaders) {
        ASSERT_EQ(0, lock.ReadUnlock());
    }
    if (held == Held::TwoReaders) {
        ASSERT_EQ(0, lock.ReadUnlock());
    }
}

bool IsFree(RWLock& lock) {
    return lock.WriteTryLock() == 0 && lock.WriteUnlock() == 0 && lock.WaitingReaders() == 0 &&
           lock.WaitingWriters() == 0;
}
}  // namespace

TEST(RWLock, TriesAnswerAtOnceByWhatIsHeld) {
    const struct {
        Held held;
        int read;
        int write;
    } rows[] = {{Held::Free, 0, 0}, {Held::OneReader, 0, 16}, {Held::TwoReaders, 0, 16}, {Held::Writer, 16, 16}};
    for (const auto& row : rows) {
        SCOPED_TRACE(static_cast<int>(row.held));
        RWLock lock;
        Take(lock, row.held);
        for (int again = 0; again < 2; ++again) {
            EXPECT_EQ(row.read, lock.ReadTryLock());
            if (row.read == 0) {
                EXPECT_EQ(0, lock.ReadUnlock());
            }
            EXPECT_EQ(row.write, lock.WriteTryLock());
            if (row.write == 0) {
                EXPECT_EQ(0, lock.WriteUnlock());
            }
        }
        Release(lock, row.held);
        EXPECT_TRUE(IsFree(lock)) << "a refused try changes nothing";
    }
}

TEST(RWLock, ThirdReaderEntersWhileAWriterWaits) {
    RWLock lock;
    Take(lock, Held::TwoReaders);
    Waiter writer(lock, WriteLock);
    ASSERT_TRUE(Eventually([&] { return lock.WaitingWriters() == 1; }));
    EXPECT_EQ(0, lock.ReadLock());
    EXPECT_EQ(0, lock.ReadTryLock());
    EXPECT_EQ(1, lock.WaitingWriters());
    for (int readers = 4; readers > 0; --readers) {
        EXPECT_FALSE(writer.Returned());
        EXPECT_EQ(0, lock.ReadUnlock());
    }
    EXPECT_FALSE(writer.Join());
    EXPECT_EQ(0, lock.WaitingWriters());
    EXPECT_EQ(16, lock.ReadTryLock());
    EXPECT_EQ(0, lock.WriteUnlock());
}

TEST(RWLock, AReleasingWriterWakesAllReadersBeforeAnyWriter) {
    RWLock lock;
    Take(lock, Held::Writer);
    Waiter writer(lock, WriteLock);
    ASSERT_TRUE(Eventually([&] { return lock.WaitingWriters() == 1; }));
    Waiter first(lock, ReadLock);
    Waiter second(lock, ReadLock);
    ASSERT_TRUE(Eventually([&] { return lock.WaitingReaders() == 2; }));
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_FALSE(first.Join());
    EXPECT_FALSE(second.Join());
    EXPECT_EQ(1, lock.WaitingWriters());
    EXPECT_FALSE(writer.Returned());
    EXPECT_EQ(0, lock.ReadUnlock());
    EXPECT_EQ(1, lock.WaitingWriters());
    EXPECT_EQ(0, lock.ReadUnlock());
    EXPECT_FALSE(writer.Join());
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, AReleasingWriterWakesOneWriterWithoutReaders) {
    RWLock lock;
    Take(lock, Held::Writer);
    Waiter first(lock, WriteLock);
    Waiter second(lock, WriteLock);
    ASSERT_TRUE(Eventually([&] { return lock.WaitingWriters() == 2; }));
    EXPECT_EQ(0, lock.WriteUnlock());
    ASSERT_TRUE(Eventually([&] { return lock.WaitingWriters() == 1; }));
    EXPECT_EQ(16, lock.ReadTryLock());
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_FALSE(first.Join());
    EXPECT_FALSE(second.Join());
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, LastErrorIsTheCallingThreadsErrno) {
    RWLock lock;
    errno = ENOTTY;
    EXPECT_EQ(ENOTTY, lock.LastError());
    std::thread([&] {
        errno = EPERM;
        EXPECT_EQ(EPERM, lock.LastError());
    }).join();
    EXPECT_EQ(ENOTTY, lock.LastError());
    errno = 0;
}

TEST(RWLock, GivenUpWaitsLeaveTheCountsRight) {
    const struct {
        Held held;
        bool write;
    } rows[] = {{Held::Writer, false}, {Held::Writer, true}, {Held::OneReader, true}};
    for (const auto& row : rows) {
        RWLock lock;
        Take(lock, row.held);
        const auto wait = [&](const std::function<bool()>& giveUp) {
            return row.write ? lock.WriteLock(giveUp) : lock.ReadLock(giveUp);
        };
        EXPECT_EQ(ECANCELED, wait(AtOnce));
        std::atomic<bool> stop{false};
        std::atomic<int> asked{0};
        std::atomic<int> result{-1};
        std::thread waiter([&] {
            result = wait([&] {
                ++asked;
                return stop.load();
            });
        });
        EXPECT_TRUE(Eventually([&] { return asked >= 3; })) << "asks again and again";
        EXPECT_EQ(row.write ? 0 : 1, lock.WaitingReaders());
        EXPECT_EQ(row.write ? 1 : 0, lock.WaitingWriters());
        stop = true;
        waiter.join();
        EXPECT_EQ(ECANCELED, result.load());
        Release(lock, row.held);
        EXPECT_TRUE(IsFree(lock));
    }
}

TEST(RWLock, AFreeLockIsTakenWithoutAskingWhetherToGiveUp) {
    RWLock lock;
    EXPECT_EQ(0, lock.ReadLock(AtOnce));
    EXPECT_EQ(0, lock.ReadLock(AtOnce));
    EXPECT_EQ(0, lock.ReadUnlock());
    EXPECT_EQ(0, lock.ReadUnlock());
    EXPECT_EQ(0, lock.WriteLock(AtOnce));
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, WaitersThatMayGiveUpAreOrdinaryWaitersOtherwise) {
    RWLock lock;
    Take(lock, Held::Writer);
    Waiter writer(lock, [](RWLock& asked) { return asked.WriteLock(Never); });
    Waiter reader(lock, [](RWLock& asked) { return asked.ReadLock(std::function<bool()>()); });
    ASSERT_TRUE(Eventually([&] { return lock.WaitingWriters() == 1 && lock.WaitingReaders() == 1; }));
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_FALSE(reader.Join());
    EXPECT_EQ(1, lock.WaitingWriters());
    EXPECT_EQ(0, lock.ReadUnlock());
    EXPECT_FALSE(writer.Join());
    EXPECT_EQ(16, lock.WriteTryLock());
    EXPECT_EQ(0, lock.WriteUnlock());
}

TEST(RWLock, AnExceptionOutOfTheQuestionLeavesNothingBehind) {
    RWLock lock;
    Take(lock, Held::Writer);
    const auto throws = []() -> bool { throw std::runtime_error("asked"); };
    EXPECT_THROW(lock.ReadLock(throws), std::runtime_error);
    EXPECT_THROW(lock.WriteLock(throws), std::runtime_error);
    EXPECT_EQ(0, lock.WriteUnlock());
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, CancelledWaitsLeaveTheCountsRightAndTheMutexFree) {
    constexpr int ROUNDS = 1000;
    for (const Operation operation : {ReadLock, WriteLock}) {
        RWLock lock;
        Take(lock, Held::Writer);
        for (int round = 0; round < ROUNDS; ++round) {
            Waiter waiter(lock, operation);
            // Every other one is cancelled wherever it happens to be.
            if (round % 2 == 0) {
                ASSERT_TRUE(Eventually([&] { return lock.WaitingReaders() + lock.WaitingWriters() == 1; }));
            }
            waiter.Cancel();
            ASSERT_TRUE(waiter.Join());
            ASSERT_EQ(0, lock.WaitingReaders());
            ASSERT_EQ(0, lock.WaitingWriters());
        }
        Release(lock, Held::Writer);
        EXPECT_TRUE(IsFree(lock));
    }
}

TEST(RWLock, ACancelledWaiterKeepsNoWakeUpFromTheOthers) {
    constexpr int ROUNDS = 500;
    for (const Operation cancelled : {ReadLock, WriteLock}) {
        for (int round = 0; round < ROUNDS; ++round) {
            RWLock lock;
            Take(lock, Held::Writer);
            Waiter first(lock, cancelled);
            ASSERT_TRUE(Eventually([&] { return lock.WaitingReaders() + lock.WaitingWriters() == 1; }));
            Waiter writer(lock, WriteLock);
            ASSERT_TRUE(Eventually([&] { return lock.WaitingReaders() + lock.WaitingWriters() == 2; }));
            if (round % 2 == 0) {
                ASSERT_EQ(0, lock.WriteUnlock());
                first.Cancel();
            } else {
                first.Cancel();
                ASSERT_EQ(0, lock.WriteUnlock());
            }
            // Woken or cancelled: either the first has the lock now, and its release wakes the other, or the other.
            if (!first.Join()) {
                ASSERT_EQ(0, cancelled == ReadLock ? lock.ReadUnlock() : lock.WriteUnlock());
            }
            ASSERT_TRUE(Eventually([&] { return writer.Returned(); })) << round;
            ASSERT_EQ(0, lock.WriteUnlock());
            ASSERT_TRUE(IsFree(lock));
        }
    }
}

TEST(RWLock, WaitersThatGiveUpKeepNoWakeUpFromTheOthers) {
    constexpr int THREADS = 4;
    constexpr int ROUNDS = 20000;
    RWLock lock;
    std::atomic<int> writers{0};
    std::atomic<int> readers{0};
    std::atomic<int> wrong{0};
    std::atomic<int> givenUp{0};
    std::vector<std::thread> threads;
    for (int index = 0; index < THREADS; ++index) {
        threads.emplace_back([&, index] {
            for (int round = 0; round < ROUNDS; ++round) {
                const bool write = (round + index) % 3 == 0;
                // Half of them give up when asked, which is before the first wait.
                const bool gives = (round / 3 + index) % 2 == 0;
                const int status =
                    write ? lock.WriteLock(gives ? AtOnce : Never) : lock.ReadLock(gives ? AtOnce : Never);
                if (status == ECANCELED && gives) {
                    ++givenUp;
                    continue;
                }
                if (status != 0)
                    ++wrong;
                if (write) {
                    if (++writers != 1 || readers != 0)
                        ++wrong;
                    if (round % 16 == 0)
                        std::this_thread::yield();
                    --writers;
                    wrong += lock.WriteUnlock() != 0;
                } else {
                    ++readers;
                    if (writers != 0)
                        ++wrong;
                    --readers;
                    wrong += lock.ReadUnlock() != 0;
                }
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(0, wrong.load());
    EXPECT_GT(givenUp.load(), 0);
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, TheResultIsTheOperationsOwnUnderLoad) {
    constexpr int THREADS = 4;
    constexpr int ROUNDS = 250000;
    RWLock lock;
    std::atomic<int> wrong{0};
    long guarded = 0;  // without a lock of its own: written only by writers
    std::atomic<long> written{0};
    std::atomic<long> refused{0};
    std::atomic<int> writers{0};
    std::atomic<int> readers{0};
    std::vector<std::thread> threads;
    for (int index = 0; index < THREADS; ++index) {
        threads.emplace_back([&, index] {
            for (int round = 0; round < ROUNDS; ++round) {
                const int kind = (round + index) % 5;
                const bool write = kind >= 3;
                const int status = kind == 0   ? lock.ReadLock()
                                   : kind < 3  ? lock.ReadTryLock()
                                   : kind == 3 ? lock.WriteLock()
                                               : lock.WriteTryLock();
                const bool tried = kind != 0 && kind != 3;
                if (status == EBUSY && tried) {
                    ++refused;
                    continue;
                }
                if (status != 0)
                    ++wrong;
                if (write) {
                    if (++writers != 1 || readers != 0)
                        ++wrong;
                    if (round % 64 == 0)
                        std::this_thread::yield();
                    ++guarded;
                    ++written;
                    --writers;
                    wrong += lock.WriteUnlock() != 0;
                } else {
                    ++readers;
                    if (round % 64 == 0)
                        std::this_thread::yield();
                    if (writers != 0 || guarded != written)
                        ++wrong;
                    --readers;
                    wrong += lock.ReadUnlock() != 0;
                }
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(0, wrong.load());
    EXPECT_EQ(guarded, written.load());
    EXPECT_GT(guarded, 0);
    EXPECT_GT(refused.load(), 0);
    EXPECT_TRUE(IsFree(lock));
}

TEST(RWLock, TheDestructorWaitsForWhoeverHoldsTheLock) {
    for (const Held held : {Held::OneReader, Held::TwoReaders, Held::Writer}) {
        auto lock = std::make_unique<RWLock>();
        RWLock& used = *lock;
        Take(used, held);
        std::atomic<bool> destroyed{false};
        std::thread destroyer([&] {
            lock.reset();
            destroyed = true;
        });
        std::this_thread::sleep_for(milliseconds(20));  // most times it waits by then
        EXPECT_FALSE(destroyed);
        Release(used, held);
        destroyer.join();
    }
}

TEST(RWLock, TheDestructorWaitsForWaitersAndThoseWhoGiveUp) {
    constexpr int ROUNDS = 50;
    for (int round = 0; round < ROUNDS; ++round) {
        auto lock = std::make_unique<RWLock>();
        RWLock& used = *lock;
        Take(used, Held::Writer);
        std::atomic<int> held{0};
        const auto take = [&](Operation acquire, Operation release) {
            return std::thread([&, acquire, release] {
                EXPECT_EQ(0, acquire(used));
                ++held;
                EXPECT_EQ(0, release(used));
            });
        };
        std::atomic<bool> stop{false};
        std::vector<std::thread> threads;
        threads.push_back(take(ReadLock, ReadUnlock));
        threads.push_back(take(WriteLock, WriteUnlock));
        threads.push_back(take(WriteLock, WriteUnlock));
        threads.emplace_back([&] {
            if (used.WriteLock([&] { return stop.load(); }) == 0)
                used.WriteUnlock();
        });
        ASSERT_TRUE(Eventually([&] { return used.WaitingReaders() == 1 && used.WaitingWriters() == 3; }));
        std::thread destroyer([&] { lock.reset(); });
        if (round % 2 == 0)
            std::this_thread::sleep_for(milliseconds(1));
        stop = true;
        EXPECT_EQ(0, used.WriteUnlock());
        destroyer.join();
        for (std::thread& thread : threads)
            thread.join();
        EXPECT_EQ(3, held.load());
    }
}

TEST(RWLock, TheDestructorWaitsForACancelledWaiter) {
    for (const Operation operation : {ReadLock, WriteLock}) {
        auto lock = std::make_unique<RWLock>();
        RWLock& used = *lock;
        Take(used, Held::Writer);
        Waiter waiter(used, operation);
        ASSERT_TRUE(Eventually([&] { return used.WaitingReaders() + used.WaitingWriters() == 1; }));
        std::thread destroyer([&] { lock.reset(); });
        waiter.Cancel();
        EXPECT_TRUE(waiter.Join());
        EXPECT_EQ(0, used.WriteUnlock());
        destroyer.join();
    }
}

TEST(RWLock, AFailedWakeUpIsTheResultOfTheWritersUnlock) {
    const struct {
        Operation waiting;
        FailingCall call;
    } rows[] = {{ReadLock, FailingCall::CondBroadcast}, {WriteLock, FailingCall::CondSignal}};
    for (const auto& row : rows) {
        RWLock lock;
        Take(lock, Held::Writer);
        Waiter waiter(lock, row.waiting);
        ASSERT_TRUE(Eventually([&] { return lock.WaitingReaders() + lock.WaitingWriters() == 1; }));
        {
            const FailsOnce failure(row.call, EINVAL);
            EXPECT_EQ(EINVAL, lock.WriteUnlock());
        }
        EXPECT_EQ(0, lock.WriteTryLock()) << "the mutex is free and the writer gone";
        EXPECT_EQ(0, lock.WriteUnlock());
        EXPECT_FALSE(waiter.Join());
        EXPECT_EQ(0, row.waiting == ReadLock ? lock.ReadUnlock() : lock.WriteUnlock());
    }
}

namespace {
int UseReadCleanup(RWLock& lock) {
    RWLock::ReadCleanup(&lock);
    return 0;
}
int UseWriteCleanup(RWLock& lock) {
    RWLock::WriteCleanup(&lock);
    return 0;
}
int UseDestructor(RWLock& lock) {
    lock.~RWLock();
    return 0;
}
int UseReadLockOrGiveUp(RWLock& lock) {
    lock.ReadLock(Never);
    return 0;
}
int UseWriteLockOrGiveUp(RWLock& lock) {
    lock.WriteLock(Never);
    return 0;
}

struct Use {
    Operation use;
    const char* function;  // as a regular expression
};
constexpr Use CALLS[] = {
    {ReadLock, "int RWLock::ReadLock\\(\\)"},         {UseReadLockOrGiveUp, "int RWLock::ReadLock\\(\\)"},
    {ReadTryLock, "int RWLock::ReadTryLock\\(\\)"},   {ReadUnlock, "int RWLock::ReadUnlock\\(\\)"},
    {WriteLock, "int RWLock::WriteLock\\(\\)"},       {UseWriteLockOrGiveUp, "int RWLock::WriteLock\\(\\)"},
    {WriteTryLock, "int RWLock::WriteTryLock\\(\\)"}, {WriteUnlock, "int RWLock::WriteUnlock\\(\\)"},
    {UseDestructor, "RWLock::~RWLock\\(\\)"},
};

// Memory whose lock the compiler cannot know to be gone.
struct Storage {
    alignas(RWLock) unsigned char bytes[sizeof(RWLock)];
    RWLock* volatile lock = new (static_cast<void*>(bytes)) RWLock;
};

std::string AssertionLine(const char* function, const char* text) {
    return std::string(": \\./ox_remote_dll/src/rwlock:[0-9]+: ") + function + ": Assertion `" + text + "' failed\\.";
}
}  // namespace

TEST(RWLockDeathTest, AnyCallOnADestroyedLockFailsTheValidityAssertion) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    for (const Use& call : CALLS) {
        EXPECT_EXIT(
            {
                Storage storage;
                storage.lock->~RWLock();
                call.use(*storage.lock);
            },
            testing::KilledBySignal(SIGABRT), AssertionLine(call.function, "m_bValid == RWLOCK_VALID"));
    }
}

TEST(RWLockDeathTest, AFailingMutexEndsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    for (const FailingCall failing : {FailingCall::MutexLock, FailingCall::MutexUnlock}) {
        for (const Use& call : CALLS) {
            EXPECT_EXIT(
                {
                    Storage storage;
                    const FailsOnce failure(failing, EINVAL);
                    call.use(*storage.lock);
                },
                testing::KilledBySignal(SIGABRT), AssertionLine(call.function, "0"));
        }
    }
    const Use cleanups[] = {{UseReadCleanup, "static void RWLock::ReadCleanup\\(void \\*\\)"},
                            {UseWriteCleanup, "static void RWLock::WriteCleanup\\(void \\*\\)"}};
    for (const Use& cleanup : cleanups) {
        EXPECT_EXIT(
            {
                Storage storage;
                const FailsOnce failure(FailingCall::MutexUnlock, EINVAL);
                cleanup.use(*storage.lock);
            },
            testing::KilledBySignal(SIGABRT), AssertionLine(cleanup.function, "0"));
    }
}

TEST(RWLockDeathTest, AFailingConditionEndsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const Use waits[] = {{ReadLock, "int RWLock::ReadLock\\(\\)"},
                         {WriteLock, "int RWLock::WriteLock\\(\\)"},
                         {UseDestructor, "RWLock::~RWLock\\(\\)"}};
    for (const Use& wait : waits) {
        EXPECT_EXIT(
            {
                Storage storage;
                storage.lock->WriteLock();
                const FailsOnce failure(FailingCall::CondWait, EINVAL);
                wait.use(*storage.lock);
            },
            testing::KilledBySignal(SIGABRT), AssertionLine(wait.function, "0"));
    }
    EXPECT_EXIT(
        {
            RWLock lock;
            lock.ReadLock();
            Waiter writer(lock, WriteLock);
            Eventually([&] { return lock.WaitingWriters() == 1; });
            const FailsOnce failure(FailingCall::CondSignal, EINVAL);
            lock.ReadUnlock();
        },
        testing::KilledBySignal(SIGABRT), AssertionLine("int RWLock::ReadUnlock\\(\\)", "0"));
}
