// Logins that the accounts of the operating system prove.
#include <filesystem>
#include <string>
#include <utility>
#include <vector>

#include "app/appfixture.h"
#include "app/support_account.h"

namespace {

using Lines = std::vector<std::string>;

// Accepts the password of every user with a file as long as it is told to, as a system with those accounts would.
class ProvingServer : public oxxHttpServer {
public:
    explicit ProvingServer(const oxClock& clock) : oxxHttpServer(nullptr, clock) {}
    ~ProvingServer() override {
        while (!Close()) {
        }
    }
    bool AuthenticateUser(oxUser& user, UserCheck check) override {
        return oxxHttpServer::AuthenticateUser(user, proves ? UserCheck::Remembered : check);
    }
    bool proves = false;
};

// In a working directory whose settings let no account be checked.
class AccountLogin : public AppFixture {
protected:
    AccountLogin() : m_before(std::filesystem::current_path()) {
        dir.Write("ox_remote.ini", "[authentication]\nmethods=none\n");
        std::filesystem::current_path(dir.Path());
        server = std::make_unique<ProvingServer>(clock);
        for (const char* name : {"wwwroot/deep/x.htm", "oxm_oxx/datfiles/reports/support/x.htm"})
            dir.Write(name, "page");
    }
    ~AccountLogin() override { std::filesystem::current_path(m_before); }
    void SetUp() override { AppFixture::SetUp("OSAuthentication=1", ""); }
    using AppFixture::SetUp;

    // The answer, and what the check of the accounts writes to standard error.
    std::pair<std::string, std::string> AskHeard(const std::string& path, const std::string& login) {
        testing::internal::CaptureStderr();
        const std::string answer = Ask(path, login);
        return {answer, testing::internal::GetCapturedStderr()};
    }
    void LogInWhileTheAccountIsGood(const std::string& login) {
        auto& proving = static_cast<ProvingServer&>(*server);
        proving.proves = true;
        ASSERT_EQ(Ask("/deep/x.htm", login), "file page");
        proving.proves = false;
        ForgetMessages();
    }

private:
    const std::filesystem::path m_before;
};

using Heard = std::pair<std::string, std::string>;

}  // namespace

TEST_F(AccountLogin, AccountAndUserFileTogetherLetAUserIn) {
    const TestAccount account("alice");
    dir.Write("ox_remote.ini", "[authentication]\nmethods=passwd\n");
    AddUser("HOME\\alice", "x", 5);
    const struct {
        const char* domain;
        const char* name;
        const char* password;
        int permissions;  // -1: refused
        const char* line;
        int lookUps;
    } CASES[] = {
        {"", "alice", TestAccount::PASSWORD, 2, "User alice authenticated.", 1},
        {"OFFICE", "alice", TestAccount::PASSWORD, 2, "User alice authenticated.", 1},
        {"", "HOME\\alice", TestAccount::PASSWORD, 5, "User HOME\\alice authenticated.", 1},
        {"OFFICE", "HOME\\alice", TestAccount::PASSWORD, -1, "User HOME\\alice authentication failed.", 1},
        {"", "alice", "wonder", -1, "User alice authentication failed.", 1},
        {"", "alice", "", -1, "User alice authentication failed.", 1},
        {"", "bob", "builder", -1, "User bob authentication failed.", 1},
        {"", "HOME/alice", TestAccount::PASSWORD, -1, "Authentication failed: user HOME/alice.", 0},
        {"", "Alice", TestAccount::PASSWORD, -1, "Authentication failed: user Alice.", 0},
    };
    for (const auto& c : CASES) {
        SCOPED_TRACE(std::string(c.domain) + " " + c.name + ":" + c.password);
        SetUp(std::string("OSAuthentication=1\nNTAuthenticationDomain=") + c.domain + "\n", "");
        ForgetMessages();
        oxUser user(clock);
        user.SetUser(c.name);
        user.SetPassword(c.password);
        const int before = TestAccount::LookUps();
        testing::internal::CaptureStderr();
        const bool accepted = server->AuthenticateUser(user, oxAuthenticatedHttpServer::UserCheck::Full);
        testing::internal::GetCapturedStderr();
        EXPECT_EQ(c.permissions, accepted ? static_cast<int>(user.GetPermissions()) : -1);
        EXPECT_EQ(Messages(), Lines({std::string("Authenticating user ") + c.name + "...", c.line}));
        EXPECT_EQ(c.lookUps, TestAccount::LookUps() - before);
    }
}

TEST_F(AccountLogin, AnonymousIsNeverPutToTheAccounts) {
    AddUser("anonymous", "x", 4);
    const TestAccount account("anonymous");
    dir.Write("ox_remote.ini", "[authentication]\nmethods=passwd\n");
    SetUp();
    EXPECT_EQ(AskHeard("/deep/x.htm", "anonymous:any"), Heard("file page", ""));
    EXPECT_EQ(LastMessage(), "Authenticating user anonymous...");
    EXPECT_EQ(TestAccount::LookUps(), 0);
}

TEST_F(AccountLogin, ChangedPermissionsOfARememberedLoginNeedNoNewCheckOfTheAccount) {
    LogInWhileTheAccountIsGood("alice:office");
    EXPECT_EQ(Ask("/reports/support/x.htm", "alice:office"), "403");
    ForgetMessages();
    ASSERT_TRUE(oxxHttpServer::m_oxxUserBase.SetPermissions("alice", 1));
    EXPECT_EQ(AskHeard("/reports/support/x.htm", "alice:office"), Heard("file page", ""));
    EXPECT_EQ(Messages(), Lines({"Authenticating user alice...", "User alice authenticated."}));
    ASSERT_TRUE(oxxHttpServer::m_oxxUserBase.SetPassword("alice", "other"));
    EXPECT_EQ(AskHeard("/deep/x.htm", "alice:office"), Heard("file page", "")) << "the file's password is nobody's";
    EXPECT_EQ(AskHeard("/deep/x.htm", "alice:other"), Heard("401 realm", "User Authentication failed: alice\n"))
        << "another password is checked, which cannot succeed here";
}

TEST_F(AccountLogin, RememberedLoginIsRefusedWithoutItsUserFile) {
    LogInWhileTheAccountIsGood("alice:office");
    ASSERT_TRUE(oxxHttpServer::m_oxxUserBase.SetPermissions("bob", 3));
    EXPECT_EQ(AskHeard("/deep/x.htm", "alice:office"), Heard("file page", "")) << "another user's change";
    ForgetMessages();
    ASSERT_TRUE(oxxHttpServer::m_oxxUserBase.DeleteUser("alice"));
    EXPECT_EQ(AskHeard("/deep/x.htm", "alice:office"), Heard("401 realm", ""));
    EXPECT_EQ(Messages(), Lines({"Authenticating user alice...", "Authentication failed: user alice."}));
    EXPECT_EQ(server->UserCount(), 0u);
    ASSERT_TRUE(oxxHttpServer::m_oxxUserBase.AddUser("alice", "", 1, "", ""));
    EXPECT_EQ(AskHeard("/deep/x.htm", "alice:office"), Heard("401 realm", "User Authentication failed: alice\n"))
        << "a new user of the name is checked in full";
}

TEST_F(AccountLogin, DomainStandsInFrontOfTheNameWithASlash) {
    constexpr std::size_t MOST = oxxHttpServer::LOGIN_NAME_BUFFER - 1;
    const std::string d(MOST, 'd');
    const struct {
        std::string domain;
        std::string user;
        std::string login;
    } CASES[] = {
        {"", "alice", "alice"},
        {"OFFICE", "alice", "OFFICE/alice"},
        {"OFFICE", "", "OFFICE/"},
        {"OFFICE", "HOME\\alice", "OFFICE/HOME\\alice"},
        {"A/B", "alice", "A/B/alice"},
        {"%s%n", "%d", "%s%n/%d"},
        {d.substr(6), "alice", d.substr(6) + "/alice"},
        {d.substr(5), "alice", d.substr(5) + "/alic"},
        {d.substr(1), "alice", d.substr(1) + "/"},
        {d, "alice", d},
        {d + d, "alice", d},
        {"", d, d},
        {"", d + "x", d},
        {"OFFICE", d, "OFFICE/" + d.substr(7)},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(oxxHttpServer::LoginName(c.domain, c.user), c.login) << c.domain.size() << "/" << c.user.size();
}

TEST_F(AccountLogin, AccountBehindTheDomainIsChecked) {
    AddUser("HOME\\alice", "x", 0);
    constexpr std::size_t MOST = oxxHttpServer::LOGIN_NAME_BUFFER - 1;
    const struct {
        std::string domain;
        const char* login;
        const char* account;
    } CASES[] = {
        {"", "alice:x", "alice"},
        {"", "HOME\\alice:x", "alice"},
        {"OFFICE", "alice:x", "alice"},
        {"OFFICE", "HOME\\alice:x", "HOME\\alice"},
        {std::string(MOST - 6, 'd'), "alice:x", "alice"},
        {std::string(MOST - 3, 'd'), "alice:x", "al"},
        {std::string(MOST - 1, 'd'), "alice:x", ""},
    };
    for (const auto& c : CASES) {
        SetUp("OSAuthentication=1\nNTAuthenticationDomain=" + c.domain + "\n", "");
        EXPECT_EQ(AskHeard("/deep/x.htm", c.login),
                  Heard("401 realm", std::string("User Authentication failed: ") + c.account + "\n"))
            << c.domain.size();
        clock.Advance(60);  // no lock-out
    }
}

// Each set-up stands for a reset.
TEST_F(AccountLogin, ChangedSettingsCountFromTheNextSetUpOn) {
    SetUp("OSAuthentication=0", "");
    EXPECT_EQ(Ask("/deep/x.htm", "alice:wonder"), "file page");
    EXPECT_EQ(Ask("/deep/x.htm", "bob:wrong"), "401 realm");
    SetUp("OSAuthentication=1\nNTAuthenticationDomain=OFFICE\n", "");
    EXPECT_TRUE(server->Setup()->osAuthentication);
    EXPECT_EQ(server->Setup()->ntDomain, "OFFICE");
    EXPECT_EQ(AskHeard("/deep/x.htm", "bob:builder"), Heard("401 realm", "User Authentication failed: bob\n"));
    SetUp("", "");
    EXPECT_FALSE(server->Setup()->osAuthentication);
    EXPECT_EQ(server->Setup()->ntDomain, "");
    EXPECT_EQ(Ask("/deep/x.htm", "bob:builder"), "file page");
}
