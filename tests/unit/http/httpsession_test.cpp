#include "http/httpsession.h"

#include <stdexcept>

#include "http/serverfixture.h"

namespace {

using oxHttpSessionTest = ServerFixture;

TEST_F(oxHttpSessionTest, IsConstructedNewAndClosed) {
    server->Configure(settings);
    const oxHttpSession session(*server, 0);
    EXPECT_EQ(session.GetState(), oxHttpSession::STATE_NEW);
    EXPECT_EQ(session.LastActivity(), 0);
    EXPECT_EQ(session.PeerAddress().Address(), 0u);
    EXPECT_EQ(session.PeerAddress().Family(), AF_INET);
}

TEST_F(oxHttpSessionTest, FinishedSessionStaysFinishedWhenStopped) {
    server->Configure(settings);
    oxHttpSession session(*server, 0);
    session.SetState(oxHttpSession::STATE_FINISHED);
    EXPECT_TRUE(session.StopSession(std::chrono::milliseconds(0)));
    EXPECT_EQ(session.GetState(), oxHttpSession::STATE_FINISHED);
}

TEST_F(oxHttpSessionTest, BadRequestsAreAnsweredWithTheirPages) {
    ASSERT_TRUE(Start());
    struct Case {
        std::string request;
        std::string reply;
    };
    const std::string bad =
        std::string("HTTP/1.0 400 Bad Request\r\nContent-Length: 133\r\n\r\n") + Http::BAD_REQUEST_400.body;
    const std::string large = std::string("HTTP/1.0 413 Request Entity Too Large\r\nContent-Length: 158\r\n\r\n") +
                              Http::REQUEST_ENTITY_TOO_LARGE_413.body;
    for (const Case& c : {Case{"DELETE / HTTP/1.0\r\n\r\n", bad},
                          {"GET index.html HTTP/1.0\r\n\r\n", bad},
                          {"\r\n\r\n", bad},
                          {"GET / HTTP/1.0\r\nX: " + std::string(40000, 'x') + "\r\n\r\n", large}})
        EXPECT_EQ(Ask(settings.port, c.request), c.reply) << c.request.substr(0, 40);
}

TEST_F(oxHttpSessionTest, ClientThatSendsNothingAndLeavesGetsBadRequest) {
    ASSERT_TRUE(Start());
    Client client(settings.port);
    client.EndOfInput();
    EXPECT_EQ(client.ReadAll().substr(0, 26), "HTTP/1.0 400 Bad Request\r\n");
}

TEST_F(oxHttpSessionTest, ClientThatResetsGetsNoReplyAndNoLine) {
    ASSERT_TRUE(Start());
    Client client(settings.port);
    ASSERT_TRUE(WaitForMessage("Adding user session"));
    client.Abort();
    ASSERT_TRUE(Eventually([&] { return server->IsFinished(0); }));
    EXPECT_EQ(Count("Error reading"), 0);
    EXPECT_EQ(dir.Read("ox_remote.log").find("400"), std::string::npos);
}

TEST_F(oxHttpSessionTest, RefusalReachesAClientThatIsStillSending) {
    ASSERT_TRUE(Start());
    for (int i = 0; i < 10; ++i) {
        Client client(settings.port);
        client.Send("POST / HTTP/1.0\r\nContent-Length: 3000000\r\n\r\n");
        client.Send(std::string(3000000, 'x'));
        EXPECT_EQ(client.ReadAll().substr(0, 12), "HTTP/1.0 413");
        EXPECT_FALSE(client.Reset()) << i;
    }
}

TEST_F(oxHttpSessionTest, EndlessSenderIsCutOffAfterTheDropLimit) {
    ASSERT_TRUE(Start());
    Client client(settings.port);
    client.Send("POST / HTTP/1.0\r\nContent-Length: 3000000\r\n\r\n");
    const std::string block(65536, 'x');
    std::size_t sent = 0;
    while (sent < 64u * 1024 * 1024 && client.Send(block))
        sent += block.size();
    EXPECT_LT(sent, 64u * 1024 * 1024);
    Poke();
}

TEST_F(oxHttpSessionTest, SilentSenderIsCutOffAfterTheDropTime) {
    ASSERT_TRUE(Start());
    Client client(settings.port);
    client.Send("GET / HTTP/1.0\r\nX: " + std::string(40000, 'x'));
    const auto begin = std::chrono::steady_clock::now();
    EXPECT_EQ(client.ReadAll().substr(0, 12), "HTTP/1.0 413");
    EXPECT_FALSE(server->IsFinished(0));  // what the client may still send is waited for
    ASSERT_TRUE(Eventually([&] { return server->IsFinished(0); }));
    EXPECT_GE(std::chrono::steady_clock::now() - begin, oxHttpSession::DROP_TIME);
}

TEST_F(oxHttpSessionTest, RuntimeErrorIsLoggedAndTheConnectionClosed) {
    ASSERT_TRUE(Start());
    server->onRequest = [](const oxRequest&) -> std::unique_ptr<oxResource> {
        throw std::runtime_error("something broke");
    };
    EXPECT_EQ(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n"), "");
    ASSERT_TRUE(WaitForMessage(" error - something broke"));
    const auto lines = Messages();
    const auto line = std::find_if(lines.begin(), lines.end(), [](const std::string& text) {
        return text.find("something broke") != std::string::npos;
    });
    EXPECT_EQ(line->rfind("Session 0x", 0), 0u);
    EXPECT_EQ(Count("Adding user session " + line->substr(8, line->find(' ', 8) - 8) + "."), 0);  // another thread's id
}

TEST_F(oxHttpSessionTest, MissingResourceIsAnError) {
    ASSERT_TRUE(Start());
    server->onRequest = [](const oxRequest&) { return std::unique_ptr<oxResource>(); };
    EXPECT_EQ(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n"), "");
    EXPECT_TRUE(WaitForMessage(" error - unable to allocate request"));
}

TEST_F(oxHttpSessionTest, MissingReplyIsAnError) {
    struct Replyless : oxResource {
        std::unique_ptr<oxReply> GetReply(const oxRequest&) override { return nullptr; }
    };
    ASSERT_TRUE(Start());
    server->onRequest = [](const oxRequest&) { return std::make_unique<Replyless>(); };
    EXPECT_EQ(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n"), "");
    EXPECT_TRUE(WaitForMessage(" error - unable to allocate reply"));
}

TEST_F(oxHttpSessionTest, AnyOtherExceptionIsUnknown) {
    ASSERT_TRUE(Start());
    server->onRequest = [](const oxRequest&) -> std::unique_ptr<oxResource> { throw std::bad_alloc(); };
    EXPECT_EQ(Ask(settings.port, "GET / HTTP/1.0\r\n\r\n"), "");
    EXPECT_TRUE(WaitForMessage(" - an unknown exeption occurred."));
    server->onRequest = nullptr;
    Poke();
}

TEST_F(oxHttpSessionTest, AbortedConnectionsNeverCarryForeignBytes) {
    oxAuditFile::SetDefaultDebugLevel(1);
    constexpr int CLIENTS = 40;
    constexpr int ROUNDS = 5;
    for (int i = 0; i < CLIENTS; ++i)
        dir.Write("www/f" + std::to_string(i), std::string(200000, static_cast<char>('A' + i % 26)));
    settings.maxSessionsPerAddress = 0;
    settings.sessionTimeout = 30;
    ASSERT_TRUE(Start());
    std::atomic<int> foreign{0};
    std::atomic<bool> done{false};
    std::vector<std::thread> clients;
    for (int i = 0; i < CLIENTS; ++i) {
        clients.emplace_back([&, i] {
            for (int round = 0; round < ROUNDS; ++round) {
                Client client(settings.port);
                client.Send("GET /f" + std::to_string(i) + " HTTP/1.0\r\n\r\n");
                const std::string reply = client.ReadAll();
                const std::size_t body = reply.find("\r\n\r\n");
                if (body == std::string::npos)
                    continue;  // timed out before its answer
                foreign += reply.find_first_not_of(static_cast<char>('A' + i % 26), body + 4) != std::string::npos;
            }
        });
    }
    std::thread time([&] {
        while (!done) {
            clock.Advance(31);  // every session that is served at this moment is overdue
            std::this_thread::yield();
        }
    });
    for (auto& client : clients)
        client.join();
    done = true;
    time.join();
    EXPECT_EQ(foreign, 0);
}

}  // namespace
