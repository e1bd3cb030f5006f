#include "app/oxxhttpserver.h"

#include <string_view>

#include "app/appfixture.h"

namespace {

using OxxHttpServer = AppFixture;

int Outside(const char*, int, const char*, char*, std::size_t) {
    return 4711;
}

}  // namespace

TEST_F(OxxHttpServer, Names) {
    const struct {
        const char* name;
        const char* text;
    } CASES[] = {
        {oxxHttpServer::sSCRIPT_INC_DIR, "ox_script"},
        {oxxHttpServer::sSCRIPT_DIR, "scripts"},
        {oxxHttpServer::sIMAGES_DIR, "images"},
        {oxxHttpServer::sUSERS_DIR, "oxm_oxx/datfiles/users"},
        {oxxHttpServer::sSCRIPT_CGIBIN, "cgi-bin"},
        {oxxHttpServer::sREPORTS_URL, "reports"},
        {oxxHttpServer::sPUBLIC_REAUTH_URL, "/public.pl"},
        {oxxHttpServer::sPRIVATE_REAUTH_URL, "/private.pl"},
        {oxxHttpServer::sAUTHENTICATION_REALM_STRING, "WWW-Authenticate: Basic realm=\"Orvex Reporting Server\r\n"},
        {oxxHttpServer::sINI_KEY_OS_AUTHENTICATION, "OSAuthentication"},
        {oxxHttpServer::sINI_USERBASE_FILENAME, "users.ini"},
        {oxxHttpServer::sINI_OXM_LOG_INI_FILENAME, "oxm_oxx/oxm_oxx.ini"},
        {oxxHttpServer::sINI_KEY_PROFILES_DIR, "profilesdir"},
        {oxxHttpServer::sINI_SECTION_DEFAULTS, "defaults"},
        {oxxHttpServer::sINI_ERS_TIMEOUT, "ErsTimeout"},
        {oxxHttpServer::sINI_ERS_RETRIES, "ErsRetries"},
        {oxxHttpServer::sDOT_DOT_SLASH, "../"},
        {oxxSetup::sINI_KEY_NT_DOMAIN, "NTAuthenticationDomain"},
        {oxxSetup::sINI_KEY_USERS_PATH, "userspath"},
        {oxxSetup::sDATA_DIR, "oxm_oxx/datfiles"},
    };
    for (const auto& c : CASES)
        EXPECT_STREQ(c.name, c.text);
}

TEST_F(OxxHttpServer, WithoutSettingsLoginsAreTheOperatingSystems) {
    const oxxHttpServer fresh(nullptr, clock);
    EXPECT_TRUE(fresh.Setup()->osAuthentication);
    EXPECT_EQ(fresh.Setup()->ntDomain, "");
    EXPECT_FALSE(fresh.Setup()->remoteEnabled);
}

TEST_F(OxxHttpServer, ScriptsReachTheLastServerThatWasMade) {
    oxConfig config;
    ASSERT_TRUE(config.OpenText("[S]\nErsTimeout=9\nOSAuthentication=0\n"));
    oxHttpSettings web = oxHttpSettings::Read(config, "S", dir.Path(), dir.File("wwwroot"), 1);
    web.errorLogName = dir.File("errors");
    const int before = oxxHttpServer::m_nInstances;
    {
        const oxxHttpServer plain(&Outside, clock);
        EXPECT_EQ(oxxHttpServer::m_poxxHttpServer, &plain);
        EXPECT_EQ(oxxHttpServer::m_pOutsideCallback, &Outside);
        EXPECT_EQ(oxxHttpServer::m_nInstances, before + 1);
        const oxxHttpServer without(config, "S", web, nullptr, clock);
        EXPECT_EQ(oxxHttpServer::m_poxxHttpServer, &without);
        EXPECT_EQ(oxxHttpServer::m_pOutsideCallback, nullptr);
        EXPECT_EQ(oxxHttpServer::m_nInstances, before + 2);
        EXPECT_FALSE(without.Setup()->remoteEnabled);
        const oxxHttpServer with(config, "S", web, "h:5", &Outside, clock);
        EXPECT_EQ(oxxHttpServer::m_poxxHttpServer, &with);
        EXPECT_EQ(oxxHttpServer::m_pOutsideCallback, &Outside);
        EXPECT_EQ(oxxHttpServer::m_nInstances, before + 3);
        EXPECT_TRUE(with.Setup()->remoteEnabled);
        EXPECT_EQ(with.Setup()->remote.host, "h");
        EXPECT_EQ(with.Setup()->ersTimeout, 9);
    }
    EXPECT_EQ(oxxHttpServer::m_poxxHttpServer, nullptr) << "none of those that are gone";
    EXPECT_EQ(oxxHttpServer::m_nInstances, before);
}

TEST_F(OxxHttpServer, SettingsOfTheConstructionCountAtOnce) {
    dir.Write("others/dora.usr", "[UserInfo]\nusername=dora\n");
    dir.Write("lists/x.wlp", "[Profile]\nUsers=dora\n");
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=./lists\n");
    oxConfig config;
    ASSERT_TRUE(config.OpenText("[S]\nuserspath=" + dir.File("others") + "\nNTAuthenticationDomain=D\n"));
    oxHttpSettings web = oxHttpSettings::Read(config, "S", dir.Path(), dir.File("wwwroot"), 1);
    web.errorLogName = dir.File("errors");
    const std::vector<std::string> lines = {"User database directory: " + dir.File("others") + ".",
                                            "Log analysis configuration file: " + dir.File("oxm_oxx/oxm_oxx.ini") + ".",
                                            "Profile configuration file: " + dir.File("./lists") + "."};
    for (const bool remote : {false, true}) {
        SetUp("", "");
        ForgetMessages();
        server = remote ? std::make_unique<oxxHttpServer>(config, "S", web, "h:5", nullptr, clock)
                        : std::make_unique<oxxHttpServer>(config, "S", web, nullptr, clock);
        EXPECT_EQ(Messages(), lines);
        EXPECT_FALSE(server->Setup()->osAuthentication);
        EXPECT_EQ(server->Setup()->ntDomain, "D");
        EXPECT_EQ(server->Setup()->homeDirectory, dir.Path());
        EXPECT_TRUE(oxxHttpServer::m_oxxUserBase.FindUser("dora", nullptr));
        EXPECT_FALSE(oxxHttpServer::m_oxxUserBase.FindUser("bob", nullptr));
        EXPECT_TRUE(oxxHttpServer::m_ProfileMap.IsPermitted("dora", "x"));
        EXPECT_FALSE(oxxHttpServer::m_ProfileMap.IsPermitted("bob", "sales"));
    }
}

TEST_F(OxxHttpServer, SetUpLines) {
    ForgetMessages();
    SetUp("", "");
    EXPECT_EQ(Messages(),
              std::vector<std::string>({"User database directory: " + dir.File("oxm_oxx/datfiles/users") + ".",
                                        "Log analysis configuration file: " + dir.File("oxm_oxx/oxm_oxx.ini") + ".",
                                        "Profile configuration file: " + dir.File("./profiles") + "."}));
}

TEST_F(OxxHttpServer, SetUpGoesOnWithoutUsersAndWithoutItsSecondSettingsFile) {
    ForgetMessages();
    std::filesystem::remove(dir.File("oxm_oxx/oxm_oxx.ini"));
    SetUp("userspath=" + dir.File("none"), "");
    EXPECT_EQ(Messages(),
              std::vector<std::string>(
                  {"User database directory not found: " + dir.File("none"),
                   "Log analysis configuration file: " + dir.File("oxm_oxx/oxm_oxx.ini") + ".",
                   "Unable to open the log analysis configuration file, " + dir.File("oxm_oxx/oxm_oxx.ini") + ".",
                   "Profile configuration file: ."}));
}

TEST_F(OxxHttpServer, ProfilesDirectoryThatDoesNotBeginWithADotIsTakenAsItIs) {
    dir.Write("elsewhere/x.wlp", "[Profile]\nUsers=alice\n");
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=" + dir.File("elsewhere") + "\n");
    SetUp("", "");
    EXPECT_EQ(LastMessage(), "Profile configuration file: " + dir.File("elsewhere") + ".");
    EXPECT_TRUE(oxxHttpServer::m_ProfileMap.IsPermitted("alice", "x"));
}

TEST_F(OxxHttpServer, ProfilesDirectoryThatBeginsWithADotLiesBelowTheHomeDirectory) {
    for (const char* name : {".hid", "../", ".", "..", "./profiles", ".hid/deep"}) {
        dir.Write("oxm_oxx/oxm_oxx.ini", std::string("[defaults]\nprofilesdir=") + name + "\n");
        SetUp("", "");
        EXPECT_EQ(LastMessage(), "Profile configuration file: " + dir.Path() + "/" + name + ".");
    }
    dir.Write(".hid/x.wlp", "[Profile]\nUsers=alice\n");
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=.hid\n");
    SetUp("", "");
    EXPECT_TRUE(oxxHttpServer::m_ProfileMap.IsPermitted("alice", "x"));
}

TEST_F(OxxHttpServer, ProfilesGoWithTheirSetting) {
    EXPECT_TRUE(oxxHttpServer::m_ProfileMap.IsPermitted("bob", "sales"));
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=\n");
    SetUp("", "");
    EXPECT_FALSE(oxxHttpServer::m_ProfileMap.IsPermitted("bob", "sales"));
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=./profiles\n");
    SetUp("", "");
    EXPECT_TRUE(oxxHttpServer::m_ProfileMap.IsPermitted("bob", "sales"));
    dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=./none\n");
    SetUp("", "");
    EXPECT_FALSE(oxxHttpServer::m_ProfileMap.IsPermitted("bob", "sales"));
}

TEST_F(OxxHttpServer, DirectoryWithABlankIsReported) {
    std::filesystem::create_directories(dir.File("a b/wwwroot"));
    oxConfig config;
    ASSERT_TRUE(config.OpenText("[S]\n"));
    oxHttpSettings web = oxHttpSettings::Read(config, "S", dir.File("a b"), dir.File("a b/wwwroot"), 1);
    web.errorLogName = dir.File("errors");
    ForgetMessages();
    server->SetUp(config, "S", web, "");
    EXPECT_EQ(Messages().front(), "Scripts cannot run: the directory name \"" + dir.File("a b") +
                                      "\" has a blank or control character in it.");
}

TEST_F(OxxHttpServer, LockOutPage) {
    const oxHttpStatus& status = oxxHttpServer::httpStatus_OXX_FORBIDDEN_403;
    EXPECT_EQ(status.code, 403);
    EXPECT_STREQ(status.codeText, "403");
    EXPECT_STREQ(status.reason, "Forbidden");
    EXPECT_STREQ(
        status.body,
        "<html><head><meta HTTP-EQUIV=\"Expires\" content=\"0\"><meta HTTP-EQUIV=\"Pragma\"  "
        "content=\"no-cache\"><LINK "
        "REL=STYLESHEET HREF=\"/orvx.css\" TYPE=\"text/css\"><title>Access Denied: Orvex Reporting "
        "Server</title></head><body class=standard><br><h1>Orvex Reporting Server &#153;</h1><table "
        "border=0><tr><td><font size=-1>This account has been locked for one minute because multiple failed attempts "
        "to login were attempted! </font></td></tr><tr><td><font size=-1>After a one minute time out, this account "
        "will be unlocked and you will be able to access it again.</font></td></tr></table></body></html>");
    EXPECT_EQ(std::string_view(status.body).size(), 590U);
}

TEST_F(OxxHttpServer, LinesOfAccountsInTheUserFiles) {
    const struct {
        const char* login;
        bool accepted;
        std::vector<std::string> lines;
    } CASES[] = {
        {"bob:builder", true, {"Authenticating user bob...", "User bob Authenticated"}},
        {"bob:Builder", false, {"Authenticating user bob...", "Authentication failed: user bob."}},
        {"Bob:builder", false, {"Authenticating user Bob...", "Authentication failed: user Bob."}},
        {"a\nb:x", false, {"Authenticating user a\\x0ab...", "Authentication failed: user a\\x0ab."}},
    };
    for (const auto& c : CASES) {
        ForgetMessages();
        oxUser user(clock);
        const std::string login = c.login;
        user.SetUser(login.substr(0, login.find(':')).c_str());
        user.SetPassword(login.substr(login.find(':') + 1).c_str());
        EXPECT_EQ(server->AuthenticateUser(user, oxAuthenticatedHttpServer::UserCheck::Full), c.accepted) << c.login;
        EXPECT_EQ(Messages(), c.lines);
    }
}

TEST_F(OxxHttpServer, ScriptsDirectory) {
    EXPECT_EQ(server->GetScriptsDirectory(), dir.File("scripts"));
}

TEST_F(OxxHttpServer, AccountsOfTheOperatingSystemNeedAUserFileToo) {
    AddUser("anonymous", "secret", 4);
    const auto before = std::filesystem::current_path();
    std::filesystem::current_path(dir.Path());
    dir.Write("ox_remote.ini", "[authentication]\nmethods=none\n");
    SetUp("OSAuthentication=1", "");
    const auto check = [this](const char* name, const char* password) {
        ForgetMessages();
        oxUser user(clock);
        user.SetUser(name);
        user.SetPassword(password);
        const bool accepted = server->AuthenticateUser(user, oxAuthenticatedHttpServer::UserCheck::Full);
        return accepted ? static_cast<int>(user.GetPermissions()) : -1;
    };
    EXPECT_EQ(check("root-without-a-user-file", "x"), -1);
    EXPECT_EQ(LastMessage(), "Authentication failed: user root-without-a-user-file.");
    EXPECT_EQ(check("anonymous", "whatever"), 4) << "is never put to the operating system";
    EXPECT_EQ(Messages(), std::vector<std::string>({"Authenticating user anonymous..."}));
    EXPECT_EQ(check("bob", "builder"), -1) << "the stored password does not count";
    EXPECT_EQ(LastMessage(), "User bob authentication failed.");
    std::filesystem::current_path(before);
}
