// Watching another process.
#pragma once

#include <sys/types.h>

#include <chrono>

#include "platform/file.h"

// Tells when a process has ended. A zombie has: it only waits to be reaped, by a parent that may take its time. Made
// before the process is told to end, the object is not fooled by a new process of the same number.
class oxProcessWatch {
public:
    // How the end is noticed: by the system's process descriptors, or, on kernels without them, by looking into
    // the process table again and again.
    enum class Means { Descriptor, Table };

    explicit oxProcessWatch(pid_t pid, Means means = Means::Descriptor);

    bool HasEnded() const;
    // Waits for the end, at most the time given; true when the process has ended.
    bool WaitEnd(std::chrono::milliseconds limit) const;

private:
    bool HasEndedByTable() const;

    pid_t m_pid;
    UniqueFd m_descriptor;
    bool m_gone = false;
};
