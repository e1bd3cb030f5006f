// Threads that are kept for a moment after their work, for the next.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <vector>

#include "platform/mutex.h"

// Starting and ending a thread costs more than serving a small file: most of it is the system's work on the stack. A
// server with a thread for each connection therefore hands a new connection to a thread that has just finished one.
//
// A kept thread waits for IDLE_TIME, then ends; at most MAX_IDLE wait. So an idle server has no thread left over, and a
// busy one starts none. Kept threads have the signal mask of the thread that first started them.
//
// Thread rules: any thread may call `Start`. The one object is never destroyed: threads may wait in it until the
// process is gone.
class MThreadCache {
public:
    static constexpr std::size_t MAX_IDLE = 64;
    static constexpr std::chrono::milliseconds IDLE_TIME{1000};

    using Work = std::function<void()>;  // must not throw
    // Makes a detached thread that runs the function with the argument; 0 or an error number.
    using Starter = int (*)(void* (*entry)(void*), void* argument);

    explicit MThreadCache(Starter starter) : m_starter(starter) {}
    MThreadCache(const MThreadCache&) = delete;
    MThreadCache& operator=(const MThreadCache&) = delete;

    // Does the work on another thread. 0, or the error number with which no thread could be started.
    int Start(Work work);
    // Threads that wait for work at this moment.
    std::size_t IdleCount();

private:
    struct Worker;
    static void* CallWorker(void* worker);
    bool AwaitWork(Worker& worker);

    const Starter m_starter;
    MMutex m_mutex;
    std::vector<Worker*> m_idle;  // the last to finish is the first to go on: its memory is still warm
};
