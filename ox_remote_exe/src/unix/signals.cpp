#include "unix/signals.h"

#include <unistd.h>

#include <atomic>

namespace {
std::atomic<oxSignals*> current{nullptr};

sigset_t AllSignals() {
    sigset_t all;
    sigfillset(&all);
    return all;
}

// Both calls, since the first is undefined where there are threads and the second where there are none.
sigset_t SetMask(const sigset_t& mask) {
    sigset_t previous;
    sigprocmask(SIG_SETMASK, &mask, &previous);
    pthread_sigmask(SIG_SETMASK, &mask, nullptr);
    return previous;
}
}  // namespace

// The system's own value for a failure.
// NOLINTNEXTLINE(performance-no-int-to-ptr)
const oxSignals::Handler oxSignals::INSTALL_FAILED = reinterpret_cast<oxSignals::Handler>(-1);

sigset_t BlockAllSignals() {
    return SetMask(AllSignals());
}

oxSignals::oxSignals() : oxSignals(BlockAllSignals()) {}

oxSignals::oxSignals(const sigset_t& previousMask) : m_previousMask(previousMask), m_allSignals(AllSignals()) {
    BlockAllSignals();
    current = this;
}

oxSignals::~oxSignals() {
    const timespec noTime{};
    while (sigtimedwait(&m_allSignals, nullptr, &noTime) > 0) {
    }
    SetMask(m_previousMask);
    oxSignals* self = this;
    current.compare_exchange_strong(self, nullptr);
}

oxSignals* oxSignals::Current() {
    return current;
}

void oxSignals::SignalHandshake() {
    m_semaphore.Signal();
}
void oxSignals::WaitHandshake() {
    m_semaphore.Wait();
}

bool oxSignals::IsOwnNotice(const siginfo_t& info) {
    switch (info.si_signo) {
        case SIGCHLD:
            return info.si_code > 0;
        case SIGPIPE:
        case SIGXFSZ:
            return info.si_pid == getpid();
        default:
            return false;
    }
}

void oxSignals::WaitLoop() {
    if (m_handshake == HANDSHAKE_WAIT)
        WaitHandshake();
    else if (m_handshake == HANDSHAKE_SIGNAL)
        SignalHandshake();
    timespec limit{};
    limit.tv_sec = WAIT_TIME.count();
    for (;;) {
        siginfo_t info{};
        const int number = sigtimedwait(&m_allSignals, &info, &limit);
        // Only a signal that somebody sent is a command.
        if (number < 0 || IsOwnNotice(info))
            continue;
        if (OnSignal(number))
            return;
    }
}

void* oxSignals::CallWaitLoop(void* signals) {
    static_cast<oxSignals*>(signals)->WaitLoop();
    return nullptr;
}

bool oxSignals::Run() {
    if (!m_ownThread) {
        WaitLoop();
        return true;
    }
    if (!Create(&CallWaitLoop, this))
        return false;
    Detach();
    return true;
}

oxSignals::Handler oxSignals::InstallHandler(int number, Handler handler) {
    struct sigaction action {};
    struct sigaction previous {};
    action.sa_sigaction = handler;
    sigemptyset(&action.sa_mask);
    sigaddset(&action.sa_mask, SIGINT);
    sigaddset(&action.sa_mask, SIGQUIT);
    sigaddset(&action.sa_mask, SIGTERM);
    action.sa_flags = SA_SIGINFO | SA_RESTART | SA_INTERRUPT;
    if (sigaction(number, &action, &previous) != 0)
        return INSTALL_FAILED;
    return previous.sa_sigaction;
}
