// What becomes of one session: its states, when it was last active, and what goes out when something fails.
#include <cerrno>
#include <list>
#include <new>
#include <stdexcept>
#include <thread>

#include "http/httpsession.h"
#include "http/serverfixture.h"
#include "http/support_threads.h"
#include "testing/injected.h"

namespace {

// A session of a server that does not run, and a listener of its own.
class HttpSessionStates : public ServerFixture {
protected:
    HttpSessionStates() {
        server->Configure(settings);
        server->OpenAccessLog();
        EXPECT_TRUE(listener.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.1", 0));
        EXPECT_TRUE(listener.Listen(128));
        port = listener.GetLocalAddress().Port();
    }
    ~HttpSessionStates() override { session.reset(); }

    // Serves one request to its end; the reply.
    std::string Serve(const char* request) {
        Client client(port);
        EXPECT_TRUE(client.Send(request));
        EXPECT_TRUE(session->AcceptConnection(listener));
        EXPECT_TRUE(session->StartThread());
        EXPECT_TRUE(session->Wait());
        session->StopSession(std::chrono::milliseconds(0));  // closes what an error has left open
        return client.ReadAll();
    }

    oxSocket listener;
    std::uint16_t port = 0;
    std::unique_ptr<oxHttpSession> session = std::make_unique<oxHttpSession>(*server, 0);
};

constexpr const char* REQUEST = "GET / HTTP/1.0\r\n\r\n";

TEST_F(HttpSessionStates, AcceptedConnectionIsBeingServed) {
    const Client client(port);
    ASSERT_TRUE(session->AcceptConnection(listener));
    EXPECT_EQ(session->GetState(), -1);
    EXPECT_TRUE(session->IsActive());
    sockaddr_in own{};
    socklen_t length = sizeof own;
    ASSERT_EQ(getsockname(client.Descriptor(), reinterpret_cast<sockaddr*>(&own), &length), 0);
    EXPECT_EQ(session->PeerAddress().Dotted(), "127.0.0.1");
    EXPECT_EQ(session->PeerAddress().Port(), ntohs(own.sin_port));
    EXPECT_EQ(session->PeerAddress().Family(), AF_INET);
}

TEST_F(HttpSessionStates, ClosedListenerFinishesTheSession) {
    listener.Close();
    EXPECT_FALSE(session->AcceptConnection(listener));
    EXPECT_EQ(session->GetState(), -2);
}

TEST_F(HttpSessionStates, AcceptIsTriedThreeTimes) {
    static int calls;
    static int good;
    struct Case {
        int good;
        bool accepted;
        int calls;
        int state;
    };
    for (const Case& c : {Case{1, true, 1, -1}, {3, true, 3, -1}, {4, false, 3, -2}}) {
        calls = 0;
        good = c.good;
        const Injected failing(
            oxSocket::m_lpfnaccept, +[](int descriptor, sockaddr* address, socklen_t* length) {
                if (++calls >= good)
                    return accept4(descriptor, address, length, SOCK_CLOEXEC);
                errno = EMFILE;
                return -1;
            });
        const Client client(port);
        session = std::make_unique<oxHttpSession>(*server, 0);
        EXPECT_EQ(session->AcceptConnection(listener), c.accepted) << c.good;
        EXPECT_EQ(session->GetState(), c.state) << c.good;
        EXPECT_EQ(calls, c.calls) << c.good;
    }
    EXPECT_EQ(listener.ErrorCode(), EMFILE);
}

TEST_F(HttpSessionStates, ThreadThatCannotBeStartedFinishesTheSession) {
    std::list<Client> clients;
    std::list<oxHttpSession> sessions;
    const FailingThreads failing(EAGAIN);
    // Threads that earlier sessions left behind serve the first few; a client that waits keeps each of them.
    bool started = true;
    for (int i = 0; i < 1000 && started; ++i) {
        clients.emplace_back(port);
        sessions.emplace_back(*server, 0U);
        ASSERT_TRUE(sessions.back().AcceptConnection(listener));
        started = sessions.back().StartThread();
    }
    ASSERT_FALSE(started);
    EXPECT_EQ(sessions.back().GetState(), -2);
    EXPECT_EQ(sessions.back().LastError().Code(), EAGAIN);
}

TEST_F(HttpSessionStates, EachStepIsAnActivity) {
    static ManualClock* time;
    time = &clock;
    const Injected slow(
        oxSocket::m_lpfnaccept, +[](int descriptor, sockaddr* address, socklen_t* length) {
            time->Advance(7);
            return accept4(descriptor, address, length, SOCK_CLOEXEC);
        });
    std::atomic<std::int64_t> atRequest{0};
    server->onRequest = [&](const oxRequest&) {
        atRequest = session->LastActivity();
        clock.Advance(7);
        return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
    };

    oxSocket closed;
    EXPECT_FALSE(session->AcceptConnection(closed));
    EXPECT_EQ(session->LastActivity(), clock.MonotonicSeconds()) << "begins to accept";

    Client client(port);
    ASSERT_TRUE(session->AcceptConnection(listener));
    EXPECT_EQ(session->LastActivity(), clock.MonotonicSeconds()) << "has accepted";

    clock.Advance(7);
    const std::int64_t begin = clock.MonotonicSeconds();
    ASSERT_TRUE(session->StartThread());
    ASSERT_TRUE(Eventually([&] { return session->LastActivity() == begin; })) << "begins to read";
    clock.Advance(7);
    client.Send(REQUEST);
    EXPECT_EQ(client.ReadAll().substr(0, 12), "HTTP/1.0 404");
    ASSERT_TRUE(session->Wait());
    EXPECT_EQ(atRequest, begin) << "what the client sends is none";
    EXPECT_EQ(session->LastActivity(), clock.MonotonicSeconds()) << "begins to send";
}

TEST_F(HttpSessionStates, SessionThatIsStoppedWhileItAnswersSendsNothingMore) {
    const std::function<void()> stops[] = {
        [&] { session->SetState(oxHttpSession::STATE_CLOSING); },  // the connection is still there
        [&] { std::jthread([&] { session->StopSession(std::chrono::milliseconds(0)); }).join(); },
    };
    for (const auto& stop : stops) {
        session = std::make_unique<oxHttpSession>(*server, 0);
        server->onRequest = [&](const oxRequest&) {
            stop();
            EXPECT_EQ(session->GetState(), -3);
            return std::make_unique<oxResource_Invalid>(Http::NOT_FOUND_404, nullptr);
        };
        EXPECT_EQ(Serve(REQUEST), "");
        EXPECT_EQ(session->GetState(), -2);
        EXPECT_EQ(dir.Read("ox_remote.log"), "");
    }
}

TEST_F(HttpSessionStates, ReadErrorIsLoggedAndNotAnswered) {
    static int error;
    struct Case {
        int error;
        const char* line;
    };
    for (const Case& c : {Case{EIO, "Error reading request from socket - socket error = 5"},
                          {ENOBUFS, "Error reading request from socket - socket error = 105"}}) {
        error = c.error;
        const Injected failing(
            oxSocket::m_lpfnrecv, +[](int, void*, size_t, int) {
                errno = error;
                return ssize_t{-1};
            });
        session = std::make_unique<oxHttpSession>(*server, 0);
        EXPECT_EQ(Serve(REQUEST), "");
        EXPECT_EQ(session->GetState(), -2);
        EXPECT_EQ(Messages().back(), c.line);
        EXPECT_EQ(dir.Read("ox_remote.log"), "");
    }
}

TEST_F(HttpSessionStates, CleanUpThatFailsAgainIsSaidInItsOwnWords) {
    struct Case {
        void (*fail)();
        const char* first;
    };
    static void (*fail)();
    for (const Case& c : {Case{[] { throw std::runtime_error("something broke"); }, " error - something broke"},
                          {[] { throw std::bad_alloc(); }, " - an unknown exeption occurred."}}) {
        fail = c.fail;
        session = std::make_unique<oxHttpSession>(*server, 0);
        const Injected failing(
            oxSocket::m_lpfnshutdown, +[](int, int) {
                fail();
                return 0;
            });
        EXPECT_EQ(Serve(REQUEST).substr(0, 15), "HTTP/1.0 200 OK");
        EXPECT_EQ(session->GetState(), -2);
        const auto lines = Messages();
        ASSERT_GE(lines.size(), 2u);
        const std::string& second = lines.back();
        const std::string id = second.substr(0, second.find(' ', 8));
        EXPECT_EQ(id.rfind("Session 0x", 0), 0u);
        EXPECT_EQ(lines[lines.size() - 2], id + c.first);
        EXPECT_EQ(second, id + " - an unknown exception occurred during cleanup.");
    }
}

}  // namespace
