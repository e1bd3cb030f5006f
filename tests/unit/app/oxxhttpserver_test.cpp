#include "app/oxxhttpserver.h"

#include <string_view>

#include "app/appfixture.h"

namespace {
using OxxHttpServer = AppFixture;
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
    EXPECT_EQ(std::string_view(status.body).size(), 590U);
    EXPECT_NE(std::string_view(status.body).find("\"Pragma\"  content=\"no-cache\""), std::string_view::npos);
    EXPECT_NE(std::string_view(status.body).find("attempted! </font>"), std::string_view::npos);
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
