// The listening thread.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <string>

#include "net/socket.h"
#include "platform/thread.h"

class oxHttpServer;
class oxHttpSession;

// Owns the listening socket and runs the accept loop, which hands each connection to a session of its own after the
// server admitted it. It is the base of the server object, so one object is both the server and its listener.
//
// Under load: connections wait in the system's queue of BACKLOG while the loop is busy. When accepting fails for lack
// of descriptors or memory the loop pauses (ACCEPT_PAUSE_MIN, doubled up to ACCEPT_PAUSE_MAX) and logs at most one
// line in ACCEPT_REPORT_INTERVAL.
class oxHttpDaemon : public MThread {
public:
    enum DaemonState { STATE_ENDED = -1, STATE_FAILED = -2 };
    static constexpr int BACKLOG = 128;
    static constexpr int LINGER_SECONDS = 30;
    // What the system may hold unsent for one connection. Its own limit of some megabytes would take a slow client
    // minutes to read, in which its session would count as idle.
    static constexpr int UNSENT_BYTES = 256 * 1024;
    static constexpr std::chrono::milliseconds ACCEPT_PAUSE_MIN{100};
    static constexpr std::chrono::milliseconds ACCEPT_PAUSE_MAX{1000};
    static constexpr std::chrono::milliseconds ACCEPT_REPORT_INTERVAL{1000};
    // How often sessions are looked at for time-outs while no connection comes.
    static constexpr std::chrono::milliseconds SWEEP_TICK{2000};

    oxHttpDaemon();
    ~oxHttpDaemon() override;

    // Creates the socket, binds it to the address (empty: every local one) and the port, and starts the accepting
    // thread. False with the reason in the message log and in `StartErrorNumber`; nothing is left half started.
    virtual bool StartDaemon(const std::string& address);
    // Ends the accept loop and waits for its thread. Sessions go on.
    void StopDaemon();
    // Waits until a connection can be accepted, sweeping timed-out sessions meanwhile. False when the listening socket
    // was closed. For the listener thread.
    bool WaitForConnection();

    // STATE_ENDED after a normal exit, STATE_FAILED after a failed start or an exit on error.
    DaemonState GetDaemonState() const { return m_daemonState.load(); }
    // The address that is listened on, with the port that the system chose where none was asked for.
    const oxSockAddr& GetListenAddress() const { return m_listenAddress; }
    // The system's error number of the call that made StartDaemon fail.
    int StartErrorNumber() const { return m_startErrorNumber; }
    bool IsStopRequested() const { return m_stopRequested.load(); }

protected:
    // Makes a spare session; may throw std::bad_alloc. Tests put theirs here.
    std::function<std::unique_ptr<oxHttpSession>()> m_makeSession;
    std::uint32_t m_port = 0;
    oxHttpServer* m_server = nullptr;

private:
    // How accepting has gone since the last connection.
    struct AcceptFailures {
        std::chrono::milliseconds pause = ACCEPT_PAUSE_MIN;
        std::chrono::steady_clock::time_point reported;  // the clock's start: never
    };

    static void* CallHttpDaemonThread(void* daemon);
    bool FailStart(const char* step, int error);
    void AcceptLoop();
    void ServeConnections();
    void MakeSpare(std::list<std::unique_ptr<oxHttpSession>>& spare, const char* failure);
    static bool MayReport(AcceptFailures& failures);
    void HandleAcceptFailure(AcceptFailures& failures);

    oxSockAddr m_listenAddress;
    std::atomic<bool> m_stopRequested{false};
    std::atomic<DaemonState> m_daemonState{STATE_ENDED};
    int m_startErrorNumber = 0;
    oxSocket m_listeningSocket;
    oxWakeup m_stopWakeup;
};
