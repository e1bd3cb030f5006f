// A debugger in a process of its own: it keeps the end of what it traces from the parent.
#pragma once

#include <signal.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

#include "bridge/proctools.h"

// Attached at the construction. An ended process that is traced is a zombie that its parent cannot reap yet.
class Tracer {
public:
    explicit Tracer(pid_t traced) {
        m_tracer = fork();
        if (m_tracer == 0) {
            // The copy of one thread of several: nothing here may need another's lock.
            const int error = ptrace(PTRACE_SEIZE, traced, nullptr, nullptr) == 0 ? 0 : errno;
            KeepOnly(m_outcome.writeEnd.Get(), m_end.readEnd.Get());
            WriteAll(m_outcome.writeEnd.Get(), reinterpret_cast<const char*>(&error), sizeof error);
            char none;
            while (read(m_end.readEnd.Get(), &none, 1) < 0 && errno == EINTR) {
            }
            _exit(0);
        }
        m_outcome.writeEnd.Reset();
        if (m_tracer < 0 || read(m_outcome.readEnd.Get(), &m_error, sizeof m_error) != sizeof m_error)
            m_error = ECHILD;
    }
    // Lets go of the process.
    ~Tracer() {
        m_end.writeEnd.Reset();
        if (m_tracer > 0)
            waitpid(m_tracer, nullptr, 0);
    }
    Tracer(const Tracer&) = delete;
    Tracer& operator=(const Tracer&) = delete;

    int Error() const { return m_error; }  // 0, or why it may not trace

private:
    // The others' ends that it got a copy of.
    static void KeepOnly(int one, int other) {
        constexpr int HIGHEST = 1023;
        for (int descriptor = STDERR_FILENO + 1; descriptor <= HIGHEST; ++descriptor)
            if (descriptor != one && descriptor != other)
                close(descriptor);
    }

    TestPipe m_outcome;
    TestPipe m_end;
    pid_t m_tracer = -1;
    int m_error = 0;
};
