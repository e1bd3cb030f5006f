// The reader/writer lock of the scripts.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>

#include "platform/mutex.h"

// Many readers or one writer. Readers enter whenever no writer holds the lock, also while writers wait, and a
// releasing writer wakes all waiting readers before any writer: writers can starve under a steady stream of readers,
// and that preference is deliberate.
//
// Safe against cancellation of a waiting thread (clean-up handlers take the waiting count back). Use after destruction
// and failures of the primitives end the process by an assertion. Every lock operation returns the result of that
// operation: 0, EBUSY (16) when a try would block, or a primitive's error code.
class RWLock {
public:
    static constexpr std::uint32_t RWLOCK_VALID = 0xFACADE;

    RWLock();
    // Waits until nobody holds the lock or waits for it.
    virtual ~RWLock();
    RWLock(const RWLock&) = delete;
    RWLock& operator=(const RWLock&) = delete;

    virtual int ReadLock();
    virtual int ReadTryLock();
    virtual int ReadUnlock();
    virtual int WriteLock();
    virtual int WriteTryLock();
    virtual int WriteUnlock();
    virtual int LastError();  // the calling thread's errno

    // Like ReadLock and WriteLock, but ask now and then (every GIVE_UP_INTERVAL) whether to give up the wait; then the
    // result is ECANCELED and nothing is held. The function is called with the lock's mutex held and must not use it.
    // An exception that it throws leaves the wait as a cancellation does.
    static constexpr std::chrono::milliseconds GIVE_UP_INTERVAL{100};
    int ReadLock(const std::function<bool()>& giveUp);
    int WriteLock(const std::function<bool()>& giveUp);
    // For tests and diagnosis; under the mutex.
    int WaitingReaders();
    int WaitingWriters();

    // What a waiting thread that is cancelled runs, with the mutex held.
    static void ReadCleanup(void* lock);
    static void WriteCleanup(void* lock);

private:
    using GiveUp = std::function<bool()>;
    int Read(const GiveUp* giveUp);
    int Write(const GiveUp* giveUp);
    void Enter(const char* function);
    int Leave(int status, const char* function);
    [[noreturn]] void Fail(int status, const void* primitive, const char* function);
    void CheckValid(const char* function) const;
    int WaitOn(MCondVar& condition, const GiveUp* giveUp, const char* function);
    void WaitSliceOn(MCondVar& condition, const char* function);
    int WakeDestructor();
    int LeftWithoutLock();

    std::int32_t m_status = 0;                       // result of the last operation of any thread
    const void* m_error = nullptr;                   // the primitive that failed last, for a core file
    volatile std::uint32_t m_bValid = RWLOCK_VALID;  // volatile: else the destructor's last store is optimised away
    MMutex m_mutex;
    MCondVar m_readOK;
    MCondVar m_writeOK;
    bool m_writer = false;
    int m_readers = 0;
    int m_readersWaiting = 0;
    int m_writersWaiting = 0;
    bool m_destroying = false;  // the destructor waits: it has to be woken too
};
