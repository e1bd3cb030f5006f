// The socket that reports events from a thread of its own.
#include "net/asynchsocket.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "net/support_table.h"
#include "testing/waiting.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr std::uint32_t READ = 0x01;
constexpr std::uint32_t WRITE = 0x08;
constexpr std::uint32_t OUT_OF_BAND = 0x20;

// Keeps the events that came, in order, each with its count: "OnRead 1".
class Recorder : public oxAsynchSocket {
public:
    ~Recorder() override { Close(); }

    void OnReserved(oxAsynchSocket& socket, int count) override { Take("OnReserved", socket, count); }
    void OnRead(oxAsynchSocket& socket, int count) override { Take("OnRead", socket, count); }
    void OnWrite(oxAsynchSocket& socket, int count) override { Take("OnWrite", socket, count); }
    void OnOutOfBand(oxAsynchSocket& socket, int count) override { Take("OnOutOfBand", socket, count); }
    void OnAccept(oxAsynchSocket& socket, int count) override { Take("OnAccept", socket, count); }
    void OnConnect(oxAsynchSocket& socket, int count) override { Take("OnConnect", socket, count); }
    void OnClose(oxAsynchSocket& socket, int count) override { Take("OnClose", socket, count); }

    std::vector<std::string> Events() const {
        const std::scoped_lock lock(m_mutex);
        return m_events;
    }
    std::size_t Total() const { return Events().size(); }
    auto Count(const std::string& event) const {
        const auto events = Events();
        return std::count_if(events.begin(), events.end(), [&](const auto& e) { return e.starts_with(event + ' '); });
    }
    bool WaitFor(const std::string& event) const {
        return Eventually([&] { return Count(event) > 0; });
    }
    bool WaitUntilEnded() const {
        return Eventually([&] { return !IsSelecting(); });
    }

    // Called on the select thread with the event's name.
    std::function<void(Recorder&, const std::string&)> onEvent;

private:
    void Take(const std::string& event, const oxAsynchSocket& socket, int count) {
        EXPECT_EQ(this, &socket);
        {
            const std::scoped_lock lock(m_mutex);
            m_events.push_back(event + ' ' + std::to_string(count));
        }
        if (onEvent)
            onEvent(*this, event);
    }

    mutable std::mutex m_mutex;
    std::vector<std::string> m_events;
};

// A connected pair: the recorder, and a plain socket at the other end. Nothing is selected yet.
class OxAsynchSocket : public TableTest {
protected:
    void Connect() {
        const oxSockAddr address = ListenOnLoopback(m_listener);
        ASSERT_TRUE(m_socket.oxSocket::Create(AF_INET, SOCK_STREAM, 0));
        ASSERT_TRUE(m_socket.oxSocket::Connect(address.Raw(), oxSockAddr::LENGTH));
        ASSERT_TRUE(m_listener.Accept(m_peer, nullptr, nullptr));
        ASSERT_TRUE(m_socket.SetNonBlocking(true));
    }
    bool WaitForResults(int results) {
        pollfd entry{m_socket.GetHandle(), static_cast<short>(results), 0};
        return Eventually([&] { return ::poll(&entry, 1, 0) > 0 && (entry.revents & results) == results; });
    }

    oxSocket m_listener;
    oxSocket m_peer;
    Recorder m_socket;
};

void CloseSelf(Recorder& socket, const std::string&) {
    socket.Close();
}

}  // namespace

TEST_F(OxAsynchSocket, EachReadinessCallsItsHandlerWithTheCountOfKinds) {
    enum Input { NOTHING = 0, DATA = 1, URGENT = 2, END = 4 };
    static const struct {
        std::uint32_t mask;
        int input;
        std::vector<std::string> events;  // of the first round
    } CASES[] = {
        {0x01, DATA, {"OnRead 1"}},
        {0x02, DATA, {"OnRead 1"}},
        {0x04, DATA, {"OnRead 1"}},
        {0x01, END, {"OnClose 1"}},
        {0x04, END, {"OnClose 1"}},
        {0x01, DATA | END, {"OnRead 1"}},
        {0x08, NOTHING, {"OnWrite 1"}},
        {0x10, NOTHING, {"OnWrite 1"}},
        {0x08, DATA | URGENT, {"OnWrite 1"}},
        {0x20, URGENT, {"OnOutOfBand 1"}},
        {0x01 | 0x08, NOTHING, {"OnWrite 1"}},
        {0x01 | 0x08, DATA, {"OnWrite 2", "OnRead 2"}},
        {0x04 | 0x10, END, {"OnWrite 2", "OnClose 2"}},
        {0x01 | 0x20, DATA | URGENT, {"OnRead 2", "OnOutOfBand 2"}},
        {0x3f, DATA | URGENT, {"OnWrite 3", "OnRead 3", "OnOutOfBand 3"}},
        {0xffffffff, DATA | URGENT, {"OnWrite 3", "OnRead 3", "OnOutOfBand 3"}},
    };
    for (const auto& test : CASES) {
        SCOPED_TRACE(testing::Message() << "mask " << test.mask << " input " << test.input);
        oxSocket listener;
        oxSocket peer;
        Recorder socket;
        const oxSockAddr address = ListenOnLoopback(listener);
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        ASSERT_TRUE(socket.SetNonBlocking(false));
        ASSERT_TRUE(socket.oxSocket::Connect(address.Raw(), oxSockAddr::LENGTH));
        ASSERT_TRUE(socket.SetNonBlocking(true));
        ASSERT_TRUE(listener.Accept(peer, nullptr, nullptr));
        int arrived = 0;
        if ((test.input & DATA) != 0) {
            EXPECT_EQ(4, peer.Send("data", -1, 0));
            arrived |= POLLIN;
        }
        if ((test.input & URGENT) != 0) {
            EXPECT_EQ(1, peer.Send("!", 1, MSG_OOB));
            arrived |= POLLPRI;
        }
        if ((test.input & END) != 0) {
            EXPECT_TRUE(peer.Shutdown(SHUT_WR));
            arrived |= POLLIN | POLLRDHUP;
        }
        pollfd entry{socket.GetHandle(), static_cast<short>(arrived), 0};
        ASSERT_TRUE(Eventually([&] { return ::poll(&entry, 1, 0) >= 0 && entry.revents == arrived; }));

        EXPECT_TRUE(socket.SetAsyncSelect(test.mask));
        EXPECT_TRUE(Eventually([&] { return socket.Total() >= test.events.size(); }));
        EXPECT_TRUE(socket.Close());
        auto events = socket.Events();
        events.resize(std::min(events.size(), test.events.size()));
        EXPECT_EQ(test.events, events);
        EXPECT_EQ(0, socket.Count("OnReserved"));
    }
}

TEST_F(OxAsynchSocket, ReportsAgainAsLongAsTheStateLasts) {
    Connect();
    EXPECT_EQ(4, m_peer.Send("data", -1, 0));
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    EXPECT_TRUE(Eventually([&] { return m_socket.Count("OnRead") >= 3; }));
}

TEST_F(OxAsynchSocket, HandlersWithoutABodyDoNothing) {
    oxAsynchSocket socket;
    socket.OnReserved(socket, 1);
    socket.OnRead(socket, 1);
    socket.OnWrite(socket, 1);
    socket.OnOutOfBand(socket, 1);
    socket.OnAccept(socket, 1);
    socket.OnConnect(socket, 1);
    socket.OnClose(socket, 1);
    EXPECT_EQ(0, socket.ErrorCode());
    EXPECT_EQ(-1, socket.GetHandle());
}

TEST_F(OxAsynchSocket, CreateMakesANonBlockingSocket) {
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_NE(0, ::fcntl(m_socket.GetHandle(), F_GETFL) & O_NONBLOCK);
    const oxSockAddr any(LOOPBACK);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0, any.Raw(), oxSockAddr::LENGTH));  // and bind
    EXPECT_NE(0, ::fcntl(m_socket.GetHandle(), F_GETFL) & O_NONBLOCK);
}

TEST_F(OxAsynchSocket, FailedCreateReportsTheError) {
    EXPECT_FALSE(m_socket.Create(AF_INET, SOCK_STREAM, IPPROTO_UDP));
    EXPECT_EQ(EPROTONOSUPPORT, m_socket.ErrorCode());
    EXPECT_EQ(-1, m_socket.GetHandle());
}

TEST_F(OxAsynchSocket, ConnectSucceedsAtOnceAndIsReportedExactlyOnce) {
    const oxSockAddr address = ListenOnLoopback(m_listener);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(m_socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_EQ(0, m_socket.ErrorCode());
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(Eventually([&] { return m_socket.Total() >= 3; }));
    EXPECT_TRUE(m_socket.Close());
    EXPECT_EQ("OnConnect 1", m_socket.Events().front());
    EXPECT_EQ(1, m_socket.Count("OnConnect"));
    EXPECT_GE(m_socket.Count("OnWrite"), 2);
}

TEST_F(OxAsynchSocket, ConnectByHostTextRemembersThePortToo) {
    const oxSockAddr address = ListenOnLoopback(m_listener);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(m_socket.Connect("127.0.0.1", address.Port()));
    EXPECT_EQ(address.Port(), m_socket.GetPort());
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitFor("OnConnect"));
}

TEST_F(OxAsynchSocket, RefusedConnectIsReportedAndItsErrorCanBeAskedFor) {
    oxSocket unused;
    const oxSockAddr any(LOOPBACK);
    ASSERT_TRUE(unused.Create(AF_INET, SOCK_STREAM, 0, any.Raw(), oxSockAddr::LENGTH));  // bound, but not listening
    const oxSockAddr address = unused.GetLocalAddress();
    std::atomic<int> outcome{0};
    m_socket.onEvent = [&](Recorder& socket, const std::string&) {
        int error = 0;
        socklen_t length = sizeof error;
        EXPECT_TRUE(socket.GetSockOpt(SOL_SOCKET, SO_ERROR, &error, &length));
        outcome = error;
        socket.Close();
    };
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(m_socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(1u, m_socket.Total());
    EXPECT_EQ(1, m_socket.Count("OnConnect"));
    EXPECT_EQ(ECONNREFUSED, outcome);
}

TEST_F(OxAsynchSocket, ConnectThatFailsOtherwiseFails) {
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    const sockaddr nowhere{.sa_family = AF_APPLETALK, .sa_data = {}};
    EXPECT_FALSE(m_socket.Connect(&nowhere, oxSockAddr::LENGTH));
    EXPECT_EQ(EAFNOSUPPORT, m_socket.ErrorCode());
}

TEST_F(OxAsynchSocket, UnderWayIsEitherOfTheTwoErrors) {
    static int s_error = 0;
    static const struct {
        int error;
        bool succeeds;
    } CASES[] = {{EINPROGRESS, true}, {EAGAIN, true}, {EALREADY, false}, {ECONNREFUSED, false}};
    oxSocket::m_lpfnconnect = [](int, const sockaddr*, socklen_t) {
        errno = s_error;
        return -1;
    };
    oxSocket::m_lpfnlisten = [](int, int) {
        errno = s_error;
        return -1;
    };
    const oxSockAddr any(LOOPBACK);
    for (const auto& test : CASES) {
        SCOPED_TRACE(test.error);
        s_error = test.error;
        ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
        EXPECT_EQ(test.succeeds, m_socket.Connect(any.Raw(), oxSockAddr::LENGTH));
        EXPECT_EQ(test.succeeds ? 0 : test.error, m_socket.ErrorCode());
        EXPECT_EQ(test.succeeds, m_socket.Listen(1));
        EXPECT_EQ(test.succeeds ? 0 : test.error, m_socket.ErrorCode());
    }
}

TEST_F(OxAsynchSocket, ListenUnderWayIsReportedAsAcceptOnce) {
    oxSocket::m_lpfnlisten = [](int handle, int backlog) {
        EXPECT_EQ(0, ::listen(handle, backlog));
        errno = EINPROGRESS;
        return -1;
    };
    const oxSockAddr any(LOOPBACK);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(m_socket.Bind(any.Raw(), oxSockAddr::LENGTH, 1));
    const oxSockAddr address = m_socket.GetLocalAddress();
    EXPECT_TRUE(m_socket.Listen(1));
    m_socket.onEvent = [&](Recorder& socket, const std::string&) {
        EXPECT_TRUE(socket.Accept(m_peer, nullptr, nullptr));
    };
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    oxSocket client;
    ASSERT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(client.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_TRUE(m_socket.WaitFor("OnAccept"));
    EXPECT_TRUE(m_socket.Close());
    EXPECT_EQ(std::vector<std::string>{"OnAccept 1"}, m_socket.Events());
}

TEST_F(OxAsynchSocket, ConnectionOnAPlainListenerIsReportedAsReadAndEndsTheEvents) {
    const oxSockAddr address = ListenOnLoopback(m_socket);
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    oxSocket client;
    ASSERT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(client.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(std::vector<std::string>{"OnRead 1"}, m_socket.Events());
    EXPECT_EQ(ENOTCONN, m_socket.ErrorCode());
}

TEST_F(OxAsynchSocket, ConnectAskedForAsExceptionIsReportedThere) {
    const oxSockAddr address = ListenOnLoopback(m_listener);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(m_socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    ASSERT_TRUE(m_listener.Accept(m_peer, nullptr, nullptr));
    EXPECT_EQ(1, m_peer.Send("!", 1, MSG_OOB));
    EXPECT_TRUE(m_socket.SetAsyncSelect(OUT_OF_BAND));
    EXPECT_TRUE(m_socket.WaitFor("OnOutOfBand"));
    EXPECT_TRUE(m_socket.Close());
    EXPECT_EQ("OnConnect 1", m_socket.Events().front());
    EXPECT_EQ(1, m_socket.Count("OnConnect"));
}

TEST_F(OxAsynchSocket, ANewSocketHasNothingUnderWay) {
    const oxSockAddr address = ListenOnLoopback(m_listener);
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(m_socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_DGRAM, 0));
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitFor("OnWrite"));
    EXPECT_EQ(0, m_socket.Count("OnConnect"));
}

TEST_F(OxAsynchSocket, PeerThatClosesIsReportedAsClose) {
    Connect();
    m_socket.onEvent = CloseSelf;
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    EXPECT_TRUE(m_peer.Close());
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(std::vector<std::string>{"OnClose 1"}, m_socket.Events());
}

TEST_F(OxAsynchSocket, EndThatNobodyAskedForIsNoEvent) {
    Connect();
    const linger reset{.l_onoff = 1, .l_linger = 0};
    EXPECT_TRUE(m_peer.SetSockOpt(SOL_SOCKET, SO_LINGER, &reset, sizeof reset));
    EXPECT_TRUE(m_peer.Close());
    ASSERT_TRUE(WaitForResults(POLLHUP | POLLERR));
    EXPECT_TRUE(m_socket.SetAsyncSelect(OUT_OF_BAND));
    // A thread that looks again without waiting uses up as much processor time as there is.
    timespec before{};
    timespec after{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &before);
    std::this_thread::sleep_for(milliseconds(300));
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &after);
    const auto used = seconds(after.tv_sec - before.tv_sec) + std::chrono::nanoseconds(after.tv_nsec - before.tv_nsec);
    EXPECT_LT(used, milliseconds(150));
    EXPECT_TRUE(m_socket.IsSelecting());
    EXPECT_EQ(0u, m_socket.Total());
}

TEST_F(OxAsynchSocket, ErrorCodeThatIsSetEndsTheEvents) {
    Connect();
    m_socket.onEvent = [](Recorder& socket, const std::string&) {
        char text[16];
        EXPECT_EQ(4, socket.Recv(text, sizeof text, 0));
        EXPECT_EQ(-1, socket.Recv(text, sizeof text, 0));
    };
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    EXPECT_EQ(4, m_peer.Send("data", -1, 0));
    EXPECT_TRUE(m_socket.WaitFor("OnRead"));
    EXPECT_TRUE(Eventually([&] { return m_socket.ErrorCode() == EAGAIN; }));
    EXPECT_TRUE(m_socket.IsSelecting());  // until the next event
    EXPECT_EQ(4, m_peer.Send("more", -1, 0));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(std::vector<std::string>{"OnRead 1"}, m_socket.Events());
}

TEST_F(OxAsynchSocket, FailedWaitKeepsItsErrorAndEndsTheEvents) {
    Connect();
    EXPECT_TRUE(::close(m_socket.GetHandle()) == 0);  // behind its back
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(EBADF, m_socket.ErrorCode());
    EXPECT_EQ(0u, m_socket.Total());
    EXPECT_FALSE(m_socket.Close());
}

TEST_F(OxAsynchSocket, SmallerTimeLimitEndsTheThreadWithoutAnEvent) {
    static const struct {
        std::uint32_t a;
        std::uint32_t b;
    } CASES[] = {{10, 1}, {1, 10}, {1, 0}, {0, 1}, {1, 1}};
    struct Limited {
        Recorder socket;
        steady_clock::time_point start;
        steady_clock::time_point end;

        bool HasEnded() {
            if (end == steady_clock::time_point() && !socket.IsSelecting())
                end = steady_clock::now();
            return end != steady_clock::time_point();
        }
    };
    std::vector<std::unique_ptr<Limited>> all;
    for (const auto& test : CASES) {
        Limited& limited = *all.emplace_back(std::make_unique<Limited>());
        limited.socket.SetTimeLimitA(test.a);
        limited.socket.SetTimeLimitB(test.b);
        EXPECT_EQ(test.a, limited.socket.GetTimeLimitA());
        EXPECT_EQ(test.b, limited.socket.GetTimeLimitB());
        ListenOnLoopback(limited.socket);
        limited.start = steady_clock::now();
        EXPECT_TRUE(limited.socket.SetAsyncSelect(READ));
    }
    EXPECT_TRUE(Eventually(
        [&] { return std::count_if(all.begin(), all.end(), [](auto& one) { return !one->HasEnded(); }) == 0; },
        seconds(8)));
    for (const auto& limited : all) {
        EXPECT_GE(limited->end - limited->start, seconds(1));
        EXPECT_EQ(0u, limited->socket.Total());
        EXPECT_EQ(0, limited->socket.ErrorCode());
        EXPECT_NE(-1, limited->socket.GetHandle());
    }
}

TEST_F(OxAsynchSocket, TimeLimitHoldsWhileEventsCome) {
    Connect();
    m_socket.SetTimeLimitA(1);
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_GT(m_socket.Count("OnWrite"), 0);
}

TEST_F(OxAsynchSocket, WithoutTimeLimitTheThreadGoesOn) {
    Connect();
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    std::this_thread::sleep_for(oxAsynchSocket::SELECT_TIME + milliseconds(200));  // one wait without an event
    EXPECT_TRUE(m_socket.IsSelecting());
    EXPECT_EQ(1, m_peer.Send("x", 1, 0));
    EXPECT_TRUE(m_socket.WaitFor("OnRead"));
}

TEST_F(OxAsynchSocket, MaskOfZeroStopsTheThreadAndAnotherStartsItAgain) {
    Connect();
    EXPECT_FALSE(m_socket.SetAsyncSelect(0));
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitFor("OnWrite"));
    EXPECT_FALSE(m_socket.SetAsyncSelect(0));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    const std::size_t total = m_socket.Total();
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(Eventually([&] { return m_socket.Total() > total; }));
    EXPECT_FALSE(m_socket.SetAsyncSelect(0));
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));  // at once
}

TEST_F(OxAsynchSocket, RunningThreadTakesUpANewMask) {
    Connect();
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ));
    EXPECT_FALSE(m_socket.SetAsyncSelect(READ | WRITE));  // started before
    EXPECT_TRUE(m_socket.WaitFor("OnWrite"));
    EXPECT_EQ(0, m_socket.Count("OnRead"));
}

TEST_F(OxAsynchSocket, EventTakenOutOfTheMaskIsNotReportedInTheSameRound) {
    Connect();
    EXPECT_EQ(4, m_peer.Send("data", -1, 0));
    ASSERT_TRUE(WaitForResults(POLLIN | POLLOUT));
    m_socket.onEvent = [](Recorder& socket, const std::string&) { EXPECT_FALSE(socket.SetAsyncSelect(0)); };
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ | WRITE));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(std::vector<std::string>{"OnWrite 2"}, m_socket.Events());
}

TEST_F(OxAsynchSocket, ThreadStartedBeforeTheSocketFindsIt) {
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.IsSelecting());
    ASSERT_TRUE(m_socket.oxSocket::Create(AF_INET, SOCK_DGRAM, 0));
    EXPECT_TRUE(m_socket.WaitFor("OnWrite"));
}

TEST_F(OxAsynchSocket, ConnectBeginsUnderARunningThread) {
    const oxSockAddr address = ListenOnLoopback(m_listener);
    for (int i = 0; i < 100; ++i) {
        Recorder socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        // An unconnected socket is writable already; that is never taken for the outcome of the connect.
        EXPECT_TRUE(socket.SetAsyncSelect(WRITE));
        EXPECT_TRUE(socket.Connect(address.Raw(), oxSockAddr::LENGTH));
        EXPECT_TRUE(socket.WaitFor("OnConnect"));
        EXPECT_TRUE(socket.IsSelecting());
        oxSockAddr peer;
        socklen_t length = oxSockAddr::LENGTH;
        EXPECT_TRUE(socket.GetPeerName(peer.Raw(), &length));
        EXPECT_TRUE(socket.Close());
        EXPECT_EQ(1, socket.Count("OnConnect"));
        oxSocket accepted;
        EXPECT_TRUE(m_listener.Accept(accepted, nullptr, nullptr));
    }
}

TEST_F(OxAsynchSocket, HandlerMayCloseTheSocket) {
    Connect();
    EXPECT_EQ(4, m_peer.Send("data", -1, 0));
    ASSERT_TRUE(WaitForResults(POLLIN | POLLOUT));
    m_socket.onEvent = [](Recorder& socket, const std::string&) {
        EXPECT_TRUE(socket.Close());
        EXPECT_EQ(-1, socket.GetHandle());
        EXPECT_FALSE(socket.SetAsyncSelect(WRITE));  // not from the thread that was stopped
    };
    EXPECT_TRUE(m_socket.SetAsyncSelect(READ | WRITE));
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(std::vector<std::string>{"OnWrite 2"}, m_socket.Events());
    EXPECT_EQ(-1, m_socket.GetHandle());
}

TEST_F(OxAsynchSocket, HandlerThatClosesOnlyTheDescriptorGetsNoFurtherEventOfItsRound) {
    static const struct {
        const char* closesOn;
        std::vector<std::string> events;
    } CASES[] = {
        {"OnWrite", {"OnWrite 3"}},
        {"OnRead", {"OnWrite 3", "OnRead 3"}},
        {"OnOutOfBand", {"OnWrite 3", "OnRead 3", "OnOutOfBand 3"}},
    };
    struct Pair {
        oxSocket peer;
        Recorder socket;
    };
    const oxSockAddr address = ListenOnLoopback(m_listener);
    std::vector<std::unique_ptr<Pair>> pairs;
    for (const auto& test : CASES) {
        auto& [peer, socket] = *pairs.emplace_back(std::make_unique<Pair>());
        ASSERT_TRUE(socket.oxSocket::Create(AF_INET, SOCK_STREAM, 0));
        ASSERT_TRUE(socket.oxSocket::Connect(address.Raw(), oxSockAddr::LENGTH));
        ASSERT_TRUE(m_listener.Accept(peer, nullptr, nullptr));
        EXPECT_EQ(4, peer.Send("data", -1, 0));
        EXPECT_EQ(1, peer.Send("!", 1, MSG_OOB));
        pollfd entry{socket.GetHandle(), POLLIN | POLLPRI, 0};
        ASSERT_TRUE(Eventually([&] { return ::poll(&entry, 1, 0) >= 0 && entry.revents == (POLLIN | POLLPRI); }));
        socket.onEvent = [&test](Recorder& self, const std::string& event) {
            if (event == test.closesOn) {
                EXPECT_TRUE(self.oxSocket::Close());
            }
        };
        socket.SetTimeLimitA(1);  // the mask stays as it is to the thread's end
        EXPECT_TRUE(socket.SetAsyncSelect(READ | WRITE | OUT_OF_BAND));
    }
    for (std::size_t i = 0; i < pairs.size(); ++i) {
        EXPECT_TRUE(pairs[i]->socket.WaitUntilEnded());
        EXPECT_EQ(CASES[i].events, pairs[i]->socket.Events());
        EXPECT_EQ(-1, pairs[i]->socket.GetHandle());
    }
}

TEST_F(OxAsynchSocket, CloseWaitsForARunningHandler) {
    Connect();
    std::atomic<bool> entered{false};
    std::atomic<bool> mayReturn{false};
    std::atomic<bool> returned{false};
    m_socket.onEvent = [&](Recorder&, const std::string&) {
        entered = true;
        EXPECT_TRUE(Eventually([&] { return mayReturn.load(); }));
        returned = true;
    };
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(Eventually([&] { return entered.load(); }));
    std::thread closer([&] {
        EXPECT_TRUE(m_socket.Close());
        EXPECT_TRUE(returned);
    });
    std::this_thread::sleep_for(milliseconds(20));
    EXPECT_NE(-1, m_socket.GetHandle());
    mayReturn = true;
    closer.join();
    EXPECT_EQ(1u, m_socket.Total());
    EXPECT_EQ(-1, m_socket.GetHandle());
}

TEST_F(OxAsynchSocket, StoppingDoesNotWaitForTheNextRound) {
    const auto start = steady_clock::now();
    for (int i = 0; i < 20; ++i) {
        Recorder socket;
        ListenOnLoopback(socket);
        EXPECT_TRUE(socket.SetAsyncSelect(READ));
        EXPECT_TRUE(socket.Close());
    }
    for (int i = 0; i < 20; ++i) {
        oxAsynchSocket socket;
        ListenOnLoopback(socket);
        EXPECT_TRUE(socket.SetAsyncSelect(READ));
    }
    EXPECT_LT(steady_clock::now() - start, seconds(20));
}

// A cancelled thread that unwinds out of a destructor ends the process.
TEST_F(OxAsynchSocket, DestructionIsNoCancellationPoint) {
    static std::atomic<bool> s_ready;
    static std::atomic<bool> s_cancelled;
    s_ready = s_cancelled = false;
    const auto body = [](void* finished) -> void* {
        int state = 0;
        pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &state);
        {
            oxAsynchSocket socket;
            ListenOnLoopback(socket);
            EXPECT_TRUE(socket.SetAsyncSelect(READ));
            s_ready = true;
            EXPECT_TRUE(Eventually([] { return s_cancelled.load(); }));
            pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, &state);
        }
        pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &state);
        return finished;
    };
    pthread_t thread;
    int finished = 0;
    ASSERT_EQ(0, pthread_create(&thread, nullptr, body, &finished));
    EXPECT_TRUE(Eventually([] { return s_ready.load(); }));
    EXPECT_EQ(0, pthread_cancel(thread));
    s_cancelled = true;
    void* result = nullptr;
    EXPECT_EQ(0, pthread_join(thread, &result));
    EXPECT_EQ(&finished, result);
}

TEST_F(OxAsynchSocket, AnyDescriptorNumberWorks) {
    static constexpr int HIGH = 1500;  // above what select can take
    rlimit before{};
    ASSERT_EQ(0, ::getrlimit(RLIMIT_NOFILE, &before));
    const rlimit raised{.rlim_cur = std::max<rlim_t>(before.rlim_cur, HIGH + 1), .rlim_max = before.rlim_max};
    ASSERT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &raised));
    oxSocket::m_lpfnsocket = [](int family, int type, int protocol) {
        const int low = ::socket(family, type, protocol);
        const int high = ::fcntl(low, F_DUPFD_CLOEXEC, HIGH);
        ::close(low);
        return high;
    };
    ASSERT_TRUE(m_socket.Create(AF_INET, SOCK_DGRAM, 0));
    EXPECT_GE(m_socket.GetHandle(), HIGH);
    EXPECT_TRUE(m_socket.SetAsyncSelect(WRITE));
    EXPECT_TRUE(m_socket.WaitFor("OnWrite"));
    EXPECT_TRUE(m_socket.Close());
    EXPECT_EQ(0, ::setrlimit(RLIMIT_NOFILE, &before));
}

TEST_F(OxAsynchSocket, SurvivesCloseByOtherThreadsAtAnyMoment) {
    static constexpr int ROUNDS = 200;
    const oxSockAddr address = ListenOnLoopback(m_listener);
    std::atomic<bool> done{false};
    std::thread service([&] {  // greets everybody
        while (!done) {
            oxSocket accepted;
            if (m_listener.WaitReadable(milliseconds(10)) == Readiness::Ready &&
                m_listener.Accept(accepted, nullptr, nullptr))
                accepted.Send("hello", -1, MSG_DONTWAIT);
        }
    });
    std::atomic<int> rounds{0};
    std::thread closer([&] {
        while (!done)
            m_socket.Close();
    });
    std::thread masker([&] {
        while (!done)
            m_socket.SetAsyncSelect(rounds % 2 == 0 ? READ | WRITE | OUT_OF_BAND : WRITE);
    });
    m_socket.onEvent = [](Recorder& socket, const std::string& event) {
        char text[16];
        if (event == "OnRead")
            socket.Recv(text, sizeof text, MSG_DONTWAIT);
        else if (event == "OnClose")
            socket.Close();
    };
    for (; rounds < ROUNDS; ++rounds) {
        m_socket.Create(AF_INET, SOCK_STREAM, 0);
        m_socket.Connect(address.Raw(), oxSockAddr::LENGTH);
        std::this_thread::yield();
    }
    done = true;
    service.join();
    closer.join();
    masker.join();
    EXPECT_TRUE(m_socket.Close());
    EXPECT_TRUE(m_socket.WaitUntilEnded());
    EXPECT_EQ(-1, m_socket.GetHandle());
    EXPECT_EQ(0, m_socket.Count("OnReserved"));
}
