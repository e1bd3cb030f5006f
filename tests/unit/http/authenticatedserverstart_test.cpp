// Starting and stopping the server and its time-out thread.
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <optional>
#include <thread>
#include <vector>

#include "http/authenticatedfixture.h"
#include "http/support_threads.h"
#include "platform/identitycalls.h"

namespace {

class AuthenticatedServerStart : public AuthenticatedFixture {};
using Checks = std::pair<int, int>;

constexpr const char* ROOT_LINE = "O/S authentication requires starting the program with root access.";

// Runs the body on a thread of its own that cannot become root, whoever runs the tests.
void WithoutRoot(const std::function<void()>& body) {
    std::thread([&] {
        constexpr uid_t NOBODY = 65534;
        ASSERT_TRUE(geteuid() != 0 || syscall(SET_USERS_CALL, NOBODY, NOBODY, NOBODY) == 0);
        body();
    }).join();
}

class WorkIn {
public:
    explicit WorkIn(const std::string& directory) : m_before(std::filesystem::current_path()) {
        std::filesystem::current_path(directory);
        oxAuditFile::SetDefaultPath(".");
    }
    ~WorkIn() {
        std::filesystem::current_path(m_before);
        oxAuditFile::SetDefaultPath(".");
    }
    WorkIn(const WorkIn&) = delete;
    WorkIn& operator=(const WorkIn&) = delete;

private:
    std::filesystem::path m_before;
};

// Starts the listener's thread but none after it.
class FailingAfterStart : public TestAuthenticatedServer {
public:
    using TestAuthenticatedServer::TestAuthenticatedServer;
    bool Start() override {
        const bool started = TestAuthenticatedServer::Start();
        m_failing.emplace(EAGAIN);
        if (onStarted)
            onStarted();
        return started;
    }
    std::function<void()> onStarted;

private:
    std::optional<FailingThreads> m_failing;
};

}  // namespace

TEST_F(AuthenticatedServerStart, StartsTheServerAndItsTimeoutThread) {
    settings.sessionTimeout = 1234;
    server->Configure(settings);
    EXPECT_TRUE(server->IsTimeoutThreadIdle());
    ASSERT_TRUE(server->StartAuthenticated(false));
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_RUNNING);
    EXPECT_EQ(oxUser::m_nTimeout, 1234);
    EXPECT_TRUE(server->StartAuthenticated(false)) << "it runs already";
    EXPECT_EQ(Count("Starting server:"), 1);
    EXPECT_EQ(Count("Server already started."), 0);
    EXPECT_NE(Ask(settings.port, "GET /none HTTP/1.0\r\n\r\n").find("404"), std::string::npos);
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_TRUE(Eventually([this] { return !server->IsTimeoutThreadIdle(); }));
    server->Stop();
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
    EXPECT_TRUE(server->IsTimeoutThreadIdle());
    EXPECT_EQ(server->UserCount(), 0u) << "a stop forgets the logins";
}

TEST_F(AuthenticatedServerStart, IdleUserIsDroppedWhileTheServerRuns) {
    settings.sessionTimeout = 2;
    server->Configure(settings);
    ASSERT_TRUE(server->StartAuthenticated(false));
    for (int i = 1; i <= 2; ++i) {
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        EXPECT_EQ(server->Checks(), Checks(i, 0));
        clock.Advance(3);
        ASSERT_TRUE(Eventually([this] { return server->UserCount() == 0; }));
        ASSERT_TRUE(WaitUntilIdle());
    }
}

TEST_F(AuthenticatedServerStart, SweepsEveryHalfTimeout) {
    static const struct {
        const char* userTimeout;  // seconds
        std::uint32_t period;     // milliseconds
    } CASES[] = {{"600", 300000}, {"77", 38000}, {"30", 15000}, {"10", 15000}};
    EXPECT_EQ(server->SweepPeriod(), 0u);
    for (const auto& c : CASES) {
        oxConfig config;
        ASSERT_TRUE(config.OpenText(std::string("[S]\nWebUserTimeout=") + c.userTimeout + "\n"));
        settings.sessionTimeout = oxHttpSettings::Read(config, "S", dir.Path(), dir.Path(), 1).sessionTimeout;
        server->Configure(settings);
        ASSERT_TRUE(server->StartAuthenticated(false));
        EXPECT_EQ(server->SweepPeriod(), c.period) << c.userTimeout;
        server->Stop();
    }
}

TEST_F(AuthenticatedServerStart, MayBeStoppedAndStartedAgain) {
    for (int i = 1; i <= 20; ++i) {
        ASSERT_TRUE(server->StartAuthenticated(false)) << i;
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        EXPECT_EQ(server->Checks(), Checks(i, 0));
        server->Stop();
        EXPECT_EQ(server->UserCount(), 0u);
    }
}

TEST_F(AuthenticatedServerStart, LoginFromBeforeAStopIsNotRemembered) {
    ASSERT_TRUE(server->StartAuthenticated(false));
    Gate gate;
    server->onCheck = [&](oxUser&, Check) {
        gate.Pass();
        return true;
    };
    std::thread slow([&] {
        std::uint32_t permissions = 0;
        EXPECT_TRUE(server->AuthenticateRequest(Credentials("alice", "ecila"), permissions));
    });
    gate.WaitUntilReached();
    server->Stop();
    ASSERT_TRUE(server->StartAuthenticated(false));
    gate.Open();
    slow.join();
    EXPECT_EQ(server->UserCount(), 0u);
}

// A session that outlives the stop may log in before the next start.
TEST_F(AuthenticatedServerStart, LoginFromBetweenAStopAndAStartIsNotRemembered) {
    ASSERT_TRUE(server->StartAuthenticated(false));
    server->Stop();
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ASSERT_EQ(server->UserCount(), 1u);
    ASSERT_TRUE(server->StartAuthenticated(false));
    EXPECT_EQ(server->UserCount(), 0u);
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(2, 0)) << "checked in full by the rules of the start";
}

TEST_F(AuthenticatedServerStart, CheckThatBeganBetweenAStopAndAStartIsNotRemembered) {
    Gate gate;
    server->onCheck = [&](oxUser&, Check) {
        gate.Pass();
        return true;
    };
    std::thread slow([&] {
        std::uint32_t permissions = 0;
        EXPECT_TRUE(server->AuthenticateRequest(Credentials("alice", "ecila"), permissions));
    });
    gate.WaitUntilReached();
    EXPECT_TRUE(server->StartAuthenticated(false));
    gate.Open();
    slow.join();
    EXPECT_EQ(server->UserCount(), 0u);
}

TEST_F(AuthenticatedServerStart, ListenerThatEndsOnAnErrorMayBeStartedAgain) {
    for (int i = 0; i < 3; ++i) {
        ASSERT_TRUE(server->StartAuthenticated(false));
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        server->Terminate();
        EXPECT_EQ(server->GetState(), oxHttpServer::STATE_ERROR);
        EXPECT_EQ(server->UserCount(), 0u);
        EXPECT_TRUE(server->IsTimeoutThreadIdle());
        server->StopDaemon();
    }
}

TEST_F(AuthenticatedServerStart, FailedStartEndsWithIt) {
    settings.port = 0;
    server->Configure(settings);
    EXPECT_FALSE(server->StartAuthenticated(false));
    EXPECT_EQ(server->GetStartError(), oxHttpServer::START_NO_ADDRESS);
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
}

TEST_F(AuthenticatedServerStart, NothingIsLeftStartedWithoutTheTimeoutThread) {
    FailingAfterStart failing(clock);
    failing.Configure(settings);
    EXPECT_FALSE(failing.StartAuthenticated(false));
    EXPECT_EQ(Count("Unable to to create timeout daemon thread - thread error = 11."), 1);
    EXPECT_EQ(failing.GetState(), oxHttpServer::STATE_STOPPED);
}

TEST_F(AuthenticatedServerStart, ListenerThatEndsAtOnceNeedsNoTimeoutThread) {
    FailingAfterStart failing(clock);
    failing.onStarted = [&] { failing.Terminate(); };
    failing.Configure(settings);
    EXPECT_TRUE(failing.StartAuthenticated(false));
    EXPECT_EQ(Count("Unable to to create timeout daemon thread"), 0) << "none was tried";
    EXPECT_EQ(failing.GetState(), oxHttpServer::STATE_ERROR);
    failing.StopDaemon();  // the listener has only been said to have ended
}

// In the log of the default name whatever the settings name.
TEST_F(AuthenticatedServerStart, OSAuthenticationWithoutRootIsSaidInTheDefaultErrorLog) {
    ASSERT_EQ(chmod(dir.Path().c_str(), 0777), 0);
    const WorkIn work(dir.Path());
    TestAuthenticatedServer unconfigured(clock);
    for (TestAuthenticatedServer* one : {&unconfigured, server.get()}) {
        dir.Write("errors", "");
        WithoutRoot([&] { EXPECT_FALSE(one->StartAuthenticated(true)); });
        const auto lines = dir.Lines("ox_remote.err");
        ASSERT_EQ(lines.size(), 1u);
        EXPECT_EQ(lines[0].find(": O/S"), 20u);
        EXPECT_EQ(lines[0].substr(lines[0].find(": ") + 2), ROOT_LINE);
        EXPECT_EQ(dir.Read("errors"), "");
        EXPECT_FALSE(one->MessageLog().IsOpen()) << "until the next settings";
        EXPECT_EQ(one->GetState(), oxHttpServer::STATE_STOPPED);
        std::filesystem::remove(dir.File("ox_remote.err"));
    }
    server->Configure(settings);
    EXPECT_TRUE(server->MessageLog().IsOpen());
}

TEST_F(AuthenticatedServerStart, WithoutErrorLoggingTheMissingRootIsSilent) {
    ASSERT_EQ(chmod(dir.Path().c_str(), 0777), 0);
    const WorkIn work(dir.Path());
    settings.logErrors = false;
    server->Configure(settings);
    WithoutRoot([this] { EXPECT_FALSE(server->StartAuthenticated(true)); });
    EXPECT_EQ(Count(ROOT_LINE), 0);
    EXPECT_FALSE(std::filesystem::exists(dir.File("ox_remote.err")));
}

TEST_F(AuthenticatedServerStart, OSAuthenticationStartsWithRoot) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root";
    // As a daemon that gave root up for its effective user only.
    std::thread([this] {
        constexpr uid_t DAEMON = 1;
        ASSERT_EQ(chmod(dir.Path().c_str(), 0777), 0);
        ASSERT_EQ(syscall(SET_USERS_CALL, UNCHANGED_USER, DAEMON, UNCHANGED_USER), 0);
        EXPECT_TRUE(server->StartAuthenticated(true));
        EXPECT_EQ(geteuid(), DAEMON) << "only tried";
        server->Stop();
    }).join();
    EXPECT_EQ(Count(ROOT_LINE), 0);
}

TEST_F(AuthenticatedServerStart, IsDestroyedWhileUsersAreLoggedIn) {
    ASSERT_TRUE(server->StartAuthenticated(false));
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ASSERT_TRUE(Eventually([this] { return !server->IsTimeoutThreadIdle(); }));
    server.reset();
    EXPECT_EQ(Count("Server stopping..."), 1);
}

// Starts and stops while sessions log in and the listener reports its own end.
TEST_F(AuthenticatedServerStart, StartsAndStopsBesideLogins) {
    std::atomic<bool> done{false};
    std::vector<std::thread> threads;
    for (int t = 0; t < 2; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; !done; ++i) {
                std::uint32_t permissions = 0;
                const std::string name = "user" + std::to_string(t) + std::to_string(i % 50);
                server->AuthenticateRequest(Credentials(name, std::string(name.rbegin(), name.rend())), permissions);
            }
        });
    }
    for (int i = 0; i < 30; ++i) {
        ASSERT_TRUE(server->StartAuthenticated(false));
        if (i % 2 == 0)
            server->Terminate();
        server->StopDaemon();
        server->Stop();
    }
    done = true;
    for (auto& thread : threads)
        thread.join();
}
