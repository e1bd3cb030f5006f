// The raw system calls that change ids.
#pragma once

#include <sys/syscall.h>
#include <sys/types.h>

// They change the calling thread, or the one thread of a child that is being started. The C library's functions would
// change every thread of the process.
#ifdef SYS_setresuid32
inline constexpr long SET_USERS_CALL = SYS_setresuid32;  // the others take 16-bit ids there
inline constexpr long SET_GROUPS_CALL = SYS_setresgid32;
inline constexpr long SET_GROUP_LIST_CALL = SYS_setgroups32;
#else
inline constexpr long SET_USERS_CALL = SYS_setresuid;
inline constexpr long SET_GROUPS_CALL = SYS_setresgid;
inline constexpr long SET_GROUP_LIST_CALL = SYS_setgroups;
#endif

inline constexpr uid_t ROOT_USER = 0;
inline constexpr uid_t UNCHANGED_USER = static_cast<uid_t>(-1);
