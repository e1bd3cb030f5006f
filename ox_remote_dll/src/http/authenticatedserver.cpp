#include "http/authenticatedserver.h"

#include <cxxabi.h>

#include <algorithm>
#include <mutex>
#include <utility>

#include "platform/encrypt.h"
#include "platform/rootguard.h"

namespace {

bool CanBecomeRoot() {
    const RootGuard root;
    return root.Raised();
}

}  // namespace

oxAuthenticatedHttpServer::oxAuthenticatedHttpServer(const oxClock& clock) : oxHttpServer(clock) {}

oxAuthenticatedHttpServer::~oxAuthenticatedHttpServer() {
    // Sessions use the logins, so all must have ended before these go.
    while (!Close()) {
    }
    const std::scoped_lock lock(m_timeoutControl);
    m_timeoutDaemon.StopTimeoutDaemon();
}

void oxAuthenticatedHttpServer::Shutdown(int code) {
    {
        const std::scoped_lock lock(m_timeoutControl);
        m_ended = true;
        m_timeoutDaemon.StopTimeoutDaemon();
        m_timeoutIdle = true;
    }
    ForgetAll();
    oxHttpServer::Shutdown(code);
}

bool oxAuthenticatedHttpServer::StartAuthenticated(bool useOSAuthentication) {
    if (GetState() == STATE_RUNNING)
        return true;
    if (useOSAuthentication && !CanBecomeRoot()) {
        ReportRootNeeded();
        return false;
    }
    const int timeout = Settings()->sessionTimeout;
    oxUser::m_nTimeout = timeout;
    m_timeoutIdle = true;
    ForgetAll();  // what sessions that outlived the last stop have remembered
    {
        const std::scoped_lock lock(m_timeoutControl);
        m_ended = false;
    }
    if (!Start())
        return false;
    {
        const std::scoped_lock lock(m_timeoutControl);
        // A listener that failed at once has been through `Shutdown` already.
        if (m_ended || m_timeoutDaemon.StartTimeoutDaemon(*this, static_cast<std::uint32_t>(std::max(1, timeout / 2))))
            return true;
    }
    Stop();
    return false;
}

// Always in the log of the default name, which the failed start points to; the log of the settings is closed for it.
void oxAuthenticatedHttpServer::ReportRootNeeded() {
    if (!Settings()->logErrors)
        return;
    if (!MessageLog().Open(m_sERROR_LOG_NAME))
        return;
    MessageLog().Error("O/S authentication requires starting the program with root access.\n");
    MessageLog().Close();
}

bool oxAuthenticatedHttpServer::AuthenticateUser(oxUser&, UserCheck) {
    return false;
}

// The C++ library has no object for a cancelled thread's unwinding: its reference is never used.
__attribute__((no_sanitize("null"))) bool oxAuthenticatedHttpServer::AuthenticateRequest(
    const oxCredentials& credentials, std::uint32_t& permissions) {
    try {
        return !credentials.GetUser().empty() && CheckRequest(credentials, permissions);
    } catch (const abi::__forced_unwind&) {
        throw;  // the thread is being cancelled, which must not be held up
    } catch (...) {
        MessageLog().Error("An unknown exception occurred during authentication.");
        return false;
    }
}

bool oxAuthenticatedHttpServer::CheckRequest(const oxCredentials& credentials, std::uint32_t& permissions) {
    // Read before the check: a change that comes during it makes the outcome outdated.
    const std::uint32_t round = Round();
    const std::uint64_t generation = Generation();
    const Memory memory = LookUp(credentials.GetUser(), credentials.GetPassword(), generation, permissions);
    if (memory == Memory::Good)
        return true;
    auto user = std::make_unique<oxUser>(Clock());
    user->SetUser(credentials.GetUser().c_str());
    user->SetPassword(credentials.GetPassword().c_str());
    if (!AuthenticateUser(*user, memory == Memory::Outdated ? UserCheck::Remembered : UserCheck::Full)) {
        if (memory == Memory::Outdated)
            Forget(*user, generation);
        return false;
    }
    permissions = user->GetPermissions();
    Remember(std::move(user), generation, round);
    return true;
}

oxAuthenticatedHttpServer::Memory oxAuthenticatedHttpServer::LookUp(const std::string& name,
                                                                    const std::string& password,
                                                                    std::uint64_t generation,
                                                                    std::uint32_t& permissions) {
    const std::scoped_lock lock(m_userLock);
    const auto found = m_users.find(name);
    // One that is idle too long is as good as swept.
    if (found == m_users.end() || found->second.user->IsExpired() ||
        !EqualSecrets(found->second.user->GetPassword(), password))
        return Memory::None;
    // One that another request has checked against newer data than this request knows of is good too.
    if (found->second.generation < generation)
        return Memory::Outdated;
    permissions = found->second.user->GetPermissions();
    return Memory::Good;
}

// One login for each name: who has several passwords that are all accepted must not fill the memory with them.
void oxAuthenticatedHttpServer::Remember(std::unique_ptr<oxUser> user, std::uint64_t generation, std::uint32_t round) {
    const std::scoped_lock lock(m_userLock);
    if (round != m_round)
        return;  // checked by the rules from before a stop
    Login& login = m_users[user->GetUser()];
    if (login.user && login.generation > generation)
        return;  // meanwhile another request was checked against newer data
    login.user = std::move(user);
    login.generation = generation;
    m_usersChanged.Broadcast();
}

// Unless the name was accepted again meanwhile.
void oxAuthenticatedHttpServer::Forget(const oxUser& user, std::uint64_t generation) {
    const std::scoped_lock lock(m_userLock);
    const auto found = m_users.find(user.GetUser());
    if (found != m_users.end() && found->second.generation < generation)
        m_users.erase(found);
}

void oxAuthenticatedHttpServer::ForgetAll() {
    Logins forgotten;
    const std::scoped_lock lock(m_userLock);
    forgotten.swap(m_users);
    ++m_round;
}

std::uint32_t oxAuthenticatedHttpServer::Round() {
    const std::scoped_lock lock(m_userLock);
    return m_round;
}

bool oxAuthenticatedHttpServer::FindUser(const std::string& name, const std::string& password,
                                         std::uint32_t& permissions) {
    return LookUp(name, password, Generation(), permissions) == Memory::Good;
}

void oxAuthenticatedHttpServer::RemoveUser(const oxUser& user) {
    const std::scoped_lock lock(m_userLock);
    m_users.erase(user.GetUser());
}

std::size_t oxAuthenticatedHttpServer::SweepUsers() {
    const std::scoped_lock lock(m_userLock);
    std::erase_if(m_users, [](const auto& login) { return login.second.user->IsExpired(); });
    return m_users.size();
}

std::size_t oxAuthenticatedHttpServer::UserCount() {
    const std::scoped_lock lock(m_userLock);
    return m_users.size();
}

bool oxAuthenticatedHttpServer::WaitForUsers(const MThread& timeoutThread) {
    std::unique_lock lock(m_userLock);
    m_timeoutIdle = m_users.empty();
    m_usersChanged.Wait(lock, [&] { return !m_users.empty() || timeoutThread.IsCancelled(); });
    m_timeoutIdle = m_users.empty();
    return !timeoutThread.IsCancelled();
}

void oxAuthenticatedHttpServer::WakeTimeoutThread() {
    const std::scoped_lock lock(m_userLock);
    m_usersChanged.Broadcast();
}
