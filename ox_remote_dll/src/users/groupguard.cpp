#include "users/groupguard.h"

#include <dlfcn.h>
#include <grp.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <new>
#include <string_view>

#include "platform/file.h"
#include "platform/identitycalls.h"

namespace {

thread_local bool t_thisThreadOnly = false;

int SetThreadGroups(std::size_t count, const gid_t* groups) {
    return static_cast<int>(syscall(SET_GROUP_LIST_CALL, count, groups));
}

std::vector<gid_t> ThreadGroups() {
    std::vector<gid_t> groups;
    // Only this thread changes its groups, so the second call finds as many as the first.
    const int count = getgroups(0, nullptr);
    if (count > 0) {
        groups.resize(static_cast<std::size_t>(count));
        groups.resize(static_cast<std::size_t>(std::max(getgroups(count, groups.data()), 0)));
    }
    return groups;
}

// The C library's own. Looked up when the program starts: a forked child may call these, and must not look up symbols.
const auto LIBRARY_SETGROUPS = reinterpret_cast<decltype(&::setgroups)>(dlsym(RTLD_NEXT, "setgroups"));
const auto LIBRARY_INITGROUPS = reinterpret_cast<decltype(&::initgroups)>(dlsym(RTLD_NEXT, "initgroups"));

int InitThreadGroups(const char* user, gid_t group) {
    try {
        constexpr int FIRST_ROOM = 64;
        int count = FIRST_ROOM;
        std::vector<gid_t> groups;
        do
            groups.resize(static_cast<std::size_t>(count));
        while (getgrouplist(user, group, groups.data(), &count) < 0);
        return SetThreadGroups(static_cast<std::size_t>(count), groups.data());
    } catch (const std::bad_alloc&) {
        errno = ENOMEM;
        return -1;
    }
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int setgroups(std::size_t count, const gid_t* groups) noexcept {
    if (t_thisThreadOnly || LIBRARY_SETGROUPS == nullptr)
        return SetThreadGroups(count, groups);
    return LIBRARY_SETGROUPS(count, groups);
}

extern "C" __attribute__((visibility("default"))) int initgroups(const char* user, gid_t group) {
    if (t_thisThreadOnly || LIBRARY_INITGROUPS == nullptr)
        return InitThreadGroups(user, group);
    return LIBRARY_INITGROUPS(user, group);
}

GroupGuard::GroupGuard() : m_groups(ThreadGroups()), m_outer(t_thisThreadOnly) {
    t_thisThreadOnly = true;
}

GroupGuard::~GroupGuard() {
    const int savedError = errno;
    t_thisThreadOnly = m_outer;
    if (ThreadGroups() != m_groups && SetThreadGroups(m_groups.size(), m_groups.data()) != 0) {
        constexpr std::string_view MESSAGE = "A thread could not take back its groups.\n";
        WriteAll(STDERR_FILENO, MESSAGE.data(), MESSAGE.size());
        std::abort();
    }
    errno = savedError;
}
