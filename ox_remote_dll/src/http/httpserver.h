// The server object.
#pragma once

#include <atomic>
#include <cstdint>
#include <list>
#include <memory>
#include <string>

#include "http/httpdaemon.h"
#include "http/httplog.h"
#include "http/httpsession.h"
#include "http/httpsettings.h"
#include "platform/clock.h"
#include "platform/mutex.h"
#include "resources/resource.h"

// Holds the settings of the web side, starts and stops the listener, owns the access log and the message log, and keeps
// the registry of live sessions with their time-out and the limit per address.
//
// Life: constructed stopped. `Configure`, then `Start`; `Stop` ends the listener and lets running sessions finish, so a
// reset loses no connection; `Close` also ends the sessions. Every derived class calls `Close` first in its destructor:
// sessions call virtual operations.
//
// Thread rules: `Configure`, `Start`, `Stop` and `Close` are for one thread at a time (the main thread). The session
// list is changed only by the listener thread while it runs, and by the stopping thread after it ended.
// `CreateResource` runs on session threads, several at once. `GetState` and `GetListenPort` may be read from anywhere.
//
// Errors: everything is reported in the message log and as a false result; nothing is thrown.
class oxHttpServer : public oxHttpDaemon {
public:
    // Keys of the settings, and the defaults of those that are texts.
    static constexpr const char* m_sINI_KEY_WEB_ADDRESS = "WebAddress";
    static constexpr const char* m_sINI_KEY_WEB_PORT = "WebPort";
    static constexpr const char* m_sINI_KEY_LOG_FILE_NAME = "WebLogFileName";
    static constexpr const char* m_sINI_KEY_WEB_LOGGING = "WebLogging";
    static constexpr const char* m_sINI_KEY_USER_TIMEOUT = "WebUserTimeout";
    static constexpr const char* m_sINI_KEY_LOG_ERRORS = "WebLogErrors";
    static constexpr const char* m_sINI_KEY_LOG_ERROR_FILE = "WebErrorLog";
    static constexpr const char* m_sINI_KEY_MAX_SESSIONS_PER_ADDRESS = "WebMaxConnectionsPerAddress";
    static constexpr const char* m_sINI_KEY_NO_CACHE = "WebNoCache";
    static constexpr const char* m_sINI_KEY_SCRIPT_TIMEOUT = "WebScriptTimeout";
    static constexpr const char* m_sDEFAULT_LOG_FILE_NAME = "ox_remote.log";
    static constexpr const char* m_sERROR_LOG_NAME = "ox_remote.err";
    static constexpr const char* m_sDEFAULT_WEB_ADDRESS = "";  // every local address

    static constexpr int STATE_RUNNING = 0;
    static constexpr int STATE_STOPPED = -1;  // by `Stop`, and before the first start
    static constexpr int STATE_ERROR = -2;    // the listener ended by itself
    enum StartError { START_GOOD = 0, START_ADDRESS_IN_USE = -1, START_NO_ADDRESS = -2 };
    // How long `Close` waits for sessions that were told to end.
    static constexpr std::chrono::milliseconds CLOSE_LIMIT{9000};
    // How long stopping one session may hold up the listener; the rest is waited for in passing.
    static constexpr std::chrono::milliseconds STOP_SESSION_LIMIT{1000};

    explicit oxHttpServer(const oxClock& clock = oxClock::System());
    ~oxHttpServer() override;

    // Takes the settings for the next start and opens or closes the message log by them.
    void Configure(const oxHttpSettings& settings);

    // Starts the server. True when it runs (also when it already did).
    virtual bool Start();
    // Makes the object that answers a good request. Null is an error of the server.
    virtual std::unique_ptr<oxResource> CreateResource(const oxRequest& request);
    // Called by the listener when it ends on an error.
    virtual void Terminate();
    // Sweeps finished sessions, closes the access log, and records the code as the state.
    virtual void Shutdown(int code);

    // Stops the listener; running sessions finish by themselves.
    void Stop();
    // Stops everything and waits for the sessions, at most CLOSE_LIMIT. False when some have not ended by then:
    // destroying the object would wait for them. Harmless when repeated.
    bool Close();

    void AddSession(std::list<std::unique_ptr<oxHttpSession>>& spare);
    bool AdmitConnection(const oxHttpSession& newSession);
    void SweepSessions(bool force);
    // Stops timed-out sessions only; finished ones wait for the next connection.
    void SweepTimedOutSessions();
    bool HasSessions() const { return !m_sessions.empty() || !m_dying.empty(); }
    void OpenAccessLog();
    void CloseAccessLog();

    int GetState() const { return m_stopped.load(); }
    StartError GetStartError() const { return m_startError; }
    int GetLastStartError() const { return m_lastError; }
    // The port that is listened on.
    std::uint32_t GetListenPort() const { return m_listenPort.load(); }

    oxHttpErrorLog& MessageLog() { return m_messageLog; }
    // Null while access logging is off. The holder keeps the log alive over a concurrent stop.
    std::shared_ptr<oxHttpServerLog> AccessLog() const;
    // The snapshot in force; never null.
    std::shared_ptr<const oxHttpSettings> Settings() const;
    const oxClock& Clock() const { return m_clock; }

private:
    using SessionList = std::list<std::unique_ptr<oxHttpSession>>;
    void Sweep(bool force, bool finished);
    void StopAndWait(bool all);

    const oxClock& m_clock;
    mutable MMutex m_snapshotLock;  // guards the two pointers below, not what they point to
    std::shared_ptr<oxHttpServerLog> m_accessLog;
    std::shared_ptr<const oxHttpSettings> m_settings;
    oxHttpErrorLog m_messageLog;
    std::atomic<int> m_stopped{STATE_STOPPED};
    StartError m_startError = START_GOOD;
    int m_lastError = 0;
    std::atomic<std::uint32_t> m_listenPort{0};
    SessionList m_sessions;
    SessionList m_dying;  // stopped and unlisted, their threads not yet ended
};
