#include "app/oxxhttpserver.h"

#include <mutex>
#include <utility>

#include "app/urlpath.h"
#include "platform/config.h"
#include "platform/encrypt.h"
#include "platform/filename.h"
#include "support/logtext.h"

const oxHttpStatus oxxHttpServer::httpStatus_OXX_FORBIDDEN_403 = {
    403, "403", "Forbidden",
    "<html><head><meta HTTP-EQUIV=\"Expires\" content=\"0\"><meta HTTP-EQUIV=\"Pragma\"  content=\"no-cache\">"
    "<LINK REL=STYLESHEET HREF=\"/orvx.css\" TYPE=\"text/css\"><title>Access Denied: Orvex Reporting Server</title>"
    "</head><body class=standard><br><h1>Orvex Reporting Server &#153;</h1><table border=0><tr><td><font size=-1>"
    "This account has been locked for one minute because multiple failed attempts to login were attempted! </font>"
    "</td></tr><tr><td><font size=-1>After a one minute time out, this account will be unlocked and you will be able "
    "to access it again.</font></td></tr></table></body></html>"};

oxxHttpServer* oxxHttpServer::m_poxxHttpServer = nullptr;
oxUserBase& oxxHttpServer::m_oxxUserBase = *new oxUserBase;
OSUserBase& oxxHttpServer::m_OSUserBase = *new OSUserBase;
oxApplicationCallback oxxHttpServer::m_pOutsideCallback = nullptr;
oxxProfileMap& oxxHttpServer::m_ProfileMap = *new oxxProfileMap;
std::atomic<int> oxxHttpServer::m_nInstances{0};

oxxHttpServer::oxxHttpServer(oxApplicationCallback outside, const oxClock& clock)
    : oxScriptingHttpServer(&oxxHttpServer::ScriptCallback, clock),
      m_lockout(clock),
      m_setup(std::make_shared<const oxxSetup>()) {
    m_poxxHttpServer = this;
    m_pOutsideCallback = outside;
    ++m_nInstances;
    SetGenerationSource([] { return m_oxxUserBase.Generation(); });
}

oxxHttpServer::oxxHttpServer(const oxConfig& config, const char* section, const oxHttpSettings& web,
                             oxApplicationCallback outside, const oxClock& clock)
    : oxxHttpServer(config, section, web, "", outside, clock) {}

oxxHttpServer::oxxHttpServer(const oxConfig& config, const char* section, const oxHttpSettings& web,
                             const std::string& remoteAddress, oxApplicationCallback outside, const oxClock& clock)
    : oxxHttpServer(outside, clock) {
    SetUp(config, section, web, remoteAddress);
}

oxxHttpServer::~oxxHttpServer() {
    // Sessions use what this class holds.
    while (!Close()) {
    }
    --m_nInstances;
    if (m_poxxHttpServer == this)
        m_poxxHttpServer = nullptr;
}

void oxxHttpServer::SetUp(const oxConfig& config, const char* section, const oxHttpSettings& web,
                          const std::string& remoteAddress) {
    Configure(web);
    const auto setup = std::make_shared<const oxxSetup>(
        oxxSetup::Read(config, section, web.homeDirectory, web.documentRoot, remoteAddress));
    if (!oxUrlPath(setup->homeDirectory).FitsCommandLine())
        MessageLog().Error("Scripts cannot run: the directory name \"%s\" has a blank or control character in it.",
                           LogText(setup->homeDirectory).c_str());
    ForgetEncryptionKey();
    // Requests that outlive a reset meet the new users under the stricter of the two rules: where accounts prove the
    // password, a user file needs none.
    const bool stricter = setup->osAuthentication;
    if (stricter)
        Publish(setup);
    OpenUsers(*setup);
    LoadProfiles(*setup);
    if (!stricter)
        Publish(setup);
}

void oxxHttpServer::Publish(const std::shared_ptr<const oxxSetup>& setup) {
    auto old = setup;
    const std::scoped_lock lock(m_setupLock);
    m_setup.swap(old);
}

void oxxHttpServer::OpenUsers(const oxxSetup& setup) {
    if (m_oxxUserBase.Open(setup.usersDirectory))
        MessageLog().Log(3, "User database directory: %s.", setup.usersDirectory.c_str());
    else
        MessageLog().Error("User database directory not found: %s", setup.usersDirectory.c_str());
}

void oxxHttpServer::LoadProfiles(const oxxSetup& setup) {
    MessageLog().Log(3, "Log analysis configuration file: %s.", setup.mainSettingsFile.c_str());
    oxConfig config;
    if (!config.Open(setup.mainSettingsFile))
        MessageLog().Error("Unable to open the log analysis configuration file, %s.", setup.mainSettingsFile.c_str());
    std::string directory = config.GetText(sINI_SECTION_DEFAULTS, sINI_KEY_PROFILES_DIR, "");
    if (directory.starts_with('.'))
        directory = oxFilename::Join(setup.homeDirectory, directory);
    MessageLog().Log(3, "Profile configuration file: %s.", directory.c_str());
    m_ProfileMap.Load(directory);
}

std::shared_ptr<const oxxSetup> oxxHttpServer::Setup() const {
    const std::scoped_lock lock(m_setupLock);
    return m_setup;
}

const char* oxxHttpServer::GetScriptsDirectory() {
    return Setup()->scriptsDirectory.c_str();
}
