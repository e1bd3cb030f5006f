// The thread that drops idle users.
#pragma once

#include <cstdint>

#include "platform/thread.h"

class oxAuthenticatedHttpServer;

// Sweeps the logged-in users of its server once in a period, and sleeps without one while nobody is logged in.
class oxHttpTimeoutDaemon : public MThread {
public:
    oxHttpTimeoutDaemon() = default;
    ~oxHttpTimeoutDaemon() override;

    // False, with a line in the server's message log, when no thread could be started.
    bool StartTimeoutDaemon(oxAuthenticatedHttpServer& server, std::uint32_t periodSeconds);
    // Ends the thread and waits for it. Harmless when none runs.
    void StopTimeoutDaemon();

private:
    static void* CallHttpTimeoutDaemonThread(void* daemon);
    void Sweep();

    oxAuthenticatedHttpServer* m_server = nullptr;
    std::uint32_t m_period = 0;  // milliseconds
};
