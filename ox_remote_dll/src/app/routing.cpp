// From a request's URL to the resource that answers it.
#include <functional>
#include <mutex>
#include <optional>

#include "app/oxxhttpserver.h"
#include "app/scriptarguments.h"
#include "app/urlpath.h"
#include "platform/text.h"
#include "protocol/http.h"
#include "resources/staticfile.h"
#include "support/logtext.h"
#include "users/keyvaluemap.h"

namespace {

constexpr int SECONDS_PER_MINUTE = 60;
constexpr int DECIMAL = 10;

// A user name in the parameters of a script: what would end the pair or the engine's argument is escaped. New users
// cannot have such names; files that were made by hand can.
std::string EscapeName(const std::string& name) {
    constexpr char DIGITS[] = "0123456789ABCDEF";
    std::string escaped;
    for (const char c : name) {
        const auto byte = static_cast<unsigned char>(c);
        if (IsControl(c) || std::string_view(" &=%+").find(c) != std::string_view::npos)
            escaped.append({'%', DIGITS[byte >> 4], DIGITS[byte & 0xf]});
        else
            escaped.push_back(c);
    }
    return escaped;
}

}  // namespace

// The login of one request: checked when it is first asked for, and once only.
class oxxHttpServer::Login {
public:
    enum Outcome { NO_NAME, LOCKED_OUT, REFUSED, ACCEPTED };

    Login(oxxHttpServer& server, const oxCredentials& credentials) : m_server(server), m_credentials(credentials) {}

    Outcome Check() {
        if (!m_outcome)
            m_outcome = Decide();
        return *m_outcome;
    }
    const std::string& Name() const { return m_credentials.GetUser(); }
    std::uint32_t Permissions() const { return m_permissions; }  // 0 unless accepted

private:
    Outcome Decide() {
        if (Name().empty())
            return NO_NAME;
        if (m_server.m_lockout.IsLockedOut(Name()))
            return LOCKED_OUT;
        if (m_server.FindUser(Name(), m_credentials.GetPassword(), m_permissions))
            return ACCEPTED;
        const std::size_t number = std::hash<std::string>()(Name()) % CHECK_LOCKS;
        m_lock = std::unique_lock(m_server.m_checkLocks[number]);  // held until a failure is recorded
        if (m_server.m_lockout.IsLockedOut(Name()))
            return LOCKED_OUT;
        if (!m_server.AuthenticateRequest(m_credentials, m_permissions)) {
            m_permissions = 0;
            return REFUSED;
        }
        m_lock.unlock();
        return ACCEPTED;
    }

    oxxHttpServer& m_server;
    const oxCredentials& m_credentials;
    std::unique_lock<MMutex> m_lock;
    std::optional<Outcome> m_outcome;
    std::uint32_t m_permissions = 0;
};

std::unique_ptr<oxResource> oxxHttpServer::CreateResource(const oxRequest& request) {
    const oxUrlPath path(request.GetPath());
    if (path.Climbs())
        return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
    // A browser that is logged in is made to ask for another name, and an anonymous one for any.
    if (request.GetPath() == sPUBLIC_REAUTH_URL && request.GetUser() != sANONYMOUS)
        return AskForLogin();
    if (request.GetPath() == sPRIVATE_REAUTH_URL && request.GetUser() == sANONYMOUS)
        return AskForLogin();
    Login login(*this, request);
    // What is open to everybody stays open to a browser with a wrong password, which is no failed login here.
    if (path.BeginsWith(sREPORTS_URL) && login.Check() != Login::ACCEPTED && AnonymousMaySee(path.Profile()))
        return CreateFile(Setup()->dataDirectory);
    std::optional<std::uint32_t> permissions;  // of an authenticated request; the top directory asks for no login
    if (path.IsBelowTop()) {
        if (auto refusal = CheckLogin(login))
            return refusal;
        permissions = login.Permissions();
    }
    if (request.GetExtension() == sSCRIPT_EXTENSION)
        return RouteScript(request, path, permissions);
    return RouteFile(request, path, permissions.value_or(0));
}

bool oxxHttpServer::AnonymousMaySee(const std::string& profile) {
    oxUser anonymous(Clock());
    anonymous.SetUser(sANONYMOUS);
    return AuthenticateUser(anonymous, UserCheck::Full) && m_ProfileMap.IsPermitted(sANONYMOUS, profile);
}

std::unique_ptr<oxResource> oxxHttpServer::AskForLogin() const {
    return std::make_unique<oxResource_Invalid>(Http::UNAUTHORIZED_401, sAUTHENTICATION_REALM_STRING);
}

std::unique_ptr<oxResource> oxxHttpServer::RefuseLockedOut() const {
    return std::make_unique<oxResource_Invalid>(httpStatus_OXX_FORBIDDEN_403, nullptr);
}

// The refusal, or null for an accepted login.
std::unique_ptr<oxResource> oxxHttpServer::CheckLogin(Login& login) {
    switch (login.Check()) {
        case Login::ACCEPTED:
            return nullptr;
        case Login::NO_NAME:
            return AskForLogin();
        case Login::LOCKED_OUT:
            return RefuseLockedOut();
        case Login::REFUSED:
            break;
    }
    m_lockout.Record(login.Name());
    if (!m_lockout.IsLockedOut(login.Name()))
        return AskForLogin();
    MessageLog().Error("User %s locked out for %d minutes. Too many failed logins.", LogText(login.Name()).c_str(),
                       m_lockout.Period() / SECONDS_PER_MINUTE);
    return RefuseLockedOut();
}

std::unique_ptr<oxResource> oxxHttpServer::CreateFile(const std::string& root) const {
    return std::make_unique<oxResource_StaticFile>(root, Settings()->noCache);
}

std::unique_ptr<oxResource> oxxHttpServer::RouteFile(const oxRequest& request, const oxUrlPath& path,
                                                     std::uint32_t permissions) {
    if (!path.BeginsWith(sREPORTS_URL))
        return CreateFile(Setup()->documentRoot);
    const std::string profile = path.Profile();
    if ((permissions & PERMISSION_ALL_PROFILES) == 0 && !m_ProfileMap.IsPermitted(request.GetUser(), profile)) {
        MessageLog().Log(2, "User %s requested a forbidden profile: %s", LogText(request.GetUser()).c_str(),
                         LogText(profile).c_str());
        return std::make_unique<oxResource_Invalid>(Http::FORBIDDEN_403, nullptr);
    }
    return CreateFile(Setup()->dataDirectory);
}

std::unique_ptr<oxResource> oxxHttpServer::RouteScript(const oxRequest& request, const oxUrlPath& path,
                                                       const std::optional<std::uint32_t>& permissions) {
    if (!path.FitsCommandLine())
        return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
    KeyValueMap parameters;
    if (permissions) {
        parameters.Add(oxScriptArguments::KEY_USERNAME, EscapeName(request.GetUser()).c_str());
        parameters.Add(oxScriptArguments::KEY_PERMISSIONS, static_cast<int>(*permissions), DECIMAL);
    }
    const auto setup = Setup();
    std::string script = setup->documentRoot + request.GetPath();
    if (path.BeginsWith(sSCRIPT_CGIBIN))
        script = setup->scriptsDirectory + std::string(path.BehindFirst());
    MessageLog().Log(3, "Script [%s] requested on session thread 0x%X.", LogText(script).c_str(), CurrentId());
    return CreateScript(setup->homeDirectory, script, setup->includeDirectory, parameters.Text());
}
