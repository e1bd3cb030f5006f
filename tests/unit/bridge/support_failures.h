// System and library calls that fail, for tests. The test program is linked so that the calls named here pass through
// this file; of the others' calls none is changed.
#pragma once

enum class FailingCall {
    MutexLock,
    MutexUnlock,
    CondWait,
    CondSignal,
    CondBroadcast,
    WaitPid,
    DuplicateText,  // strdup; the error number is not used
    System,         // syscall() with the number given
};

// While it lives, one call made by this thread, or by a child forked from it, fails with the error number: the first,
// or the one after as many as are to pass. There is one at a time for each thread.
class FailsOnce {
public:
    FailsOnce(FailingCall call, int error, int passing = 0) : FailsOnce(call, 0, error, passing) {}
    FailsOnce(long systemCall, int error, int passing = 0)
        : FailsOnce(FailingCall::System, systemCall, error, passing) {}
    ~FailsOnce();
    FailsOnce(const FailsOnce&) = delete;
    FailsOnce& operator=(const FailsOnce&) = delete;

    static bool HasFailed();  // the one of this thread

private:
    FailsOnce(FailingCall call, long systemCall, int error, int passing);
};

// How often any thread has called waitpid.
long WaitPidCalls();
