#include "http/httpdaemon.h"

#include <fcntl.h>
#include <netinet/tcp.h>
#include <sys/syscall.h>

#include <cerrno>
#include <cstring>
#include <list>
#include <new>
#include <thread>

#include "http/serverfixture.h"
#include "http/support_threads.h"
#include "testing/injected.h"

namespace {

using oxHttpDaemonTest = ServerFixture;

TEST_F(oxHttpDaemonTest, PortZeroLetsTheSystemChoose) {
    settings.port = 0;
    server->Configure(settings);
    ASSERT_TRUE(server->StartDaemon("127.0.0.1"));
    const std::uint16_t port = server->GetListenAddress().Port();
    EXPECT_NE(port, 0);
    EXPECT_NE(Ask(port, "GET / HTTP/1.0\r\n\r\n").find("home"), std::string::npos);
}

TEST_F(oxHttpDaemonTest, ConnectionsAreTakenAsSoonAsTheStartReturns) {
    server->Configure(settings);
    for (int i = 0; i < 200; ++i) {
        ASSERT_TRUE(server->Start());
        ASSERT_TRUE(Client(settings.port).Connected()) << i;
        server->Stop();
    }
}

TEST_F(oxHttpDaemonTest, CreateFailureIsSaid) {
    const Injected failing(
        oxSocket::m_lpfnsocket, +[](int, int, int) {
            errno = EMFILE;
            return -1;
        });
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetDaemonState(), -2);
    EXPECT_EQ(Count("Socket create failed: Too many open files (24)"), 1);
    EXPECT_EQ(Count("Server unable to start. (error=24)"), 1);
}

TEST_F(oxHttpDaemonTest, OptionsAreSetAndTheirFailureIsIgnored) {
    struct Call {
        int level;
        int name;
        std::vector<int> value;
        bool operator==(const Call&) const = default;
    };
    static std::vector<Call> calls;
    calls.clear();
    const Injected failing(
        oxSocket::m_lpfnsetsockopt, +[](int, int level, int name, const void* value, socklen_t length) {
            Call call{level, name, std::vector<int>(length / sizeof(int))};
            std::memcpy(call.value.data(), value, call.value.size() * sizeof(int));
            calls.push_back(std::move(call));
            errno = ENOPROTOOPT;
            return -1;
        });
    ASSERT_TRUE(Start());
    const std::vector<Call> expected = {{IPPROTO_TCP, TCP_NODELAY, {1}},
                                        {SOL_SOCKET, SO_REUSEADDR, {1}},
                                        {SOL_SOCKET, SO_KEEPALIVE, {1}},
                                        {SOL_SOCKET, SO_LINGER, {1, 30}}};
    ASSERT_GE(calls.size(), expected.size());
    EXPECT_EQ(std::vector<Call>(calls.begin(), calls.begin() + 4), expected);
    server->Stop();
}

TEST_F(oxHttpDaemonTest, BindIsTriedOnce) {
    static int calls;
    static socklen_t size;
    calls = 0;
    const Injected failing(
        oxSocket::m_lpfnbind, +[](int, const sockaddr*, socklen_t length) {
            ++calls;
            size = length;
            errno = EADDRINUSE;
            return -1;
        });
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetStartError(), oxHttpServer::START_ADDRESS_IN_USE);
    EXPECT_EQ(calls, 1);
    EXPECT_EQ(size, 16u);
}

TEST_F(oxHttpDaemonTest, QueueHolds128Connections) {
    static std::atomic<int> calls;
    static std::atomic<int> others;
    calls = others = 0;
    const Injected counting(
        oxSocket::m_lpfnlisten, +[](int descriptor, int backlog) {
            ++calls;
            others += backlog != 128;
            return listen(descriptor, backlog);
        });
    ASSERT_TRUE(Start());
    ASSERT_TRUE(WaitForMessage("HttpDaemon thread: waiting on 128 connections."));
    server->Stop();
    EXPECT_GT(calls, 0);
    EXPECT_EQ(others, 0);
}

TEST_F(oxHttpDaemonTest, StateTellsHowTheLastRunEnded) {
    {
        const Injected failing(
            oxSocket::m_lpfnbind, +[](int, const sockaddr*, socklen_t) {
                errno = EACCES;
                return -1;
            });
        EXPECT_FALSE(Start());
    }
    EXPECT_EQ(server->GetDaemonState(), -2);
    ASSERT_TRUE(server->Start());
    server->Stop();
    EXPECT_EQ(server->GetDaemonState(), -1);
}

TEST_F(oxHttpDaemonTest, FailingListenEndsTheThreadOnErrorAndCanBeStartedAgain) {
    {
        const Injected failing(
            oxSocket::m_lpfnlisten, +[](int, int) {
                errno = EADDRINUSE;
                return -1;
            });
        ASSERT_TRUE(Start());
        ASSERT_TRUE(WaitForMessage(" exiting."));
    }
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_ERROR);
    EXPECT_EQ(server->GetDaemonState(), -2);
    const auto lines = Messages();
    ASSERT_EQ(lines.size(), 8u);
    EXPECT_EQ(lines[4], "listen failed");
    EXPECT_EQ(lines[5], "Server log closed.");
    EXPECT_EQ(lines[6], "Daemon thread exiting on error.");
    EXPECT_EQ(lines[7], "session thread 0x" + lines[3].substr(37) + " exiting.");
    ASSERT_TRUE(server->Start());
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_RUNNING);
    Poke();
}

TEST_F(oxHttpDaemonTest, FirstSessionThatCannotBeMadeEndsTheThread) {
    server->onMakeSession = [] { throw std::bad_alloc(); };
    ASSERT_TRUE(Start());
    ASSERT_TRUE(WaitForMessage("Daemon thread exiting on error."));
    EXPECT_EQ(Count("1st session allocation failed"), 1);
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_ERROR);
}

TEST_F(oxHttpDaemonTest, LaterSessionThatCannotBeMadeEndsTheThreadButNotTheConnection) {
    std::atomic<int> made{0};
    server->onMakeSession = [&] {
        if (++made > 1)
            throw std::bad_alloc();
    };
    ASSERT_TRUE(Start());
    EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("home"), std::string::npos);
    ASSERT_TRUE(WaitForMessage("Daemon thread exiting on error."));
    const auto lines = Messages();
    EXPECT_EQ(std::count(lines.begin(), lines.end(), "session allocation failed"), 1);
}

TEST_F(oxHttpDaemonTest, ConnectionsAreTraced) {
    ASSERT_TRUE(Start());
    Poke();
    ASSERT_TRUE(WaitForMessage("accepting connection:", 2));
    const auto lines = Messages();
    const auto connected = std::find(lines.begin(), lines.end(), "HttpDaemon thread: connected to 127.0.0.1.");
    ASSERT_NE(connected, lines.end());
    EXPECT_EQ((connected + 1)->rfind("Adding user session 0x", 0), 0u);
}

TEST_F(oxHttpDaemonTest, FailingAcceptsAreReportedOnceASecondAndServiceReturns) {
    static std::atomic<int> failures;
    static std::atomic<bool> exhausted;
    failures = 0;
    exhausted = true;
    const Injected failing(
        oxSocket::m_lpfnaccept, +[](int descriptor, sockaddr* address, socklen_t* length) {
            if (!exhausted)
                return accept4(descriptor, address, length, SOCK_CLOEXEC);
            ++failures;
            errno = EMFILE;
            return -1;
        });
    ASSERT_TRUE(Start());
    Client waiting(settings.port);
    waiting.Send("GET / HTTP/1.0\r\n\r\n");
    ASSERT_TRUE(WaitForMessage("Socket::Accept error: Too many open files (24).", 2));
    EXPECT_LT(failures, 3 * 12);  // three tries a round, rounds 100 ms apart and more
    exhausted = false;
    EXPECT_NE(waiting.ReadAll().find("home"), std::string::npos);
    server->Stop();
}

TEST_F(oxHttpDaemonTest, ClientThatLeavesBeforeItIsAcceptedLeavesNoLine) {
    static std::atomic<int> aborted;
    aborted = 0;
    const Injected failing(
        oxSocket::m_lpfnaccept, +[](int descriptor, sockaddr* address, socklen_t* length) {
            if (aborted++ % 2 == 0) {
                errno = ECONNABORTED;
                return -1;
            }
            return accept4(descriptor, address, length, SOCK_CLOEXEC);
        });
    ASSERT_TRUE(Start());
    Poke();
    Poke();
    EXPECT_EQ(Count("Accept error"), 0);
    server->Stop();
}

TEST_F(oxHttpDaemonTest, AcceptedConnectionsAreCloseOnExec) {
    ASSERT_TRUE(Start());
    std::atomic<int> guarded{0};
    std::atomic<int> unguarded{0};
    server->onRequest = [&](const oxRequest&) {
        for (int descriptor = 3; descriptor < 200; ++descriptor) {
            struct sockaddr_in peer {};
            socklen_t length = sizeof peer;
            if (getpeername(descriptor, reinterpret_cast<sockaddr*>(&peer), &length) == 0 &&
                ntohs(peer.sin_port) != settings.port)
                ++((fcntl(descriptor, F_GETFD) & FD_CLOEXEC) != 0 ? guarded : unguarded);
        }
        return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
    };
    EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("404"), std::string::npos);
    EXPECT_EQ(guarded, 1);
    EXPECT_EQ(unguarded, 0);
}

TEST_F(oxHttpDaemonTest, StopRightAfterTheStartLeavesNoErrorLine) {
    server->Configure(settings);
    for (int i = 0; i < 300; ++i) {
        ASSERT_TRUE(server->Start());
        server->Stop();
    }
    EXPECT_EQ(Count("failed"), 0);
    EXPECT_EQ(Count("rror"), 0);
}

TEST_F(oxHttpDaemonTest, StartRightAfterAnErrorEndSucceeds) {
    static std::atomic<bool> broken;
    const Injected failing(
        oxSocket::m_lpfnlisten, +[](int descriptor, int backlog) {
            if (!broken)
                return listen(descriptor, backlog);
            errno = EADDRINUSE;
            return -1;
        });
    for (int i = 0; i < 100; ++i) {
        broken = true;
        ASSERT_TRUE(Start());
        ASSERT_TRUE(Eventually([&] { return server->GetState() == oxHttpServer::STATE_ERROR; }));
        broken = false;
        server->Stop();
        ASSERT_TRUE(server->Start()) << i;
        EXPECT_EQ(server->GetState(), oxHttpServer::STATE_RUNNING);
        Poke();
        server->Stop();
    }
    EXPECT_EQ(Count("Unable to create daemon thread"), 0);
}

TEST_F(oxHttpDaemonTest, FullDescriptorTableWithNobodyWaitingIsNoError) {
    static std::atomic<int> calls;
    calls = 0;
    const Injected failing(
        oxSocket::m_lpfnaccept, +[](int, sockaddr*, socklen_t*) {
            ++calls;
            errno = EMFILE;
            return -1;
        });
    ASSERT_TRUE(Start());
    ASSERT_TRUE(Eventually([] { return calls >= 3; }));
    server->Stop();
    EXPECT_LE(calls, 6);  // one round, and one more where the stop came in its middle
    EXPECT_EQ(Count("Accept error"), 0);
}

TEST_F(oxHttpDaemonTest, AlternatingFailuresAreReportedOnceASecond) {
    static std::atomic<int> calls;
    calls = 0;
    const Injected failing(
        oxSocket::m_lpfnaccept, +[](int descriptor, sockaddr* address, socklen_t* length) {
            // Two rounds of three tries fail, of which one may come before there is a connection, which is no error.
            if (++calls % 7 == 0)
                return accept4(descriptor, address, length, SOCK_CLOEXEC);
            errno = ENFILE;
            return -1;
        });
    ASSERT_TRUE(Start());
    const auto begin = std::chrono::steady_clock::now();
    for (int i = 0; i < 8; ++i)
        Poke();
    const auto seconds = std::chrono::ceil<std::chrono::seconds>(std::chrono::steady_clock::now() - begin).count();
    server->Stop();
    EXPECT_GE(Count("Socket::Accept error: Too many open files in system (23)."), 1);
    EXPECT_LE(Count("Socket::Accept error"), seconds + 1);
}

TEST_F(oxHttpDaemonTest, StopDuringTheAcceptPauseIsPromptAndSilent) {
    static std::atomic<int> calls;
    calls = 0;
    const Injected failing(
        oxSocket::m_lpfnaccept, +[](int, sockaddr*, socklen_t*) {
            ++calls;
            errno = ENOMEM;
            return -1;
        });
    ASSERT_TRUE(Start());
    const Client waiting(settings.port);
    ASSERT_TRUE(Eventually([] { return calls >= 12; }));  // the pause is near its longest
    const int lines = Count("Accept error");
    server->Stop();
    EXPECT_EQ(Count("Daemon thread exiting normally."), 1);
    EXPECT_LE(Count("Accept error"), lines + 1);
    EXPECT_EQ(Count("Success"), 0);
}

TEST_F(oxHttpDaemonTest, ListenerThreadThatCannotBeStartedFailsTheStart) {
    FailingThreads failing(EAGAIN);
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetDaemonState(), -2);
    EXPECT_EQ(Count("Unable to create daemon thread, thread error = 11"), 1);
    EXPECT_EQ(Count("Server unable to start. (error=11)"), 1);
    failing.End();
    EXPECT_TRUE(server->Start());
}

TEST_F(oxHttpDaemonTest, SessionThreadThatCannotBeStartedClosesTheConnectionAndTheLoopGoesOn) {
    ASSERT_TRUE(Start());
    {
        const FailingThreads failing(EAGAIN);
        std::list<Client> clients;  // threads that earlier sessions left behind serve the first few
        ASSERT_TRUE(Eventually([&] {
            clients.emplace_back(settings.port);
            return Count("Unable to create session thread") > 0;
        }));
        EXPECT_EQ(clients.back().ReadAll(), "");
    }
    EXPECT_EQ(Count("Unable to create session thread, thread error = 11"), 1);
    EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("home"), std::string::npos);
}

TEST_F(oxHttpDaemonTest, RootIsGivenBackExceptWhereTheSocketCannotBeCreated) {
    if (getuid() != 0)
        GTEST_SKIP() << "needs root";
#ifdef SYS_setresuid32
    constexpr long SET_IDS = SYS_setresuid32;
#else
    constexpr long SET_IDS = SYS_setresuid;
#endif
    server->Configure(settings);
    struct Case {
        bool create;
        uid_t after;
    };
    for (const Case& c : {Case{true, 0}, {false, 1}}) {
        uid_t during = 99;
        uid_t after = 99;
        static uid_t seen;
        std::thread([&] {  // the ids of one thread; they end with it
            ASSERT_EQ(syscall(SET_IDS, -1, 1, -1), 0);
            if (c.create) {
                const Injected failing(
                    oxSocket::m_lpfnsocket, +[](int, int, int) {
                        seen = geteuid();
                        errno = EMFILE;
                        return -1;
                    });
                EXPECT_FALSE(server->StartDaemon("127.0.0.1"));
            } else {
                const Injected failing(
                    oxSocket::m_lpfnbind, +[](int, const sockaddr*, socklen_t) {
                        seen = geteuid();
                        errno = EACCES;
                        return -1;
                    });
                EXPECT_FALSE(server->StartDaemon("127.0.0.1"));
            }
            during = seen;
            after = geteuid();
        })
            .join();
        EXPECT_EQ(during, 0u);
        EXPECT_EQ(after, c.after);
    }
    EXPECT_EQ(geteuid(), 0u);
}

}  // namespace
