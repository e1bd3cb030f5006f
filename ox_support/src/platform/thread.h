// The platform's thread class: one object is one thread of control, which may be run again after it ended.
#pragma once

#include <pthread.h>
#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "platform/mutex.h"

// The outcome of a thread operation: 0, or the error number of the pthreads call that failed.
class MThreadError {
public:
    constexpr MThreadError() = default;
    constexpr explicit MThreadError(int code) : m_code(code) {}

    int Code() const { return m_code; }
    std::string Text() const;  // the system's text for the code
    explicit operator bool() const { return m_code != 0; }

private:
    int m_code = 0;
};

// A thread. `Create` starts it, `Wait` returns when its body has ended, from any thread and as often as asked.
//
// Ownership: the object must outlive the thread's body; the destructor waits for it. Detaching only marks the
// thread: `Wait` and the destructor still wait for the body, so that an object is never used after its end.
// Exactly one join is made for each thread, by whoever comes last.
//
// Errors: nothing throws; a failed operation returns false and `LastError` says why. An exception that leaves a
// thread's body ends the process through the terminate handler.
class MThread {
public:
    // The entry is a static function taking the object it works on; its result is not used.
    using Entry = void* (*)(void* argument);

    // Only recorded: the threads of a server that waits for input gain nothing from scheduling classes.
    enum class Priority { Idle = 0, Low = 1, Normal = 2, High = 3, Realtime = 4 };

    // Enough for the largest buffers of a request and what PAM needs beside them, and small enough for some
    // thousand threads in the 3 GB of a 32-bit process. A guard page lies below.
    static constexpr std::size_t STACK_BYTES = std::size_t{1024} * 1024;

    // With Kept::Yes the object's runs are done by threads that are kept for a moment after their work (MThreadCache);
    // nothing else about the object changes. For short work that comes often.
    enum class Kept { No, Yes };

    explicit MThread(Priority priority = Priority::Normal, Kept kept = Kept::No);
    virtual ~MThread();
    MThread(const MThread&) = delete;
    MThread& operator=(const MThread&) = delete;

    // Starts the thread with the signal mask of the caller. False when it could not be started or still runs. An
    // ended earlier run of the object is joined first.
    bool Create(Entry entry, void* argument);
    // Marks the thread as detached; see the class comment. `LastError` is ESRCH when no thread was started and EINVAL
    // when it is marked already.
    void Detach();
    // Waits until the body has ended. True at once when no thread was started; from the thread itself it
    // returns false (EDEADLK) at once.
    bool Wait();
    // As `Wait`, but gives up after the time; true when the body has ended.
    bool Wait(std::chrono::milliseconds limit);
    // Asks the body to end. Bodies that can be cancelled look at `IsCancelled`; nothing is torn away from under a
    // running function. The next `Create` takes the request back.
    void Cancel();
    bool IsCancelled() const { return m_cancelled.load(); }
    // Waits, for the body of this thread: true when the time has passed, false at once when the thread is cancelled.
    bool Pause(std::chrono::milliseconds time);
    bool IsRunning() const;

    // The kernel's id of the started thread (0 before the first start); in log lines with 0x%X.
    unsigned Id() const;
    static unsigned CurrentId();

    Priority GetPriority() const { return m_priority; }
    MThreadError LastError() const;

    // Runs the function once for each flag, also when several threads ask at the same time; the others wait.
    static void Once(std::once_flag& flag, const std::function<void()>& function);

private:
    struct Run;  // what the object and its running thread share
    static int Launch(const std::shared_ptr<Run>& run, Kept kept);
    static int StartThread(pthread_t* thread, int detachState, void* (*entry)(void*), void* argument);
    static void* Main(void* argument);
    std::shared_ptr<Run> CurrentRun() const;
    bool WaitForRun(const std::optional<std::chrono::milliseconds>& limit);
    void SetError(int code);

    const Priority m_priority;
    const Kept m_kept;
    MMutex m_pauseMutex;
    MCondVar m_pauseEnd;
    mutable MMutex m_mutex;  // over the two below
    std::shared_ptr<Run> m_run;
    MThreadError m_error;
    std::atomic<bool> m_cancelled{false};
};
