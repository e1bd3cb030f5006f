#include "app/support_account.h"

#include <pwd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <string_view>

namespace {

// With few rounds, so that a check takes no time.
constexpr std::string_view HASH =
    "$6$rounds=1000$saltsalt$SeNk9n.vN3tgOYPGkRI.cMWta7J8zqiQEhXI4AVZIh8eL3XZu9o6iQhRFb65RZ7g/"
    "VELDgKbVps5wHePHiS4Z0";
std::string account;  // empty: none
std::atomic<int> lookUps{0};

}  // namespace

TestAccount::TestAccount(const std::string& name) {
    account = name;
    lookUps = 0;
}

TestAccount::~TestAccount() {
    account.clear();
}

int TestAccount::LookUps() {
    return lookUps;
}

// Comes before the C library's.
extern "C" int getpwnam_r(const char* name, passwd* entry, char* buffer, size_t size, passwd** found) {
    ++lookUps;
    *found = nullptr;
    if (account.empty() || account != name)
        return 0;
    if (size <= HASH.size())
        return ERANGE;
    HASH.copy(buffer, HASH.size());
    buffer[HASH.size()] = '\0';
    entry->pw_passwd = buffer;
    *found = entry;
    return 0;
}
