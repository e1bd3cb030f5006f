#include "proc.h"

#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <thread>

#include "platform/assertion.h"
#include "platform/poll.h"
#include "platform/text.h"
#include "proc/child.h"

namespace {
using namespace std::chrono_literals;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr long PIDFD_OPEN = 434;  // the same number on every machine; older C libraries have no name for it
constexpr auto LONGEST_SLEEP = 1000ms;
constexpr auto FIRST_NAP = 1ms;
constexpr auto LONGEST_NAP = 50ms;
constexpr std::uint32_t MILLISECONDS_PER_SECOND = 1000;
constexpr int NOT_WAITED = -2;
constexpr int ALLOCATION_LINE = 205;

std::optional<rlimit> childFileLimit;

// The sanitizers keep books in the process's memory, which a child must not share with it.
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
#define OX_CHILD_COPIES_MEMORY 1
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer) || __has_feature(address_sanitizer) || __has_feature(memory_sanitizer)
#define OX_CHILD_COPIES_MEMORY 1
#endif
#endif

#ifdef OX_CHILD_COPIES_MEMORY
pid_t StartChild(const oxChildPlan& plan) {
    const pid_t child = fork();
    if (child == 0)
        RunChild(plan);
    return child;
}
#else
// As fork, but the child runs in the memory of this process, on a stack of its own, and this thread sleeps until the
// program starts: copying the tables of that memory, and copying pages that other threads write to meanwhile, costs a
// fifth of what a small script does. `RunChild` touches nothing but its stack and the plan.
pid_t StartChild(const oxChildPlan& plan) {
    constexpr std::size_t STACK_BYTES = std::size_t{64} * 1024;
    alignas(64) std::array<char, STACK_BYTES> stack;
    const auto run = [](void* argument) -> int { RunChild(*static_cast<const oxChildPlan*>(argument)); };
    return clone(run, stack.data() + stack.size(), CLONE_VM | CLONE_VFORK | SIGCHLD, const_cast<oxChildPlan*>(&plan));
}
#endif

// Between the fork and the start of the program no handler of the server's may run in the child.
class SignalsHeld {
public:
    SignalsHeld() {
        sigset_t all;
        sigfillset(&all);
        pthread_sigmask(SIG_SETMASK, &all, &m_before);
    }
    ~SignalsHeld() { pthread_sigmask(SIG_SETMASK, &m_before, nullptr); }
    SignalsHeld(const SignalsHeld&) = delete;
    SignalsHeld& operator=(const SignalsHeld&) = delete;

private:
    sigset_t m_before;
};
}  // namespace

oxProc::oxProc() = default;
oxProc::~oxProc() = default;

void oxProc::SetChildFileLimit(const rlimit& limit) {
    childFileLimit = limit;
}

void oxProc::SetErrorText(const char* format, ...) {
    va_list values;
    va_start(values, format);
    std::vsnprintf(m_errorText, sizeof m_errorText, format, values);
    va_end(values);
}

const char* oxProc::GetErrorText() {
    return m_errorText;
}

// The words stand between single blanks; other white space belongs to them.
void oxProc::TakeArguments(const char* arguments) {
    const std::unique_ptr<char, decltype(&std::free)> copy(strdup(arguments), &std::free);
    OX_ASSERT_AT(copy, "lpTempStr", "./ox_remote_dll/src/proc", ALLOCATION_LINE,
                 "int oxProc::Spawn(const char *, const char *, const char *, int, unsigned int)");
    m_commandLine = copy.get();
    m_arguments.clear();
    char* rest = nullptr;
    for (char* word = strtok_r(copy.get(), " ", &rest); word != nullptr; word = strtok_r(nullptr, " ", &rest))
        m_arguments.emplace_back(word);
}

int oxProc::Spawn(const char* program, const char* arguments, const char* directory, bool wait, unsigned priority) {
    if (program != nullptr)
        m_program = program;
    if (arguments != nullptr)
        TakeArguments(arguments);

    oxChildPlan plan;
    plan.program = m_program.c_str();
    plan.arguments[0] = m_program.data();
    const std::size_t count = std::min(m_arguments.size(), MAX_ARGUMENTS);
    for (std::size_t index = 0; index < count; ++index)
        plan.arguments[index + 1] = m_arguments[index].data();
    plan.directory = directory;
    plan.priority = priority;
    plan.runAsRealUser = m_runAsRealUser == 1;
    plan.standardInput = m_childStdin;
    plan.standardOutput = m_childStdout;
    plan.standardError = m_childStderr;
    plan.fileLimit = childFileLimit ? &*childFileLimit : nullptr;
    m_parentPid = getpid();
    plan.parent = m_parentPid;

    pid_t child = 0;
    int error = 0;
    {
        const SignalsHeld held;
        child = StartChild(plan);
        error = errno;
    }
    if (child < 0) {
        SetErrorText("Fork() error %d: %s.\n", error, GetLastErrorText(error));
        WriteAll(STDERR_FILENO, m_errorText, std::strlen(m_errorText));
        return 0;
    }
    m_pid = child;
    m_endDescriptor.Reset(static_cast<int>(syscall(PIDFD_OPEN, child, 0)));
    CloseChildEnds();
    if (wait) {
        const int result = Wait(NO_LIMIT);
        if (result == STILL_RUNNING || result == NOT_WAITED)
            Terminate(false);
    }
    return m_pid;
}

// Each number once: a second close might hit what another thread has just opened.
void oxProc::CloseChildEnds() {
    int* const ends[] = {&m_childStdin, &m_childStdout, &m_childStderr};
    for (int* const end : ends) {
        const int descriptor = *end;
        if (descriptor != 0)
            close(descriptor);
        for (int* const other : ends) {
            if (*other == descriptor)
                *other = 0;
        }
    }
}

bool oxProc::IsParent() const {
    return getpid() == m_parentPid;
}

// Without allocating: the child is reaped by now, and must not be forgotten for want of memory.
int oxProc::DescribeEnd(int pid, int status, char* text, std::size_t size) {
    constexpr int SIGNAL_BITS = 0x7F;
    constexpr int CORE_FLAG = 0x80;
    const auto say = [&](const char* format, int code) {
        std::snprintf(text, size, format, pid, code);
        return code;
    };
    const int signalBits = status & SIGNAL_BITS;
    if (signalBits == 0)
        return say("Child %d exited w/code %d.", (status >> 8) & 0xFF);
    if (signalBits != SIGNAL_BITS)
        return say("Child %d terminated abnormally w/code %d.", signalBits);
    // Hardly ever seen: a dumped core has signal bits too and was told above.
    if ((status & CORE_FLAG) != 0)
        return say("Child %d cored w/code %d.", CORE_FLAG);
    return say("Child %d stopped w/code %d.", (status >> 8) & 0xFF);
}

int oxProc::Reaped(int result) {
    m_pid = 0;
    m_endDescriptor.Reset();
    return result;
}

int oxProc::Look() {
    int status = 0;
    do
        m_lastWait = waitpid(m_pid, &status, WNOHANG);
    while (m_lastWait < 0 && errno == EINTR);
    if (m_lastWait == 0)
        return STILL_RUNNING;
    if (m_lastWait == m_pid) {
        return Reaped(DescribeEnd(m_pid, status, m_errorText, sizeof m_errorText));
    }
    const int error = errno;
    if (error == ECHILD) {
        SetErrorText("Child %d terminated before wait called.", m_pid);
        return Reaped(0);
    }
    SetErrorText("Wait failed w/code %d.", error);
    return Reaped(error);
}

// Returns early when the child ends. Short naps serve where the descriptor cannot: there is none, or it is readable
// and the child cannot be reaped yet, or not by this process.
void oxProc::AwaitEnd(milliseconds limit) {
    const bool watched = m_endDescriptor && m_nap == 0ms && IsParent();
    if (watched && WaitReadable(m_endDescriptor.Get(), limit) == Readiness::TimedOut)
        return;
    if (!watched)
        std::this_thread::sleep_for(std::min(limit, m_nap));
    m_nap = std::clamp<milliseconds>(m_nap * 2, FIRST_NAP, LONGEST_NAP);
}

// Limits count whole seconds, and any limit but 0 is at least one.
int oxProc::Wait(std::uint32_t milliseconds) {
    if (m_pid == 0)
        return 0;
    const bool limited = milliseconds != NO_LIMIT;
    const std::chrono::seconds time(std::max(milliseconds / MILLISECONDS_PER_SECOND, 1U));
    const auto deadline = steady_clock::now() + time;
    int result = STILL_RUNNING;
    m_nap = 0ms;
    while (true) {
        if (IsParent())
            result = Look();
        if (m_pid == 0 || milliseconds == 0)
            return result;
        auto sleep = LONGEST_SLEEP;
        if (limited) {
            const auto left = deadline - steady_clock::now();
            if (left < 0ms)
                return result;
            sleep = std::min(sleep, std::chrono::ceil<std::chrono::milliseconds>(left));
        }
        AwaitEnd(sleep);
    }
}

void oxProc::Terminate(bool wait) {
    m_lastWait = 0;
    if (m_pid != 0 && kill(m_pid, SIGINT) != 0)
        m_lastWait = errno;
    if (wait)
        Wait(NO_LIMIT);
}

void oxProc::Kill() {
    m_lastWait = 0;
    if (m_pid != 0 && kill(m_pid, SIGKILL) != 0)
        m_lastWait = errno;
}
