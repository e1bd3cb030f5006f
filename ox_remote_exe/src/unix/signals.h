// Taking all signals of a process in one loop.
#pragma once

#include <signal.h>

#include <chrono>

#include "platform/mutex.h"
#include "platform/thread.h"

// Blocks every signal of the calling thread, and so of each thread it creates later. The mask before that is handed
// back. Signals that arrive stay pending until a loop takes them.
sigset_t BlockAllSignals();

// While an object lives, every signal is blocked and its loop takes them one after the other, so that nothing runs in
// an asynchronous handler. One object exists at a time; it must outlive its loop.
class oxSignals : public MThread {
public:
    // The loop wakes this often without a signal, and then does nothing.
    static constexpr std::chrono::seconds WAIT_TIME{10};

    enum Handshake {
        HANDSHAKE_NONE = 0,
        HANDSHAKE_WAIT = 1,   // the loop waits for the semaphore before it starts
        HANDSHAKE_SIGNAL = 2  // the loop signals the semaphore when it starts
    };
    using Handler = void (*)(int, siginfo_t*, void*);

    oxSignals();
    // For a process that blocked the signals earlier: the mask that was in force before that.
    explicit oxSignals(const sigset_t& previousMask);
    // Drops the signals that are still pending, so that none strikes a process that is cleaning up, and puts the
    // previous mask back.
    ~oxSignals() override;

    // The steps of the hand-shake; `Semaphore` is its other end.
    virtual void SignalHandshake();
    virtual void WaitHandshake();
    // Takes signals until `OnSignal` returns true.
    virtual void WaitLoop();
    // Reacts to one signal; true ends the loop.
    virtual bool OnSignal(int number) = 0;
    // Installs an asynchronous handler; the previous one, or INSTALL_FAILED.
    virtual Handler InstallHandler(int number, Handler handler);
    static const Handler INSTALL_FAILED;  // -1

    void SetHandshake(Handshake mode) { m_handshake = mode; }
    void SetOwnThread(bool ownThread) { m_ownThread = ownThread; }
    MSemaphore& Semaphore() { return m_semaphore; }
    // Runs the loop to its end, or, with an own thread, starts it and returns; false when that cannot be created.
    bool Run();

    // The process's signal object, or null.
    static oxSignals* Current();
    // Whether the signal is the system's notice of something that the process itself met, and not sent by somebody: a
    // child that ended, a write to a closed pipe or beyond the file-size limit.
    static bool IsOwnNotice(const siginfo_t& info);

private:
    static void* CallWaitLoop(void* signals);

    sigset_t m_previousMask;
    sigset_t m_allSignals;
    MSemaphore m_semaphore{0};
    Handshake m_handshake = HANDSHAKE_NONE;
    bool m_ownThread = false;
};
