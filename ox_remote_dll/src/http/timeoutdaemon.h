// The thread that drops idle users.
#pragma once

#include <cstdint>
#include <limits>

#include "platform/thread.h"

class oxAuthenticatedHttpServer;

// Sweeps the logged-in users of its server once in a period, and sleeps without one while nobody is logged in.
//
// Thread rules: starts and stops are for one thread at a time.
class oxHttpTimeoutDaemon : public MThread {
public:
    static constexpr std::uint32_t MILLISECONDS = 1000;  // in a second
    // Some 49 days; longer periods are cut to it.
    static constexpr std::uint32_t MAX_PERIOD = std::numeric_limits<std::uint32_t>::max() / MILLISECONDS;

    oxHttpTimeoutDaemon() = default;
    ~oxHttpTimeoutDaemon() override;

    // False, with a line in the server's message log, when no thread could be started. One that runs is ended first.
    bool StartTimeoutDaemon(oxAuthenticatedHttpServer& server, std::uint32_t periodSeconds);
    // Ends the thread and waits for it. Harmless when none runs.
    void StopTimeoutDaemon();
    std::uint32_t Period() const { return m_period; }  // milliseconds; 0 before the first start

private:
    static void* CallHttpTimeoutDaemonThread(void* daemon);

    oxAuthenticatedHttpServer* m_server = nullptr;
    std::uint32_t m_period = 0;
};
