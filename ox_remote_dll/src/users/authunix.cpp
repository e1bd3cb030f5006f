#include "users/authunix.h"

#include <pwd.h>

#include <cstring>

#include "platform/text.h"

namespace {
constexpr std::size_t ENTRY_BYTES = 512;
}

oxAuthUnix::oxAuthUnix(const char* user, const char* password) : oxAuthenticate(user, password) {
    if (user != nullptr && password != nullptr)
        oxAuthUnix::Authenticate(user, password);
}

bool oxAuthUnix::Authenticate(const char* user, const char* password) {
    if (!Begin(user, password))
        return false;
    char buffer[ENTRY_BYTES];
    passwd entry{};
    passwd* found = nullptr;
    if (const int error = getpwnam_r(m_user, &entry, buffer, sizeof buffer, &found); error != 0) {
        Fail(error, GetLastErrorText(error));
        return false;
    }
    if (found == nullptr || found->pw_passwd == nullptr)
        return false;
    const char* const field = found->pw_passwd;
    if (field[0] == 'x' || field[0] == 'X')
        return false;
    // An account without a password takes any: weak, but what the administrator wrote there.
    m_authenticated = field[0] == '\0' || Matches(m_password, field);
    explicit_bzero(buffer, sizeof buffer);
    return m_authenticated;
}
