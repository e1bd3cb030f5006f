#include "http/httpserver.h"

#include <algorithm>
#include <cerrno>
#include <mutex>

#include "resources/staticfile.h"

namespace {

std::chrono::milliseconds Left(std::chrono::steady_clock::time_point end) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
    return std::max(left, std::chrono::milliseconds{0});
}

}  // namespace

oxHttpServer::oxHttpServer(const oxClock& clock)
    : m_clock(clock), m_settings(std::make_shared<const oxHttpSettings>()) {
    m_server = this;
}

oxHttpServer::~oxHttpServer() {
    Close();
    m_sessions.clear();
    m_dying.clear();
    m_messageLog.Close();
}

void oxHttpServer::Configure(const oxHttpSettings& settings) {
    {
        auto snapshot = std::make_shared<const oxHttpSettings>(settings);
        const std::scoped_lock lock(m_snapshotLock);
        m_settings.swap(snapshot);
    }
    m_port = settings.port;
    // Not closed first: sessions that outlive a reset may have something to say.
    if (!settings.logErrors)
        m_messageLog.Close();
    else if (m_messageLog.Open(settings.errorLogName.c_str()))
        m_messageLog.SetDebugLevel(oxAuditFile::GetDefaultDebugLevel());
}

std::shared_ptr<const oxHttpSettings> oxHttpServer::Settings() const {
    const std::scoped_lock lock(m_snapshotLock);
    return m_settings;
}

std::shared_ptr<oxHttpServerLog> oxHttpServer::AccessLog() const {
    const std::scoped_lock lock(m_snapshotLock);
    return m_accessLog;
}

void oxHttpServer::OpenAccessLog() {
    const auto settings = Settings();
    if (!settings->logging || settings->logFileName.empty() || AccessLog())
        return;
    const std::string path = settings->homeDirectory + "/" + settings->logFileName;
    auto log = std::make_shared<oxHttpServerLog>();
    if (!log->Open(path.c_str(), "a")) {
        m_messageLog.Log(5, "Log file open failed: %s.", path.c_str());
        return;
    }
    {
        const std::scoped_lock lock(m_snapshotLock);
        m_accessLog = std::move(log);
    }
    m_messageLog.Log(3, "Logging server activity to %s.", path.c_str());
}

void oxHttpServer::CloseAccessLog() {
    std::shared_ptr<oxHttpServerLog> log;
    {
        const std::scoped_lock lock(m_snapshotLock);
        log.swap(m_accessLog);
    }
    if (!log)
        return;
    log.reset();  // a session that is writing its line at this moment closes it
    m_messageLog.Log(3, "Server log closed.");
}

bool oxHttpServer::Start() {
    if (m_stopped == STATE_RUNNING) {
        m_messageLog.Error("Server already started.");
        return true;
    }
    m_startError = START_GOOD;
    if (m_port == 0) {
        m_messageLog.Error("Server unable to start - an address or port was not specified.");
        m_startError = START_NO_ADDRESS;
        return false;
    }
    OpenAccessLog();
    const std::string address = Settings()->webAddress;
    m_messageLog.Error("Starting server: connecting to %s on port %d.",
                       address.empty() ? "local host" : address.c_str(), static_cast<int>(m_port));
    // Before the listener runs: where it ends at once on an error, the state that it leaves must not be overwritten.
    const int before = m_stopped.exchange(STATE_RUNNING);
    if (StartDaemon(address)) {
        m_listenPort = GetListenAddress().Port();
        return true;
    }
    m_stopped = before;
    CloseAccessLog();
    m_lastError = StartErrorNumber();
    if (m_lastError == EADDRINUSE) {
        m_messageLog.Error("Server unable to start - the specified address or port (%d) is already in use.",
                           static_cast<int>(m_port));
        m_startError = START_ADDRESS_IN_USE;
    } else {
        m_messageLog.Error("Server unable to start. (error=%d)", m_lastError);
    }
    return false;
}

void oxHttpServer::Stop() {
    if (m_stopped == STATE_ERROR)
        Wait();  // for the last lines of a listener that ended on an error
    if (m_stopped != STATE_RUNNING)
        return;
    m_messageLog.Log(3, "Server stopping...");
    StopDaemon();
    Shutdown(STATE_STOPPED);
}

bool oxHttpServer::Close() {
    Stop();
    StopDaemon();  // where it was started without the server
    if (!m_sessions.empty())
        m_messageLog.Log(3, "%d sessions not cleaned up on exit.", static_cast<int>(m_sessions.size()));
    const auto end = std::chrono::steady_clock::now() + CLOSE_LIMIT;
    SweepSessions(true);
    m_dying.remove_if([end](const auto& session) { return session->Wait(Left(end)); });
    return m_dying.empty();
}

void oxHttpServer::Terminate() {
    Shutdown(STATE_ERROR);
}

void oxHttpServer::Shutdown(int code) {
    SweepSessions(false);
    CloseAccessLog();
    m_stopped = code;
}

std::unique_ptr<oxResource> oxHttpServer::CreateResource(const oxRequest& request) {
    // Nothing below checks the path: what climbs out of the root is not found.
    if (request.GetPath().find("../") != std::string::npos)
        return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
    const auto settings = Settings();
    return std::make_unique<oxResource_StaticFile>(settings->documentRoot, settings->noCache);
}

void oxHttpServer::AddSession(std::list<std::unique_ptr<oxHttpSession>>& spare) {
    m_messageLog.Log(5, "Adding user session 0x%X.", CurrentId());
    m_sessions.splice(m_sessions.end(), spare);
}

bool oxHttpServer::AdmitConnection(const oxHttpSession& newSession) {
    SweepSessions(false);
    const int limit = Settings()->maxSessionsPerAddress;
    if (limit <= 0)
        return true;
    const std::uint32_t address = newSession.PeerAddress().Address();
    int count = 1;  // the new connection itself
    for (const auto& session : m_sessions) {
        if (session->IsActive() && session->PeerAddress().Address() == address)
            ++count;
        if (count > limit)
            break;
    }
    if (count <= limit)
        return true;
    m_messageLog.Error("HttpServer: connection refused from address: %s. Too many active connections from this address",
                       newSession.PeerAddress().Dotted().c_str());
    return false;
}

void oxHttpServer::SweepSessions(bool force) {
    Sweep(force, true);
}

void oxHttpServer::SweepTimedOutSessions() {
    Sweep(false, false);
}

void oxHttpServer::Sweep(bool force, bool finished) {
    m_dying.remove_if([](const auto& session) { return !session->IsRunning(); });
    StopAndWait(force);
    for (auto position = m_sessions.begin(); position != m_sessions.end();) {
        const auto session = position++;
        if ((*session)->WasStopped() && !force)
            m_messageLog.Log(5, "Session 0x%X has timed-out -- removing.", CurrentId());
        else if (force || (finished && (*session)->GetState() == oxHttpSession::STATE_FINISHED))
            m_messageLog.Log(5, "Removing user session 0x%X.", CurrentId());
        else
            continue;
        if ((*session)->GetState() == oxHttpSession::STATE_FINISHED)
            m_sessions.erase(session);  // joins the thread, which is past its last statement
        else
            m_dying.splice(m_dying.end(), m_sessions, session);
    }
}

// Tells the sessions to end that are overdue, or all, and gives them a moment together: a sweep never takes longer than
// the limit, however many there are.
void oxHttpServer::StopAndWait(bool all) {
    const std::int64_t now = m_clock.MonotonicSeconds();
    const int timeout = Settings()->sessionTimeout;
    const auto end = std::chrono::steady_clock::now() + STOP_SESSION_LIMIT;
    bool stopped = false;
    for (const auto& session : m_sessions) {
        const bool running = session->GetState() != oxHttpSession::STATE_FINISHED;
        if (all || (running && session->LastActivity() + timeout < now)) {
            session->StopSession(std::chrono::milliseconds(0));
            stopped = true;
        }
    }
    if (!stopped)
        return;
    for (const auto& session : m_sessions) {
        if (session->WasStopped())
            session->StopSession(Left(end));
    }
}
