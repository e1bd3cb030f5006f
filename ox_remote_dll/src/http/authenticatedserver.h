// The server that knows who is logged in.
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <string>

#include "http/httpserver.h"
#include "http/timeoutdaemon.h"
#include "platform/mutex.h"
#include "users/user.h"

// Remembers accepted logins, one for each user name, until they are idle for `oxUser::m_nTimeout` seconds, so that most
// requests need no password check. What the user check would decide differently meanwhile is not remembered: when
// the generation of the user data has changed, the next request is checked again.
//
// Thread rules: as its base; the checks run on session threads, several at once, the sweep on the time-out thread.
class oxAuthenticatedHttpServer : public oxHttpServer {
public:
    // Remembered: the password was accepted before, and only the user's existence and permissions are in question.
    enum class UserCheck { Full, Remembered };

    explicit oxAuthenticatedHttpServer(const oxClock& clock = oxClock::System());
    ~oxAuthenticatedHttpServer() override;

    // Also ends the time-out thread and forgets every login.
    void Shutdown(int code) override;

    // Whether the request's credentials are good; the permissions are filled in then. A failure of the check itself is
    // logged and counts as a refusal.
    virtual bool AuthenticateRequest(const oxCredentials& credentials, std::uint32_t& permissions);
    // Starts the server and the time-out thread. With operating-system authentication the process must be able to
    // become root; false with a line in the message log where it is not.
    virtual bool StartAuthenticated(bool useOSAuthentication);
    // The user check: true when the user is accepted, with the permissions stored in it. This class accepts nobody.
    virtual bool AuthenticateUser(oxUser& user, UserCheck check);

    // The permissions of a remembered login with exactly this name and password; counts as use. False when there is
    // none, or the user data has changed since it was checked.
    bool FindUser(const std::string& name, const std::string& password, std::uint32_t& permissions);
    // Forgets the login of this user name.
    void RemoveUser(const oxUser& user);
    // Forgets idle logins; the count of those left.
    std::size_t SweepUsers();
    std::size_t UserCount();
    // Waits until somebody is logged in; false when the time-out thread is to end.
    bool WaitForUsers();
    bool IsTimeoutThreadIdle() const { return m_timeoutIdle.load(); }

protected:
    // Where the generation of the user data comes from; set before the start. Without one, nothing ever changes.
    void SetGenerationSource(std::function<std::uint64_t()> generation) { m_generation = std::move(generation); }

private:
    friend class oxHttpTimeoutDaemon;
    struct Login {
        std::unique_ptr<oxUser> user;
        std::uint64_t generation;
    };
    std::list<Login> m_users;
    MMutex m_userLock;
    MCondVar m_usersChanged;
    std::atomic<bool> m_timeoutIdle{true};
    oxHttpTimeoutDaemon m_timeoutDaemon;
    std::function<std::uint64_t()> m_generation;
};
