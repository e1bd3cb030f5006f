// The supplementary groups of one thread, kept while foreign code runs.
#pragma once

#include <sys/types.h>

#include <vector>

// PAM modules (pam_group) change the groups of the process through the C library. That would give the new groups to
// every thread, or end the process where the other threads are not root: the C library aborts when its threads do not
// all get the same answer. While a guard lives, `setgroups` and `initgroups` of its thread, called from any library,
// change that thread alone (this file's definitions of both stand before the C library's); its end restores the groups.
//
// Guards nest. The thread needs the rights to restore what it could change, so a RootGuard must outlive the guard. A
// failed restore ends the process, as it would leave a thread with rights that nobody gave it.
class GroupGuard {
public:
    GroupGuard();
    ~GroupGuard();
    GroupGuard(const GroupGuard&) = delete;
    GroupGuard& operator=(const GroupGuard&) = delete;

private:
    std::vector<gid_t> m_groups;
    bool m_outer;
};
