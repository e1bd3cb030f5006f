// The server that knows who is logged in.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>

#include "http/httpserver.h"
#include "http/timeoutdaemon.h"
#include "platform/mutex.h"
#include "users/user.h"

// Remembers accepted logins, one for each user name, until they are idle for `oxUser::m_nTimeout` seconds, so that most
// requests need no password check. What the user check would decide differently meanwhile is not remembered: when
// the generation of the user data has changed, the next request is checked again. Idle logins are dropped by a sweep
// every half time-out, so one may live half a time-out longer.
//
// Thread rules: as its base; the checks run on session threads, several at once, the sweep on the time-out thread.
// `Shutdown` may be called by the listener thread and by the stopping thread.
class oxAuthenticatedHttpServer : public oxHttpServer {
public:
    // Remembered: the password was accepted before, and only the user's existence and permissions are in question.
    enum class UserCheck { Full, Remembered };

    explicit oxAuthenticatedHttpServer(const oxClock& clock = oxClock::System());
    ~oxAuthenticatedHttpServer() override;

    // Also ends the time-out thread and forgets every login.
    void Shutdown(int code) override;

    // Whether the request's credentials are good; the permissions are filled in then. Without a user name they are not.
    // A failure of the check itself is logged and counts as a refusal.
    virtual bool AuthenticateRequest(const oxCredentials& credentials, std::uint32_t& permissions);
    // Starts the server and the time-out thread; nothing is left started when one of them cannot be. With
    // operating-system authentication the process must be able to become root; false with a line in the error log where
    // it is not.
    virtual bool StartAuthenticated(bool useOSAuthentication);
    // The user check: true when the user is accepted, with the permissions stored in it. This class accepts nobody.
    // Called without any lock held.
    virtual bool AuthenticateUser(oxUser& user, UserCheck check);

    // The permissions of a remembered login with exactly this name and password; counts as use. False when there is
    // none, or the user data has changed since it was checked.
    bool FindUser(const std::string& name, const std::string& password, std::uint32_t& permissions);
    // Forgets the login of this user name.
    void RemoveUser(const oxUser& user);
    // Forgets idle logins; the count of those left.
    std::size_t SweepUsers();
    std::size_t UserCount();
    // For the time-out thread: waits until somebody is logged in; false when the thread is to end.
    bool WaitForUsers(const MThread& timeoutThread);
    // Makes a waiting time-out thread look again whether it is to end.
    void WakeTimeoutThread();
    bool IsTimeoutThreadIdle() const { return m_timeoutIdle.load(); }
    // Milliseconds between two sweeps, as of the last start; 0 before it. Not while another thread starts the server.
    std::uint32_t SweepPeriod() const { return m_timeoutDaemon.Period(); }

protected:
    // Where the generation of the user data comes from; set before the start. Without one, nothing ever changes.
    void SetGenerationSource(std::function<std::uint64_t()> generation) { m_generation = std::move(generation); }

private:
    enum class Memory { None, Outdated, Good };
    struct Login {
        std::unique_ptr<oxUser> user;
        std::uint64_t generation = 0;  // of the user data, as it was before the check
    };
    using Logins = std::unordered_map<std::string, Login>;

    std::uint64_t Generation() const { return m_generation ? m_generation() : 0; }
    bool CheckRequest(const oxCredentials& credentials, std::uint32_t& permissions);
    Memory LookUp(const std::string& name, const std::string& password, std::uint64_t generation,
                  std::uint32_t& permissions);
    void Remember(std::unique_ptr<oxUser> user, std::uint64_t generation, std::uint32_t round);
    void Forget(const oxUser& user, std::uint64_t generation);
    void ForgetAll();
    std::uint32_t Round();
    void ReportRootNeeded();

    MMutex m_userLock;
    Logins m_users;             // by name
    std::uint32_t m_round = 0;  // counts starts and stops: the user check may have other settings after each
    MCondVar m_usersChanged;
    std::atomic<bool> m_timeoutIdle{true};  // the time-out thread waits for a login, or none runs
    MMutex m_timeoutControl;                // over starts and stops of the time-out thread
    bool m_ended = true;                    // `Shutdown` was called since the last start
    oxHttpTimeoutDaemon m_timeoutDaemon;
    std::function<std::uint64_t()> m_generation;
};
