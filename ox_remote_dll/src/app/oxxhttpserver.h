// The reporting application server: the one server object of the process.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "app/appsetup.h"
#include "app/profilemap.h"
#include "app/scriptingserver.h"
#include "app/urlpath.h"
#include "http/loginlockout.h"
#include "net/socket.h"
#include "platform/mutex.h"
#include "users/osuserbase.h"
#include "users/oxuserbase.h"

// Routes each URL to a file, a report or a script under the access rules that go with it, decides who a user is and
// what they may see, and carries out the commands of scripts.
//
// Life: `SetUp` with the settings, then `StartAuthenticated`; a reset stops it and does both again. The user bases and
// the profile map are shared by all objects of the class and never destroyed.
//
// Thread rules: as its bases. Routing and commands run on session threads, many at once; one that outlives a reset may
// meet the old setup or the new one. Errors: every refusal is a reply, every failure of the set-up a line in the
// message log.
class oxxHttpServer : public oxScriptingHttpServer {
public:
    static constexpr const char* sSCRIPT_INC_DIR = "ox_script";
    static constexpr const char* sSCRIPT_DIR = "scripts";
    static constexpr const char* sIMAGES_DIR = "images";  // kept; images are files like others
    static constexpr const char* sUSERS_DIR = "oxm_oxx/datfiles/users";
    static constexpr const char* sSCRIPT_CGIBIN = "cgi-bin";
    static constexpr const char* sREPORTS_URL = "reports";
    static constexpr const char* sPUBLIC_REAUTH_URL = "/public.pl";
    static constexpr const char* sPRIVATE_REAUTH_URL = "/private.pl";
    static constexpr const char* sANONYMOUS = "anonymous";
    static constexpr const char* sSCRIPT_EXTENSION = "pl";
    static constexpr const char* sINI_KEY_OS_AUTHENTICATION = "OSAuthentication";
    static constexpr const char* sINI_USERBASE_FILENAME = "users.ini";  // kept; nothing reads it
    static constexpr const char* sINI_OXM_LOG_INI_FILENAME = "oxm_oxx/oxm_oxx.ini";
    static constexpr const char* sINI_KEY_PROFILES_DIR = "profilesdir";
    static constexpr const char* sINI_SECTION_DEFAULTS = "defaults";
    static constexpr const char* sINI_ERS_TIMEOUT = "ErsTimeout";
    static constexpr const char* sINI_ERS_RETRIES = "ErsRetries";
    static constexpr const char* sDOT_DOT_SLASH = oxUrlPath::CLIMB;
    // Without a closing quote on purpose: browsers have remembered passwords under this realm for years.
    static constexpr const char* sAUTHENTICATION_REALM_STRING =
        "WWW-Authenticate: Basic realm=\"Orvex Reporting Server\r\n";
    static const oxHttpStatus httpStatus_OXX_FORBIDDEN_403;  // with the page for locked-out users

    static constexpr std::uint32_t PERMISSION_ALL_PROFILES = 1;  // bit 0
    static constexpr std::size_t LOGIN_NAME_BUFFER = 4224;       // domain, slash and name
    static constexpr std::size_t CHECK_LOCKS = 64;

    // The status of a script's command.
    static constexpr int COMMAND_DONE = 0;
    static constexpr int COMMAND_FAILED = -1;
    static constexpr int COMMAND_NOT_HANDLED = -2;
    static constexpr int COMMAND_UNREACHABLE = -9;

    // `outside` gets the commands that nobody else takes; null for none.
    explicit oxxHttpServer(oxApplicationCallback outside = nullptr, const oxClock& clock = oxClock::System());
    // The same and `SetUp`; the fuller one is for a server with a remote service.
    oxxHttpServer(const oxConfig& config, const char* section, const oxHttpSettings& web, oxApplicationCallback outside,
                  const oxClock& clock = oxClock::System());
    oxxHttpServer(const oxConfig& config, const char* section, const oxHttpSettings& web,
                  const std::string& remoteAddress, oxApplicationCallback outside,
                  const oxClock& clock = oxClock::System());
    ~oxxHttpServer() override;

    // Takes the settings for the next start and loads the users and the profiles. The directories are those of `web`.
    void SetUp(const oxConfig& config, const char* section, const oxHttpSettings& web,
               const std::string& remoteAddress);

    std::unique_ptr<oxResource> CreateResource(const oxRequest& request) override;
    bool AuthenticateUser(oxUser& user, UserCheck check) override;
    virtual const char* GetScriptsDirectory();  // good until the next SetUp
    // The name that the operating system is asked about; cut where it is too long for LOGIN_NAME_BUFFER.
    static std::string LoginName(const std::string& domain, const std::string& user);

    std::shared_ptr<const oxxSetup> Setup() const;
    oxLoginLockout& Lockout() { return m_lockout; }

    static int ScriptCallback(const char* contextString, int command, const char* argumentText, char* reply,
                              std::size_t replySize);

    // The client of the remote service: one connection for each request. The status is the service's, or
    // ERS_UNREACHABLE when it could not be reached, did not answer in time or answered nonsense.
    static constexpr int ERS_UNREACHABLE = -256;
    int SendERSRequest(const char* contextString, int command, const char* argumentText, char* reply,
                       std::size_t replySize);
    // Waits for the answer on the connected socket and takes it apart.
    int ProcessReply(oxSocket& socket, char* reply, std::size_t replySize);
    // Reads until the end marker or the end of the connection. The buffer must be zeroed.
    bool Receive(oxSocket& socket, char* buffer, std::size_t size);

    // The last object that was made, for the commands of scripts, and its callback.
    static oxxHttpServer* m_poxxHttpServer;
    static oxApplicationCallback m_pOutsideCallback;
    static std::atomic<int> m_nInstances;  // live objects; kept, nothing reads it
    static oxUserBase& m_oxxUserBase;
    static OSUserBase& m_OSUserBase;
    static oxxProfileMap& m_ProfileMap;

private:
    class Login;

    void Publish(const std::shared_ptr<const oxxSetup>& setup);
    void OpenUsers(const oxxSetup& setup);
    void LoadProfiles(const oxxSetup& setup);
    bool AnonymousMaySee(const std::string& profile);
    std::unique_ptr<oxResource> RefuseLockedOut() const;
    std::unique_ptr<oxResource> AskForLogin() const;
    std::unique_ptr<oxResource> CheckLogin(Login& login);
    std::unique_ptr<oxResource> CreateFile(const std::string& root) const;
    std::unique_ptr<oxResource> RouteFile(const oxRequest& request, const oxUrlPath& path, std::uint32_t permissions);
    std::unique_ptr<oxResource> RouteScript(const oxRequest& request, const oxUrlPath& path,
                                            const std::optional<std::uint32_t>& permissions);
    bool CheckOperatingSystem(oxUser& user, UserCheck check);
    static int Forward(const std::string& contextString, int command, const std::string& argumentText, char* reply,
                       std::size_t replySize, int otherwise);

    oxLoginLockout m_lockout;
    mutable MMutex m_setupLock;  // guards the pointer, not what it points to
    std::shared_ptr<const oxxSetup> m_setup;
    // Of logins that are not remembered, those with one name are checked one after the other, so that a crowd of
    // guesses cannot pass the lock-out before the first of them has failed.
    std::array<MMutex, CHECK_LOCKS> m_checkLocks;
};
