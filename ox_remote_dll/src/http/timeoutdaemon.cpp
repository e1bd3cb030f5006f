#include "http/timeoutdaemon.h"

#include <algorithm>
#include <chrono>

#include "http/authenticatedserver.h"

oxHttpTimeoutDaemon::~oxHttpTimeoutDaemon() {
    StopTimeoutDaemon();
}

bool oxHttpTimeoutDaemon::StartTimeoutDaemon(oxAuthenticatedHttpServer& server, std::uint32_t periodSeconds) {
    StopTimeoutDaemon();
    m_server = &server;
    m_period = std::min(periodSeconds, MAX_PERIOD) * MILLISECONDS;
    if (Create(&oxHttpTimeoutDaemon::CallHttpTimeoutDaemonThread, this))
        return true;
    server.MessageLog().Error("Unable to to create timeout daemon thread - thread error = %d.", LastError().Code());
    return false;
}

void oxHttpTimeoutDaemon::StopTimeoutDaemon() {
    if (m_server == nullptr)
        return;
    Cancel();
    m_server->WakeTimeoutThread();
    Wait();
}

void* oxHttpTimeoutDaemon::CallHttpTimeoutDaemonThread(void* daemon) {
    auto& self = *static_cast<oxHttpTimeoutDaemon*>(daemon);
    while (self.m_server->WaitForUsers(self) && self.Pause(std::chrono::milliseconds(self.m_period)))
        self.m_server->SweepUsers();
    return nullptr;
}
