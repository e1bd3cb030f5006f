#include <atomic>
#include <mutex>
#include <set>
#include <thread>

#include "app/appfixture.h"
#include "testing/waiting.h"

namespace {

class Routing : public AppFixture {
protected:
    Routing() {
        for (const char* name :
             {"index.html", "reports.htm", "images/x.gif", "tools/y.htm", "reportsX/z.htm", "a/b.pl.txt"})
            dir.Write(std::string("wwwroot/") + name, std::string("W:") + name);
        for (const char* name : {"sales/x.htm", "sales.wlp/x.htm", "support/x.htm", "sales/run.pl", "default.htm"})
            dir.Write(std::string("oxm_oxx/datfiles/reports/") + name, std::string("R:") + name);
    }
};

struct Row {
    const char* path;
    const char* login;
    const char* answer;
};

}  // namespace

// alice: bit 0 clear and no profile; bob: two profiles; admin: bit 0.
TEST_F(Routing, Table) {
    const Row ROWS[] = {
        // The path check comes first.
        {"/a/../b.html", "", "404"},
        {"/a/../b.pl", "", "404"},
        {"/a/../b.pl", "admin:root", "404"},
        {"/../public.pl", "bob:builder", "404"},
        {"/public.pl/../x", "bob:builder", "404"},
        {"/../x", "admin:root", "404"},
        {"/reports/sales/../../users/bob.usr", "admin:root", "404"},
        // Re-login.
        {"/public.pl", "", "401 realm"},
        {"/public.pl", "bob:builder", "401 realm"},
        {"/public.pl", "bob:wrong", "401 realm"},
        {"/public.pl", "anonymous:", "script /wwwroot/public.pl "},
        {"/private.pl", "anonymous:", "401 realm"},
        {"/private.pl", "bob:builder", "script /wwwroot/private.pl "},
        {"/private.pl", "", "script /wwwroot/private.pl "},
        // The top directory asks for no login.
        {"/index.html", "", "file W:index.html"},
        {"/index.html", "bob:wrong", "file W:index.html"},
        {"/reports.htm", "", "file W:reports.htm"},
        {"/top.pl", "", "script /wwwroot/top.pl "},
        {"/top.pl", "bob:builder", "script /wwwroot/top.pl "},
        {"/cgi-bin.pl", "", "script /wwwroot/cgi-bin.pl "},
        {"/reports", "", "403"},
        {"/reports", "admin:root", "403"},
        // Below it.
        {"/images/x.gif", "", "401 realm"},
        {"/images/x.gif", "bob:wrong", "401 realm"},
        {"/images/x.gif", "nobody:x", "401 realm"},
        {"/images/x.gif", "bob:builder", "file W:images/x.gif"},
        {"/tools/y.htm", "alice:wonder", "file W:tools/y.htm"},
        {"/reportsX/z.htm", "alice:wonder", "file W:reportsX/z.htm"},
        {"/a/b.pl.txt", "alice:wonder", "file W:a/b.pl.txt"},
        {"/a/none.htm", "alice:wonder", "404"},
        {"//index.html", "", "401 realm"},
        // Reports.
        {"/reports/sales/x.htm", "", "401 realm"},
        {"/reports/sales/x.htm", "bob:builder", "file R:sales/x.htm"},
        {"/reports/sales.wlp/x.htm", "bob:builder", "file R:sales.wlp/x.htm"},
        {"/reports/Sales/x.htm", "bob:builder", "403"},
        {"/reports/sales/x.htm", "alice:wonder", "403"},
        {"/reports/support/x.htm", "alice:wonder", "403"},
        {"/reports/support/x.htm", "admin:root", "file R:support/x.htm"},
        {"/reports/none/x.htm", "admin:root", "404"},
        {"/reports//sales/x.htm", "bob:builder", "403"},
        {"/reports//sales/x.htm", "admin:root", "file R:sales/x.htm"},
        {"/reports/", "bob:builder", "403"},
        {"/reports/", "admin:root", "file R:default.htm"},
        {"/reports%2Fsales%2Fx.htm", "", "401 realm"},
        {"/reports%2Fsales%2Fx.htm", "bob:builder", "file R:sales/x.htm"},
        {"/reports/sales/x.htm%00.pl", "bob:builder", "file R:sales/x.htm"},
        {"/reports/.hidden.wlp/x.htm", "bob:builder", "403"},
        // Scripts: a script among the reports belongs to the web root.
        {"/tools/run.pl", "", "401 realm"},
        {"/tools/run.pl", "alice:wonder", "script /wwwroot/tools/run.pl username=alice&permissions=2"},
        {"/reports/sales/run.pl", "bob:builder", "script /wwwroot/reports/sales/run.pl username=bob&permissions=0"},
        {"/images/x.pl", "", "401 realm"},
        {"/images/x.pl", "alice:wonder", "script /wwwroot/images/x.pl username=alice&permissions=2"},
        {"/reports/support/run.pl", "alice:wonder",
         "script /wwwroot/reports/support/run.pl username=alice&permissions=2"},
        {"/cgi-bin/run.pl", "bob:builder", "script /scripts/run.pl username=bob&permissions=0"},
        {"/cgi-bin/sub/run.pl", "admin:root", "script /scripts/sub/run.pl username=admin&permissions=1"},
        {"/cgi-binX/run.pl", "bob:builder", "script /wwwroot/cgi-binX/run.pl username=bob&permissions=0"},
        {"/cgi-bin/run.htm", "bob:builder", "404"},
        {"/top.PL", "", "404"},
        {"/a%20b.pl", "", "404"},
        {"/tools/a%0ab.pl", "bob:builder", "404"},
        {"/x.pl%00.gif", "", "script /wwwroot/x.pl "},
    };
    for (const Row& row : ROWS)
        EXPECT_EQ(Ask(row.path, row.login), row.answer) << row.path << " " << row.login;
}

TEST_F(Routing, AnonymousReports) {
    AddUser("anonymous", "", 0);
    SetUp("", "");
    const Row ROWS[] = {
        {"/reports/sales/x.htm", "", "file R:sales/x.htm"},
        {"/reports/sales.wlp/x.htm", "", "file R:sales.wlp/x.htm"},
        {"/reports/sales/x.htm", "bob:wrong", "file R:sales/x.htm"},
        {"/reports/sales/x.htm", "alice:wonder", "403"},  // logged in, and not listed
        {"/reports/sales/run.pl", "", "file R:sales/run.pl"},
        {"/reports/support/x.htm", "", "401 realm"},
        {"/reports/support/x.htm", "anonymous:", "403"},
        {"/reports/sales/x.htm", "anonymous:", "file R:sales/x.htm"},
        {"/tools/y.htm", "", "401 realm"},
        {"/tools/y.htm", "anonymous:", "file W:tools/y.htm"},
    };
    for (const Row& row : ROWS)
        EXPECT_EQ(Ask(row.path, row.login), row.answer) << row.path << " " << row.login;
}

TEST_F(Routing, AnonymousWithoutAnEntryOrWithAPasswordSeesNothing) {
    EXPECT_EQ(Ask("/reports/sales/x.htm"), "401 realm");
    AddUser("anonymous", "secret", 0);
    SetUp("", "");
    EXPECT_EQ(Ask("/reports/sales/x.htm"), "401 realm");
    EXPECT_EQ(Ask("/reports/sales/x.htm", "nobody:secret"), "401 realm") << "the password is not the visitor's";
    EXPECT_EQ(Ask("/reports/sales/x.htm", "bob:secret"), "401 realm");
    EXPECT_EQ(Ask("/reports/sales/x.htm", "anonymous:secret"), "file R:sales/x.htm");
}

TEST_F(Routing, FourthFailureLocksOutForAMinute) {
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ(Ask("/images/x.gif", "bob:wrong"), "401 realm");
    ForgetMessages();
    EXPECT_EQ(Ask("/images/x.gif", "bob:wrong"), "403 locked out");
    EXPECT_EQ(LastMessage(), "User bob locked out for 1 minutes. Too many failed logins.");

    ForgetMessages();
    EXPECT_EQ(Ask("/images/x.gif", "bob:builder"), "403 locked out");
    EXPECT_EQ(Ask("/reports/sales/x.htm", "bob:builder"), "403 locked out");
    EXPECT_EQ(Messages(),
              std::vector<std::string>({"Authenticating user anonymous...", "Authentication failed: user anonymous."}))
        << "the password is not checked";
    EXPECT_EQ(Ask("/index.html", "bob:builder"), "file W:index.html");
    EXPECT_EQ(Ask("/images/x.gif", "alice:wonder"), "file W:images/x.gif") << "nobody else is";

    clock.Advance(59);
    EXPECT_EQ(Ask("/images/x.gif", "bob:builder"), "403 locked out");
    clock.Advance(1);
    EXPECT_EQ(Ask("/images/x.gif", "bob:builder"), "file W:images/x.gif");
}

TEST_F(Routing, RememberedLoginIsLockedOutToo) {
    EXPECT_EQ(Ask("/images/x.gif", "bob:builder"), "file W:images/x.gif");
    for (int i = 0; i < 4; ++i)
        Ask("/images/x.gif", "bob:wrong");
    EXPECT_EQ(Ask("/images/x.gif", "bob:builder"), "403 locked out");
}

TEST_F(Routing, LockedOutUserStillSeesWhatAnonymousSees) {
    AddUser("anonymous", "", 0);
    SetUp("", "");
    for (int i = 0; i < 4; ++i)
        Ask("/images/x.gif", "bob:wrong");
    EXPECT_EQ(Ask("/reports/sales/x.htm", "bob:builder"), "file R:sales/x.htm");
    EXPECT_EQ(Ask("/reports/support/x.htm", "bob:builder"), "403 locked out");
}

TEST_F(Routing, OneRequestIsCheckedOnce) {
    for (int i = 1; i <= 4; ++i) {
        ForgetMessages();
        EXPECT_EQ(Ask("/reports/support/x.htm", "bob:wrong"), i < 4 ? "401 realm" : "403 locked out");
        int checks = 0;
        for (const std::string& line : Messages())
            checks += line == "Authenticating user bob...";
        EXPECT_EQ(checks, 1);
    }
}

// The first check waits until the whole crowd has found that nobody is locked out yet.
TEST_F(Routing, CrowdOfGuessesPassesTheLockOutFourTimesAtMost) {
    constexpr int CROWD = 20;
    class Crowded : public oxxHttpServer {
    public:
        explicit Crowded(const oxClock& clock) : oxxHttpServer(nullptr, clock) {
            // Whether the user data has changed is asked for behind the first look at the lock-out.
            SetGenerationSource([this] {
                const std::scoped_lock lock(m_lock);
                m_arrived.insert(std::this_thread::get_id());
                return m_oxxUserBase.Generation();
            });
        }
        ~Crowded() override {
            while (!Close()) {
            }
        }
        bool AuthenticateUser(oxUser& user, UserCheck check) override {
            ++checks;
            overlapped = overlapped && Eventually([this] { return Arrived() == CROWD; });
            return oxxHttpServer::AuthenticateUser(user, check);
        }
        std::atomic<int> checks{0};
        std::atomic<bool> overlapped{true};

    private:
        std::size_t Arrived() {
            const std::scoped_lock lock(m_lock);
            return m_arrived.size();
        }
        MMutex m_lock;
        std::set<std::thread::id> m_arrived;
    };
    auto crowded = std::make_unique<Crowded>(clock);
    Crowded& checker = *crowded;
    server = std::move(crowded);
    SetUp("", "");
    std::vector<std::jthread> crowd;
    std::atomic<int> asked{0}, locked{0};
    for (int i = 0; i < CROWD; ++i)
        crowd.emplace_back([&] {
            const std::string answer = Ask("/images/x.gif", "bob:wrong");
            asked += answer == "401 realm";
            locked += answer == "403 locked out";
        });
    crowd.clear();
    EXPECT_TRUE(checker.overlapped);
    EXPECT_EQ(asked, 3);
    EXPECT_EQ(locked, CROWD - 3);
    EXPECT_EQ(checker.checks, 4);
}

TEST_F(Routing, ForbiddenProfileLine) {
    ForgetMessages();
    EXPECT_EQ(Ask("/reports/a%0ab/x.htm", "alice:wonder"), "403");
    EXPECT_EQ(LastMessage(), "User alice requested a forbidden profile: a\\x0ab");
}

TEST_F(Routing, ScriptLine) {
    Ask("/top.pl");
    char id[16];
    std::snprintf(id, sizeof id, "0x%X", MThread::CurrentId());
    EXPECT_EQ(LastMessage(), "Script [" + dir.File("wwwroot/top.pl") + "] requested on session thread " + id + ".");
}

TEST_F(Routing, NamesInParametersStayOneArgument) {
    dir.Write("oxm_oxx/datfiles/users/odd.usr",
              "[UserInfo]\nusername=b s&permissions=1=%+\x7f\nPlaintextPassword=x\npermissions=6\n");
    SetUp("", "");
    EXPECT_EQ(Ask("/t/x.pl", "b s&permissions=1=%+\x7f:x"),
              "script /wwwroot/t/x.pl username=b%20s%26permissions%3D1%3D%25%2B%7F&permissions=6");
}

TEST_F(Routing, ChangedPasswordPermissionsAndDeletionCountWithTheNextRequest) {
    oxUserBase& users = oxxHttpServer::m_oxxUserBase;
    EXPECT_EQ(Ask("/reports/support/x.htm", "admin:root"), "file R:support/x.htm");
    ASSERT_TRUE(users.SetPermissions("admin", 2));
    EXPECT_EQ(Ask("/reports/none/x.htm", "admin:root"), "403");
    EXPECT_EQ(Ask("/t/x.pl", "admin:root"), "script /wwwroot/t/x.pl username=admin&permissions=2");
    ASSERT_TRUE(users.SetPassword("admin", "new"));
    EXPECT_EQ(Ask("/t/x.pl", "admin:root"), "401 realm");
    EXPECT_EQ(Ask("/t/x.pl", "admin:new"), "script /wwwroot/t/x.pl username=admin&permissions=2");
    ASSERT_TRUE(users.DeleteUser("admin"));
    EXPECT_EQ(Ask("/t/x.pl", "admin:new"), "401 realm");
}
