#include "users/authshadow.h"

#include <shadow.h>

#include <cerrno>
#include <cstring>

#include "platform/rootguard.h"
#include "platform/text.h"

namespace {

constexpr std::size_t ENTRY_BYTES = 8192;

// Why a look-up gave no entry; 0 when there simply is none. Some name services swallow the reason that another one was
// not allowed to look, so where the thread could not become root that counts as the reason.
int LookUpError(int result, int errorNumber, const RootGuard& root) {
    if (result != 0)
        return result;
    if (errorNumber != 0 && errorNumber != ENOENT && errorNumber != ESRCH)
        return errorNumber;
    return root.Error();
}

}  // namespace

oxAuthShadow::oxAuthShadow(const char* user, const char* password) : oxAuthenticate(user, password) {
    if (user != nullptr && password != nullptr)
        oxAuthShadow::Authenticate(user, password);
}

bool oxAuthShadow::Authenticate(const char* user, const char* password) {
    if (!Begin(user, password))
        return false;
    const RootGuard root;
    char buffer[ENTRY_BYTES];
    spwd entry{};
    spwd* found = nullptr;
    errno = 0;
    const int result = getspnam_r(m_user, &entry, buffer, sizeof buffer, &found);
    if (found == nullptr) {
        if (const int error = LookUpError(result, errno, root); error != 0)
            Fail(error, GetLastErrorText(error));
        return false;
    }
    // Unlike in the passwd file, no password means no login.
    if (found->sp_pwdp != nullptr && found->sp_pwdp[0] != '\0')
        m_authenticated = Matches(m_password, found->sp_pwdp);
    explicit_bzero(buffer, sizeof buffer);
    return m_authenticated;
}
