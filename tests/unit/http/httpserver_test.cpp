#include "http/httpserver.h"

#include <algorithm>
#include <cerrno>
#include <regex>
#include <thread>

#include "http/serverfixture.h"

namespace {

using oxHttpServerTest = ServerFixture;

TEST_F(oxHttpServerTest, IsConstructedStopped) {
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
    EXPECT_EQ(server->AccessLog(), nullptr);
}

TEST_F(oxHttpServerTest, StartAndStopWriteTheirLines) {
    ASSERT_TRUE(Start());
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_RUNNING);
    EXPECT_EQ(server->GetListenPort(), settings.port);
    ASSERT_TRUE(WaitForMessage("accepting connection:"));
    server->Stop();
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
    const auto lines = Messages();
    const std::string port = std::to_string(settings.port);
    ASSERT_EQ(lines.size(), 10u);
    EXPECT_EQ(lines[0], "Debug level is now 9.");
    EXPECT_EQ(lines[1], "Logging server activity to " + dir.File("ox_remote.log") + ".");
    EXPECT_EQ(lines[2], "Starting server: connecting to 127.0.0.1 on port " + port + ".");
    EXPECT_EQ(lines[3].rfind("Daemon thread started. Thread id = 0x", 0), 0u);
    EXPECT_EQ(lines[4], "HttpDaemon thread: waiting on 128 connections.");
    EXPECT_EQ(lines[5], "HttpDaemon thread: accepting connection:");
    EXPECT_EQ(lines[6], "Server stopping...");
    EXPECT_EQ(lines[7], "Daemon thread exiting normally.");
    EXPECT_EQ(lines[8], "session thread 0x" + lines[3].substr(37) + " exiting.");
    EXPECT_EQ(lines[9], "Server log closed.");
}

TEST_F(oxHttpServerTest, EveryAddressIsCalledLocalHost) {
    settings.webAddress = "";
    ASSERT_TRUE(Start());
    EXPECT_EQ(Count("Starting server: connecting to local host on port " + std::to_string(settings.port) + "."), 1);
}

TEST_F(oxHttpServerTest, SecondStartIsAnsweredWithALine) {
    ASSERT_TRUE(Start());
    EXPECT_TRUE(server->Start());
    EXPECT_EQ(Count("Server already started."), 1);
}

TEST_F(oxHttpServerTest, WithoutAPortNothingStarts) {
    settings.port = 0;
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetStartError(), oxHttpServer::START_NO_ADDRESS);
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
    EXPECT_EQ(Count("Server unable to start - an address or port was not specified."), 1);
    EXPECT_EQ(dir.Read("ox_remote.log"), "");
}

TEST_F(oxHttpServerTest, PortInUseIsSaidInOrder) {
    oxSocket other;
    ASSERT_TRUE(other.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.1", 0));
    ASSERT_TRUE(other.Listen(1));
    settings.port = other.GetLocalAddress().Port();
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetStartError(), oxHttpServer::START_ADDRESS_IN_USE);
    EXPECT_EQ(server->GetLastStartError(), EADDRINUSE);
    EXPECT_EQ(server->GetState(), oxHttpServer::STATE_STOPPED);
    const auto lines = Messages();
    const std::string port = std::to_string(settings.port);
    ASSERT_EQ(lines.size(), 6u);
    EXPECT_EQ(lines[2], "Starting server: connecting to 127.0.0.1 on port " + port + ".");
    EXPECT_EQ(lines[3], "Socket bind failed: Address already in use (98)");
    EXPECT_EQ(lines[4], "Server log closed.");
    EXPECT_EQ(lines[5], "Server unable to start - the specified address or port (" + port + ") is already in use.");
}

TEST_F(oxHttpServerTest, OtherStartFailureGivesItsNumberAndCanBeRepeated) {
    settings.webAddress = "192.0.2.1";  // no address of this machine
    EXPECT_FALSE(Start());
    EXPECT_EQ(server->GetStartError(), oxHttpServer::START_GOOD);
    EXPECT_EQ(server->GetLastStartError(), EADDRNOTAVAIL);
    EXPECT_EQ(Count("Socket bind failed: Cannot assign requested address (99)"), 1);
    EXPECT_EQ(Count("Server unable to start. (error=99)"), 1);
    settings.webAddress = "127.0.0.1";
    EXPECT_TRUE(Start());
}

TEST_F(oxHttpServerTest, StartErrorIsThatOfTheLastStart) {
    const std::uint32_t good = settings.port;
    oxSocket other;
    ASSERT_TRUE(other.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.1", 0));
    ASSERT_TRUE(other.Listen(1));
    struct Case {
        const char* address;
        std::uint32_t port;
        int error;
        bool started;
    };
    const std::uint32_t taken = other.GetLocalAddress().Port();
    for (const Case& c : {Case{"127.0.0.1", 0, -2, false},
                          {"127.0.0.1", good, 0, true},
                          {"127.0.0.1", taken, -1, false},
                          {"192.0.2.1", good, 0, false},
                          {"127.0.0.1", taken, -1, false},
                          {"127.0.0.1", good, 0, true}}) {
        settings.webAddress = c.address;
        settings.port = c.port;
        EXPECT_EQ(Start(), c.started) << c.address << " " << c.port;
        EXPECT_EQ(server->GetStartError(), c.error) << c.address << " " << c.port;
        server->Stop();
    }
}

TEST_F(oxHttpServerTest, AccessLogThatCannotBeOpenedDoesNotStopTheStart) {
    settings.logFileName = "none/access";
    testing::internal::CaptureStderr();
    ASSERT_TRUE(Start());
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "oxAuditFile error: No such file or directory\n");
    EXPECT_EQ(server->AccessLog(), nullptr);
    EXPECT_EQ(Count("Log file open failed: " + dir.Path() + "/none/access."), 1);
    EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("200 OK"), std::string::npos);
}

TEST_F(oxHttpServerTest, WithoutAccessLoggingNoFileIsMade) {
    for (const bool named : {true, false}) {
        settings.logging = !named;
        settings.logFileName = named ? "access" : "";
        ASSERT_TRUE(Start());
        Poke();
        server->Stop();
        EXPECT_FALSE(std::filesystem::exists(dir.File("access")));
    }
}

TEST_F(oxHttpServerTest, WithoutErrorLoggingNoMessagesAreKept) {
    settings.logErrors = false;
    ASSERT_TRUE(Start());
    Poke();
    server->Stop();
    EXPECT_FALSE(std::filesystem::exists(dir.File("errors")));
}

TEST_F(oxHttpServerTest, AnswersAreLogged) {
    ASSERT_TRUE(Start());
    EXPECT_EQ(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").substr(0, 17), "HTTP/1.0 200 OK\r\n");
    EXPECT_EQ(Ask(settings.port, "GET /none HTTP/1.0\r\n\r\n").substr(0, 24), "HTTP/1.0 404 Not Found\r\n");
    EXPECT_EQ(Ask(settings.port, "nonsense\r\n\r\n").substr(0, 26), "HTTP/1.0 400 Bad Request\r\n");
    const auto lines = dir.Lines("ox_remote.log");
    ASSERT_EQ(lines.size(), 3u);
    EXPECT_NE(lines[0].find("\"GET / HTTP/1.0\" 200 18"), std::string::npos);
    EXPECT_NE(lines[1].find("\"GET /none HTTP/1.0\" 404 0"), std::string::npos);
    EXPECT_NE(lines[2].find("\"  \" 400 0"), std::string::npos);
}

TEST_F(oxHttpServerTest, PathsThatClimbAreNotFound) {
    dir.Write("secret", "secret");
    ASSERT_TRUE(Start());
    for (const char* path : {"/../secret", "/a/../secret", "/%2e%2e/secret", "/..%2fsecret", "/a../b"})
        EXPECT_EQ(Ask(settings.port, std::string("GET ") + path + " HTTP/1.0\r\n\r\n").substr(9, 3), "404") << path;
}

TEST_F(oxHttpServerTest, FinishedSessionStaysListedUntilTheNextConnection) {
    ASSERT_TRUE(Start());
    Poke();
    ASSERT_TRUE(WaitForMessage("accepting connection:", 2));
    ASSERT_TRUE(Eventually([&] { return server->IsFinished(0); }));
    EXPECT_EQ(Count("Removing user session"), 0);
    Poke();
    ASSERT_TRUE(WaitForMessage("accepting connection:", 3));
    EXPECT_EQ(Count("Removing user session 0x"), 1);
    // The session's lines carry the listener's id.
    const auto lines = Messages();
    const std::string id = lines.at(3).substr(lines.at(3).find("0x"));
    EXPECT_EQ(Count("Adding user session " + id + "."), 2);
    EXPECT_EQ(Count("Removing user session " + id + "."), 1);
    ASSERT_TRUE(Eventually([&] { return server->IsFinished(1); }));
    server->Stop();
    EXPECT_EQ(Count("Removing user session 0x"), 2);
}

TEST_F(oxHttpServerTest, IdleConnectionIsDroppedAfterTheTimeout) {
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    Client idle(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    ASSERT_TRUE(AdvanceUntilTimedOut());
    EXPECT_EQ(idle.ReadAll(), "");
    const auto lines = Messages();
    const auto read = std::find(lines.begin(), lines.end(), "Error reading request from socket - socket timed out.");
    const auto removed = std::find_if(lines.begin(), lines.end(), [](const std::string& line) {
        return line.rfind("Session 0x", 0) == 0 && line.find(" has timed-out -- removing.") != std::string::npos;
    });
    EXPECT_LT(read, removed);
    EXPECT_LT(removed, lines.end());
    EXPECT_EQ(dir.Read("ox_remote.log"), "");
}

TEST_F(oxHttpServerTest, ConnectionIsKeptUntilTheTimeoutHasPassed) {
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    Client idle(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    clock.Advance(30);
    Poke();
    EXPECT_EQ(Count("has timed-out"), 0);
    idle.Send("GET / HTTP/1.0\r\n\r\n");
    EXPECT_NE(idle.ReadAll().find("home"), std::string::npos);
}

TEST_F(oxHttpServerTest, TimeBeforeTheConnectionDoesNotCount) {
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    ASSERT_TRUE(WaitForMessage("accepting connection:"));
    clock.Advance(31);
    Client late(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    Poke();
    EXPECT_EQ(Count("has timed-out"), 0);
    late.Send("GET / HTTP/1.0\r\n\r\n");
    EXPECT_NE(late.ReadAll().find("home"), std::string::npos);
}

TEST_F(oxHttpServerTest, TickRemovesTimedOutSessionsButNotFinishedOnes) {
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    Client idle(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    Poke();
    ASSERT_TRUE(Eventually([&] { return server->IsFinished(1); }));
    ASSERT_TRUE(AdvanceUntilTimedOut());
    EXPECT_EQ(Count("Removing user session"), 0);
}

TEST_F(oxHttpServerTest, SlowDownloadIsNotTimedOutWhileItMoves) {
    // Each step is more than the system buffers, so the session sends, and shows that it lives, within each.
    constexpr std::size_t STEP = 8 * 1024 * 1024;
    constexpr int STEPS = 6;
    dir.Write("www/big", std::string(STEP * STEPS, 'b'));
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    Client slow(settings.port, INADDR_LOOPBACK, 65536);
    slow.Send("GET /big HTTP/1.0\r\n\r\n");
    std::string got;
    for (int i = 1; i < STEPS; ++i) {
        std::string step(STEP, '\0');
        ASSERT_EQ(recv(slow.Descriptor(), step.data(), STEP, MSG_WAITALL), static_cast<ssize_t>(STEP));
        got += step;
        clock.Advance(25);
        Poke();
    }
    got += slow.ReadAll();
    EXPECT_EQ(got.size() - got.find("\r\n\r\n") - 4, STEP * STEPS);
    EXPECT_EQ(Count("has timed-out"), 0);
}

TEST_F(oxHttpServerTest, ClientThatReadsNothingIsStoppedWithoutHoldingUpOthers) {
    dir.Write("www/big", std::string(32 * 1024 * 1024, 'b'));
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    Client silent(settings.port, INADDR_LOOPBACK, 65536);
    silent.Send("GET /big HTTP/1.0\r\n\r\n");
    char first;
    ASSERT_EQ(recv(silent.Descriptor(), &first, 1, 0), 1);  // its reply is under way
    EXPECT_TRUE(Eventually([&] {
        clock.Advance(31);
        Poke();
        return Count("has timed-out -- removing.") > 0;
    }));
    EXPECT_EQ(Count("Reply error writing to socket - socket error = "), 1);
    Poke();
}

TEST_F(oxHttpServerTest, ConnectionsBeyondTheLimitAreClosedWithoutAReply) {
    settings.maxSessionsPerAddress = 2;
    ASSERT_TRUE(Start());
    Client first(settings.port);
    Client second(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session", 2));
    Client third(settings.port);
    EXPECT_EQ(third.ReadAll(), "");
    EXPECT_EQ(Count("HttpServer: connection refused from address: 127.0.0.1. Too many active connections from this "
                    "address"),
              1);
    // Another address is another count.
    first.Send("GET / HTTP/1.0\r\n\r\n");
    EXPECT_NE(first.ReadAll().find("200 OK"), std::string::npos);
    EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("200 OK"), std::string::npos);
}

TEST_F(oxHttpServerTest, LimitOfOneServesAClientThatComesBackAtOnce) {
    settings.maxSessionsPerAddress = 1;
    ASSERT_TRUE(Start());
    for (int i = 0; i < 500; ++i)
        ASSERT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("200 OK"), std::string::npos) << i;
}

TEST_F(oxHttpServerTest, NoLimitAdmitsAny) {
    for (const int limit : {0, -1}) {
        settings.maxSessionsPerAddress = limit;
        settings.port = FreePort();
        ASSERT_TRUE(Start());
        std::vector<std::unique_ptr<Client>> clients;
        for (int i = 0; i < 20; ++i)
            clients.push_back(std::make_unique<Client>(settings.port));
        EXPECT_NE(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n").find("200 OK"), std::string::npos);
        server->Stop();
    }
}

TEST_F(oxHttpServerTest, StopLetsRunningSessionsFinish) {
    ASSERT_TRUE(Start());
    Client late(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    server->Stop();
    late.Send("GET / HTTP/1.0\r\n\r\n");
    EXPECT_NE(late.ReadAll().find("home"), std::string::npos);
}

TEST_F(oxHttpServerTest, CloseEndsWhatStillRuns) {
    ASSERT_TRUE(Start());
    Client first(settings.port);
    Client second(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session", 2));
    EXPECT_TRUE(server->Close());
    EXPECT_EQ(Count("2 sessions not cleaned up on exit."), 1);
    EXPECT_EQ(Count("Removing user session"), 2);
    EXPECT_EQ(first.ReadAll(), "");
    EXPECT_EQ(second.ReadAll(), "");
    EXPECT_TRUE(server->Close());  // harmless when repeated
    EXPECT_EQ(Count("sessions not cleaned up"), 1);
}

TEST_F(oxHttpServerTest, CloseEndsASilentDownload) {
    dir.Write("www/big", std::string(32 * 1024 * 1024, 'b'));
    ASSERT_TRUE(Start());
    Client silent(settings.port);
    silent.Send("GET /big HTTP/1.0\r\n\r\n");
    char one;
    ASSERT_EQ(recv(silent.Descriptor(), &one, 1, 0), 1);
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_TRUE(server->Close());
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(5));
}

TEST_F(oxHttpServerTest, RestartTakesNewSettings) {
    ASSERT_TRUE(Start());
    server->Stop();
    settings.port = FreePort();
    settings.logFileName = "other.log";
    settings.errorLogName = dir.File("errors2");
    ASSERT_TRUE(Start());
    Poke();
    EXPECT_EQ(dir.Lines("other.log").size(), 1u);
    EXPECT_NE(dir.Read("errors2").find("Starting server:"), std::string::npos);
}

TEST_F(oxHttpServerTest, ThousandStartsAndStopsLeaveNoErrorLine) {
    ASSERT_TRUE(Start());
    for (int i = 0; i < 1000; ++i) {
        server->Stop();
        ASSERT_TRUE(server->Start()) << i;
    }
    server->Stop();
    const std::regex expected(
        "Debug level is now 9\\.|Logging server activity to .*\\.|Starting server: .*\\."
        "|Daemon thread started\\. .*|HttpDaemon thread: .*|Server stopping\\.\\.\\."
        "|Daemon thread exiting normally\\.|session thread 0x[0-9A-F]+ exiting\\."
        "|Server log closed\\.");
    for (const std::string& line : Messages())
        EXPECT_TRUE(std::regex_match(line, expected)) << line;
    EXPECT_EQ(Count("Daemon thread exiting normally."), 1001);
    EXPECT_EQ(Count(" exiting."), 1001);
}

TEST_F(oxHttpServerTest, RestartsUnderLoadLoseNoAcceptedConnection) {
    settings.maxSessionsPerAddress = 0;
    ASSERT_TRUE(Start());
    std::atomic<bool> done{false};
    std::atomic<int> answered{0};
    std::atomic<int> cut{0};
    std::vector<std::thread> clients;
    for (int c = 0; c < 4; ++c) {
        clients.emplace_back([&] {
            while (!done) {
                Client client(settings.port);
                if (!client.Connected())
                    continue;  // between stop and start
                client.Send("GET / HTTP/1.0\r\n\r\n");
                const std::string reply = client.ReadAll();
                if (reply.ends_with("<html>home</html>\n"))
                    ++answered;
                else if (!reply.empty())
                    ++cut;
            }
        });
    }
    for (int i = 0; i < 100; ++i) {
        server->Stop();
        server->Configure(settings);
        ASSERT_TRUE(server->Start()) << i;
        const int before = answered;
        ASSERT_TRUE(Eventually([&] { return answered > before + 3; }));
    }
    done = true;
    for (auto& client : clients)
        client.join();
    EXPECT_EQ(cut, 0);
    // Every accepted connection has its whole answer.
    EXPECT_EQ(answered, Count("HttpDaemon thread: connected to "));
    EXPECT_EQ(Count("rror"), 0);
    EXPECT_EQ(Count("failed"), 0);
}

TEST_F(oxHttpServerTest, NameThatNobodyKnowsIsNoAddress) {
    settings.webAddress = "no.such.host.invalid";
    EXPECT_FALSE(Start());
    EXPECT_EQ(Count("Starting server: connecting to no.such.host.invalid on port "), 1);
    EXPECT_EQ(Count("Socket bind failed: Cannot assign requested address (99)"), 1);
    EXPECT_EQ(Count("Server unable to start. (error=99)"), 1);
}

}  // namespace
