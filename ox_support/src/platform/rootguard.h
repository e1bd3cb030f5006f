// Root for a moment, for the calling thread alone.
#pragma once

#include <sys/types.h>

// Raises the effective user id of the calling thread to root for the life of the guard and restores the earlier one.
// It uses the raw system call: the C library's call would raise every thread of the process and interrupt their waits.
// Guards nest. Where the process may not become root nothing changes and `Raised` is false with the reason
// in `Error`. A failed restore ends the process: a thread that stays root by accident is worse than none.
//
// Do not start threads or processes while a guard lives: they inherit the raised id.
class RootGuard {
public:
    RootGuard();
    ~RootGuard();
    RootGuard(const RootGuard&) = delete;
    RootGuard& operator=(const RootGuard&) = delete;

    bool Raised() const { return m_error == 0; }
    int Error() const { return m_error; }
    // Leaves the raised id in force beyond the guard's life.
    void Keep() { m_keep = true; }

private:
    uid_t m_previous;
    int m_error = 0;
    bool m_keep = false;
};
