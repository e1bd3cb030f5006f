#include "unix/processwatch.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <thread>

#include "platform/poll.h"

namespace {
using namespace std::chrono_literals;

constexpr long PIDFD_OPEN = 434;  // the same number on every machine; older C libraries have no name for it
constexpr auto TABLE_STEP = 50ms;

// "12 (name) Z 1 ...": the name may hold anything, the last ")" ends it.
bool IsZombie(pid_t pid) {
    std::string text;
    if (!ReadWholeFile("/proc/" + std::to_string(pid) + "/stat", text))
        return false;
    const std::size_t nameEnd = text.rfind(')');
    if (nameEnd == std::string::npos || nameEnd + 2 >= text.size())
        return false;
    const char state = text[nameEnd + 2];
    return state == 'Z' || state == 'X';
}
}  // namespace

oxProcessWatch::oxProcessWatch(pid_t pid, Means means) : m_pid(pid) {
    if (pid <= 0 || means == Means::Table)
        return;
    m_descriptor.Reset(static_cast<int>(syscall(PIDFD_OPEN, pid, 0)));
    m_gone = !m_descriptor && errno == ESRCH;
}

bool oxProcessWatch::HasEnded() const {
    if (m_gone)
        return true;
    if (m_descriptor)
        return WaitReadable(m_descriptor.Get(), 0ms) == Readiness::Ready;
    return HasEndedByTable();
}

bool oxProcessWatch::HasEndedByTable() const {
    if (m_pid <= 0)
        return false;
    return (kill(m_pid, 0) != 0 && errno == ESRCH) || IsZombie(m_pid);
}

bool oxProcessWatch::WaitEnd(std::chrono::milliseconds limit) const {
    if (m_gone)
        return true;
    if (m_descriptor)
        return WaitReadable(m_descriptor.Get(), limit) == Readiness::Ready;
    const auto deadline = std::chrono::steady_clock::now() + limit;
    while (!HasEndedByTable()) {
        const auto left = deadline - std::chrono::steady_clock::now();
        if (left <= 0ms)
            return false;
        std::this_thread::sleep_for(std::min<std::chrono::nanoseconds>(left, TABLE_STEP));
    }
    return true;
}
