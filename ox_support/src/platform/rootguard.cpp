#include "platform/rootguard.h"

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <string_view>

#include "platform/file.h"
#include "platform/identitycalls.h"

namespace {

// 0 or the error number.
int SetThreadEffectiveUser(uid_t user) {
    return syscall(SET_USERS_CALL, UNCHANGED_USER, user, UNCHANGED_USER) == 0 ? 0 : errno;
}

}  // namespace

RootGuard::RootGuard() : m_previous(geteuid()) {
    if (m_previous == ROOT_USER)
        return;
    const int savedError = errno;
    m_error = SetThreadEffectiveUser(ROOT_USER);
    errno = savedError;
}

RootGuard::~RootGuard() {
    if (m_keep || m_error != 0 || m_previous == ROOT_USER)
        return;
    const int savedError = errno;
    if (SetThreadEffectiveUser(m_previous) != 0) {
        constexpr std::string_view MESSAGE = "A thread could not give up the root identity.\n";
        WriteAll(STDERR_FILENO, MESSAGE.data(), MESSAGE.size());
        std::abort();
    }
    errno = savedError;
}
