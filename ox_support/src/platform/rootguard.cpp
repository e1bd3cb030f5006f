#include "platform/rootguard.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>

#include "platform/file.h"

namespace {

#ifdef SYS_setresuid32
constexpr long SET_IDS_CALL = SYS_setresuid32;  // the other one takes 16-bit ids there
#else
constexpr long SET_IDS_CALL = SYS_setresuid;
#endif

constexpr uid_t ROOT = 0;
constexpr uid_t UNCHANGED = static_cast<uid_t>(-1);

// 0 or the error number.
int SetThreadEffectiveUser(uid_t user) {
    return syscall(SET_IDS_CALL, UNCHANGED, user, UNCHANGED) == 0 ? 0 : errno;
}

}  // namespace

RootGuard::RootGuard() : m_previous(geteuid()) {
    if (m_previous == ROOT)
        return;
    const int savedError = errno;
    m_error = SetThreadEffectiveUser(ROOT);
    errno = savedError;
}

RootGuard::~RootGuard() {
    if (m_keep || m_error != 0 || m_previous == ROOT)
        return;
    const int savedError = errno;
    if (SetThreadEffectiveUser(m_previous) != 0) {
        constexpr std::string_view MESSAGE = "A thread could not give up the root identity.\n";
        WriteAll(STDERR_FILENO, MESSAGE.data(), MESSAGE.size());
        std::abort();
    }
    errno = savedError;
}
