#include "http/timeoutdaemon.h"

#include <cerrno>
#include <chrono>
#include <thread>

#include "http/authenticatedfixture.h"
#include "http/support_threads.h"

namespace {

class oxHttpTimeoutDaemonTest : public AuthenticatedFixture {
protected:
    ~oxHttpTimeoutDaemonTest() override { daemon.StopTimeoutDaemon(); }
    void Expire() { clock.Advance(oxUser::m_nTimeout + 1); }

    oxHttpTimeoutDaemon daemon;
};

}  // namespace

TEST_F(oxHttpTimeoutDaemonTest, PeriodIsInMilliseconds) {
    static const struct {
        std::uint32_t seconds;
        std::uint32_t milliseconds;
    } CASES[] = {{1, 1000}, {300, 300000}, {15, 15000}, {4294967, 4294967000}, {4294968, 4294967000}};
    EXPECT_EQ(daemon.Period(), 0u);
    for (const auto& c : CASES) {
        ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, c.seconds));
        EXPECT_EQ(daemon.Period(), c.milliseconds) << c.seconds;
    }
}

TEST_F(oxHttpTimeoutDaemonTest, SleepsWhileNobodyIsLoggedIn) {
    ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 0));
    ASSERT_TRUE(WaitUntilIdle());
    EXPECT_TRUE(daemon.IsRunning());
    daemon.StopTimeoutDaemon();
    EXPECT_FALSE(daemon.IsRunning());
}

TEST_F(oxHttpTimeoutDaemonTest, DropsIdleUsersAndSleepsAgain) {
    ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 0));
    for (int round = 0; round < 3; ++round) {
        ASSERT_TRUE(WaitUntilIdle());
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        ASSERT_TRUE(Eventually([this] { return !server->IsTimeoutThreadIdle(); })) << "the login wakes it";
        EXPECT_EQ(server->UserCount(), 1u);
        Expire();
        ASSERT_TRUE(Eventually([this] { return server->UserCount() == 0; }));
    }
    EXPECT_TRUE(WaitUntilIdle());
}

TEST_F(oxHttpTimeoutDaemonTest, PausesForThePeriodBetweenSweeps) {
    const auto start = std::chrono::steady_clock::now();
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    Expire();
    ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 1));
    ASSERT_TRUE(Eventually([this] { return server->UserCount() == 0; }));
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1000));
}

TEST_F(oxHttpTimeoutDaemonTest, StopEndsALongPauseAtOnce) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 300));
    ASSERT_TRUE(Eventually([this] { return !server->IsTimeoutThreadIdle(); }));
    const auto start = std::chrono::steady_clock::now();
    daemon.StopTimeoutDaemon();
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
    EXPECT_EQ(server->UserCount(), 1u) << "a pause that was cut short sweeps nothing";
}

TEST_F(oxHttpTimeoutDaemonTest, MayBeStoppedTwiceAndStartedAgain) {
    daemon.StopTimeoutDaemon();
    for (int i = 0; i < 100; ++i) {
        ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 300));
        if (i % 3 != 0)
            daemon.StopTimeoutDaemon();
        if (i % 3 == 1)
            daemon.StopTimeoutDaemon();
    }
    ASSERT_TRUE(daemon.IsRunning()) << "the last start found it running, and began anew";
}

TEST_F(oxHttpTimeoutDaemonTest, ThreadThatCannotBeStartedIsReported) {
    FailingThreads failing(EAGAIN);
    EXPECT_FALSE(daemon.StartTimeoutDaemon(*server, 300));
    EXPECT_EQ(Count("Unable to to create timeout daemon thread - thread error = 11."), 1);
    daemon.StopTimeoutDaemon();
    failing.End();
    EXPECT_TRUE(daemon.StartTimeoutDaemon(*server, 300));
}

// A login that comes at the very moment when the thread finds nobody must not be slept over.
TEST_F(oxHttpTimeoutDaemonTest, NoLoginIsSleptOver) {
    ASSERT_TRUE(daemon.StartTimeoutDaemon(*server, 0));
    for (int i = 0; i < 500; ++i) {
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        Expire();
        ASSERT_TRUE(Eventually([this] { return server->UserCount() == 0; })) << i;
    }
}
