#include "http/httpdaemon.h"

#include <netinet/tcp.h>

#include <algorithm>
#include <cerrno>
#include <list>
#include <new>
#include <stdexcept>

#include "http/httpserver.h"
#include "platform/rootguard.h"
#include "platform/text.h"

oxHttpDaemon::oxHttpDaemon() : m_makeSession([this] { return std::make_unique<oxHttpSession>(*m_server, 0); }) {}

oxHttpDaemon::~oxHttpDaemon() {
    StopDaemon();
    Wait();
}

bool oxHttpDaemon::StartDaemon(const std::string& address) {
    oxHttpErrorLog& log = m_server->MessageLog();
    Wait();  // for the last lines of a listener that ended on an error
    m_stopRequested = false;
    m_stopWakeup.Clear();
    m_startErrorNumber = 0;
    const auto port = static_cast<std::uint16_t>(m_port);
    m_listenAddress = address.empty() ? oxSockAddr(0U, port) : oxSockAddr(address.c_str(), port);
    {
        RootGuard root;  // a privileged port may be asked for
        if (!m_listeningSocket.Create(AF_INET, SOCK_STREAM, 0)) {
            root.Keep();  // as it always was: only the bound or refused port gives the right back
            return FailStart("create", m_listeningSocket.ErrorCode());
        }
        const int on = 1;
        const linger lingering{.l_onoff = 1, .l_linger = LINGER_SECONDS};
        m_listeningSocket.SetSockOpt(IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
        m_listeningSocket.SetSockOpt(SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
        m_listeningSocket.SetSockOpt(SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
        m_listeningSocket.SetSockOpt(SOL_SOCKET, SO_LINGER, &lingering, sizeof lingering);
        // Connections inherit it: a session sees that a slow client still reads each time this much has gone out.
        m_listeningSocket.SetSockOpt(IPPROTO_TCP, TCP_NOTSENT_LOWAT, &UNSENT_BYTES, sizeof UNSENT_BYTES);
        // A client that goes away between the wait and the accept must not hold up the accept loop.
        m_listeningSocket.SetNonBlocking(true);
        // A name that nobody knows leaves the address that is none, and the system would even listen on it.
        if (!address.empty() && m_listenAddress.Address() == INADDR_NONE)
            return FailStart("bind", EADDRNOTAVAIL);
        if (!m_listeningSocket.Bind(m_listenAddress.Raw(), oxSockAddr::LENGTH, 1))
            return FailStart("bind", m_listeningSocket.ErrorCode());
    }
    if (port == 0) {
        socklen_t length = oxSockAddr::LENGTH;
        m_listeningSocket.GetSockName(m_listenAddress.Raw(), &length);
    }
    // Clients may connect from here on, before the thread runs; an error is reported by the thread, which listens
    // again.
    m_listeningSocket.Listen(BACKLOG);
    if (!Create(&oxHttpDaemon::CallHttpDaemonThread, this)) {
        m_startErrorNumber = LastError().Code();
        log.Error("Unable to create daemon thread, thread error = %d", m_startErrorNumber);
        m_daemonState = STATE_FAILED;
        m_listeningSocket.Close();
        return false;
    }
    return true;
}

bool oxHttpDaemon::FailStart(const char* step, int error) {
    m_startErrorNumber = error;
    m_server->MessageLog().Error("Socket %s failed: %s (%d)", step, GetLastErrorText(m_startErrorNumber),
                                 m_startErrorNumber);
    m_daemonState = STATE_FAILED;
    m_listeningSocket.Close();
    return false;
}

void oxHttpDaemon::StopDaemon() {
    if (m_listeningSocket.GetHandle() != -1) {
        m_stopRequested = true;
        m_stopWakeup.Wake();
        m_listeningSocket.Shutdown(SHUT_RD);
        m_listeningSocket.Close();
    }
    Wait();
}

void* oxHttpDaemon::CallHttpDaemonThread(void* daemon) {
    static_cast<oxHttpDaemon*>(daemon)->AcceptLoop();
    return nullptr;
}

bool oxHttpDaemon::WaitForConnection() {
    while (m_listeningSocket.GetHandle() != -1) {
        const WaitLimit tick = m_server->HasSessions() ? WaitLimit(SWEEP_TICK) : std::nullopt;
        if (m_listeningSocket.WaitReadable(tick) != Readiness::TimedOut)
            return !m_stopRequested;
        m_server->SweepTimedOutSessions();
    }
    return false;
}

void oxHttpDaemon::AcceptLoop() {
    oxHttpErrorLog& log = m_server->MessageLog();
    try {
        ServeConnections();
    } catch (const std::exception& error) {
        log.Error("%s", error.what());
    } catch (...) {
        log.Error("an unknown exception ended the listener");
    }
    m_listeningSocket.Close();
    if (!m_stopRequested)
        m_server->Terminate();
    if (!m_stopRequested) {
        m_daemonState = STATE_FAILED;
        log.Log(3, "Daemon thread exiting on error.");
    } else {
        m_daemonState = STATE_ENDED;
        log.Log(5, "Daemon thread exiting normally.");
        Detach();
    }
    log.Log(5, "session thread 0x%X exiting.", CurrentId());  // says session, means this thread
}

void oxHttpDaemon::ServeConnections() {
    oxHttpErrorLog& log = m_server->MessageLog();
    log.Log(5, "Daemon thread started. Thread id = 0x%X", CurrentId());
    if (!m_listeningSocket.Listen(BACKLOG)) {
        if (m_stopRequested)
            return;
        throw std::runtime_error("listen failed");
    }
    log.Log(7, "HttpDaemon thread: waiting on %d connections.", BACKLOG);

    AcceptFailures failures;
    // The spare session waits in a list of one, so that registering it cannot fail once its thread runs.
    std::list<std::unique_ptr<oxHttpSession>> spare;
    MakeSpare(spare, "1st session allocation failed");
    while (!m_stopRequested) {
        log.Log(7, "HttpDaemon thread: accepting connection:");
        oxHttpSession& session = *spare.front();
        if (!session.AcceptConnection(m_listeningSocket)) {
            if (!m_stopRequested && m_listeningSocket.GetHandle() != -1)
                HandleAcceptFailure(failures);
            spare.clear();
        } else {
            failures.pause = ACCEPT_PAUSE_MIN;
            if (!m_server->AdmitConnection(session)) {
                spare.clear();
            } else if (!session.StartThread()) {
                if (MayReport(failures))
                    log.Error("Unable to create session thread, thread error = %d", session.LastError().Code());
                spare.clear();
            } else {
                log.Log(7, "HttpDaemon thread: connected to %s.", session.PeerAddress().Dotted().c_str());
                m_server->AddSession(spare);
            }
        }
        if (m_stopRequested)
            break;
        MakeSpare(spare, "session allocation failed");
    }
}

void oxHttpDaemon::MakeSpare(std::list<std::unique_ptr<oxHttpSession>>& spare, const char* failure) {
    try {
        spare.push_back(m_makeSession());
    } catch (const std::bad_alloc&) {
        throw std::runtime_error(failure);
    }
}

bool oxHttpDaemon::MayReport(AcceptFailures& failures) {
    const auto now = std::chrono::steady_clock::now();
    if (now - failures.reported < ACCEPT_REPORT_INTERVAL)
        return false;
    failures.reported = now;
    return true;
}

// Accepting fails for lack of descriptors or memory, and goes on failing until some are free: pause, or the loop would
// spin, and report at most once a second.
void oxHttpDaemon::HandleAcceptFailure(AcceptFailures& failures) {
    const int error = m_listeningSocket.ErrorCode();
    if (m_stopRequested)  // set before the stopping thread touches the socket and its error code
        return;
    if (error != EBADF && MayReport(failures))
        m_server->MessageLog().Error("Socket::Accept error: %s (%d).", GetLastErrorText(error), error);
    pollfd stop{.fd = m_stopWakeup.Descriptor(), .events = POLLIN, .revents = 0};
    if (PollAll({&stop, 1}, failures.pause) == 0)
        m_server->SweepTimedOutSessions();
    failures.pause = std::min(failures.pause * 2, ACCEPT_PAUSE_MAX);
}
