#include "proc/child.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <string_view>

#include "platform/file.h"
#include "platform/identitycalls.h"

namespace {
constexpr const char* SOURCE = "./ox_remote_dll/src/proc";
constexpr int SETUID_LINE = 553;  // fixed, as the path: known to those who read the status log
constexpr mode_t CHILD_MASK = 022;
constexpr int LAST_SIGNAL = 64;
constexpr std::size_t KERNEL_MASK_BYTES = 8;
// Enough for the longest path that the system takes and the words around it.
constexpr std::size_t MESSAGE_BYTES = PATH_MAX + 256;

// Nice values of the priorities 1 to 10; the entry of 0 and that of the unchanged one are not used.
constexpr std::array<int, 11> NICE = {0, 19, 16, 12, 8, 4, 0, -5, -10, -15, -20};

// A message that goes out in one write. What does not fit is left out.
class ChildMessage {
public:
    ChildMessage& operator<<(std::string_view text) {
        const std::size_t length = std::min(text.size(), m_text.size() - m_length);
        std::memcpy(m_text.data() + m_length, text.data(), length);
        m_length += length;
        return *this;
    }
    ChildMessage& operator<<(int number) {
        const auto end = std::to_chars(m_text.data() + m_length, m_text.data() + m_text.size(), number);
        if (end.ec == std::errc())
            m_length = static_cast<std::size_t>(end.ptr - m_text.data());
        return *this;
    }
    // The system's text for the error number.
    ChildMessage& Error(int error) {
        if (const char* text = strerrordesc_np(error))
            return *this << text;
        return *this << "Unknown error " << error;
    }
    void Write() const { WriteAll(STDERR_FILENO, m_text.data(), m_length); }

private:
    std::array<char, MESSAGE_BYTES> m_text;
    std::size_t m_length = 0;
};

bool SetUsers(uid_t real, uid_t effective, uid_t saved) {
    return syscall(SET_USERS_CALL, real, effective, saved) == 0;
}

[[noreturn]] void EndWithIdentityKept(int error) {
    ChildMessage message;
    message << "Unable to give up the root identity: ";
    message.Error(error) << " (" << error << ")\n";
    message.Write();
    _exit(error);
}

// Runs the body as root where the process may become it, else as it is.
template <typename Body>
void AsRoot(Body body) {
    const uid_t user = geteuid();
    const bool raised = user != ROOT_USER && SetUsers(UNCHANGED_USER, ROOT_USER, UNCHANGED_USER);
    body();
    // No program is started with more than it was to have.
    if (raised && !SetUsers(UNCHANGED_USER, user, UNCHANGED_USER))
        EndWithIdentityKept(errno);
}

void SetPriority(unsigned priority) {
    if (priority < 1 || priority >= NICE.size() || priority == oxProc::PRIORITY_UNCHANGED)
        return;
    AsRoot([nice = NICE[priority]] { setpriority(PRIO_PROCESS, 0, nice); });
}

void Redirect(int from, int to, const char* name, bool stillNeeded) {
    if (!DuplicateOnto(from, to)) {
        const int error = errno;
        ChildMessage message;
        message << "dup2 (" << name << ") error " << error << ": ";
        message.Error(error) << ".\n";
        message.Write();
        _exit(error);
    }
    if (!stillNeeded)
        close(from);
}

void KeepAcrossExec(int descriptor) {
    fcntl(descriptor, F_SETFD, 0);
}

// One descriptor may serve several streams: it is closed after its last use.
void ConnectStreams(const oxChildPlan& plan) {
    const int in = plan.standardInput;
    const int out = plan.standardOutput;
    const int err = plan.standardError;
    if (in != 0)
        Redirect(in, STDIN_FILENO, "stdin", in == out || in == err);
    if (out > STDOUT_FILENO)
        Redirect(out, STDOUT_FILENO, "stdout", out == err);
    else if (out == STDOUT_FILENO)
        KeepAcrossExec(STDOUT_FILENO);
    if (err == STDERR_FILENO)
        KeepAcrossExec(STDERR_FILENO);
    else if (err != 0)
        Redirect(err, STDERR_FILENO, "stderr", false);
}

// Closes what lies below the lowest free descriptor; above a gap they stay open, unless they are close-on-exec as all
// of the server's own.
void CloseInherited() {
    int descriptor;
    do {
        descriptor = open("/dev/null", O_RDWR);  // 0 to 2, where one is free: stays open, for the program
    } while (descriptor < 0 && errno == EINTR);
    for (; descriptor > STDERR_FILENO; --descriptor)
        close(descriptor);
}

// After the descriptors were closed, which the lower limit might prevent, and while root can still be had.
void RestoreFileLimit(const rlimit* limit) {
    if (limit == nullptr || setrlimit(RLIMIT_NOFILE, limit) == 0)
        return;
    bool set = false;
    AsRoot([&] { set = setrlimit(RLIMIT_NOFILE, limit) == 0; });
    rlimit now{};
    if (set || getrlimit(RLIMIT_NOFILE, &now) != 0)
        return;
    // The server lowered its hard limit and may not raise it again.
    now.rlim_cur = std::min(limit->rlim_cur, now.rlim_max);
    setrlimit(RLIMIT_NOFILE, &now);
}

// A real or saved id of root would let the program become root whenever it likes; shells and perl do by themselves. Any
// other real id that differs (a set-uid start) would put perl under its rules for tainted data.
void TakeEffectiveUserForGood() {
    const uid_t user = geteuid();
    const gid_t group = getegid();
    if (user == ROOT_USER || getuid() == user)
        return;
    const bool wasRoot = getuid() == ROOT_USER;
    const bool raised = SetUsers(UNCHANGED_USER, ROOT_USER, UNCHANGED_USER);
    if ((wasRoot && !raised) || (raised && syscall(SET_GROUP_LIST_CALL, 0, nullptr) != 0) ||
        syscall(SET_GROUPS_CALL, group, group, group) != 0 || !SetUsers(user, user, user))
        EndWithIdentityKept(errno);
}

void ChangeDirectory(const char* directory) {
    if (directory == nullptr || chdir(directory) == 0)
        return;
    const int error = errno;
    ChildMessage message;
    message << "Unable to change to directory \"" << directory << "\" : ";
    message.Error(error) << " (" << error << ")";
    message.Write();
    _exit(error);
}

void BecomeRealUser() {
    const uid_t user = getuid();
    if (SetUsers(UNCHANGED_USER, user, UNCHANGED_USER))
        return;
    const int error = errno;
    ChildMessage message;
    message << SOURCE << " " << SETUID_LINE << " - setuid(" << static_cast<int>(user) << "): ";
    message.Error(error);
    message.Write();
}

// What a service manager gave the server beyond its user's rights (low ports, say) is not for programs that it runs.
void DropAmbientCapabilities() {
    prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0);
}

// After the last change of ids, which takes it back. The server may have ended before.
void DieWithParent(pid_t parent) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent)
        _exit(EXIT_FAILURE);
}

// By the raw calls: the C library refuses the signals that it keeps for itself, of which the server ignores one.
void ResetSignals() {
    // Default handler, no flags, no restorer, empty mask, in whatever order.
    constexpr std::size_t KERNEL_ACTION_BYTES = 3 * sizeof(long) + KERNEL_MASK_BYTES;
    alignas(long) const unsigned char action[KERNEL_ACTION_BYTES] = {};
    for (int number = 1; number <= LAST_SIGNAL; ++number)
        syscall(SYS_rt_sigaction, number, action, nullptr, KERNEL_MASK_BYTES);
    alignas(long) const unsigned char none[KERNEL_MASK_BYTES] = {};
    syscall(SYS_rt_sigprocmask, SIG_SETMASK, none, nullptr, KERNEL_MASK_BYTES);
}
}  // namespace

void RunChild(const oxChildPlan& plan) noexcept {
    SetPriority(plan.priority);
    ConnectStreams(plan);
    CloseInherited();
    RestoreFileLimit(plan.fileLimit);
    if (!plan.runAsRealUser)
        TakeEffectiveUserForGood();
    ChangeDirectory(plan.directory);
    if (plan.runAsRealUser)
        BecomeRealUser();
    DropAmbientCapabilities();
    umask(CHILD_MASK);
    DieWithParent(plan.parent);
    ResetSignals();
    execv(plan.program, plan.arguments.data());

    const int error = errno;
    ChildMessage message;
    if (error == ENOENT) {
        message << "Couldn't launch \"" << plan.program << "\": ";
        message.Error(error) << " (" << error << ")\n";
    } else {
        message << "execl error #" << error << ": ";
        message.Error(error) << "\n";
    }
    message.Write();
    _exit(error);
}
