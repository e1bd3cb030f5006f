// Signals do not show: every call that one interrupts is made again.
#include <pthread.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <functional>
#include <thread>

#include "net/support_table.h"
#include "testing/waiting.h"

namespace {
using OxSocketInterrupted = TableTest;

int s_left = 0;  // interruptions still to come
int s_calls = 0;

// Interrupts twice, then succeeds with the value.
int Interrupt(int value) {
    ++s_calls;
    if (s_left > 0) {
        --s_left;
        errno = EINTR;
        return -1;
    }
    return value;
}

int Socket(int family, int type, int protocol) {
    return Interrupt(0) == 0 ? ::socket(family, type, protocol) : -1;
}
int Accept(int, sockaddr*, socklen_t*) {
    return Interrupt(0) == 0 ? ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0) : -1;
}
int Listen(int, int) {
    return Interrupt(0);
}
int Bind(int, const sockaddr*, socklen_t) {
    return Interrupt(0);
}
ssize_t Send(int, const void*, size_t, int) {
    return Interrupt(1);
}
ssize_t SendTo(int, const void*, size_t, int, const sockaddr*, socklen_t) {
    return Interrupt(1);
}
ssize_t Recv(int, void*, size_t, int) {
    return Interrupt(1);
}
ssize_t RecvFrom(int, void*, size_t, int, sockaddr*, socklen_t*) {
    return Interrupt(1);
}
int IOCtl(int, unsigned long, ...) {
    return Interrupt(0);
}
int SetSockOpt(int, int, int, const void*, socklen_t) {
    return Interrupt(0);
}
int GetSockOpt(int, int, int, void*, socklen_t*) {
    return Interrupt(0);
}
int GetName(int, sockaddr*, socklen_t*) {
    return Interrupt(0);
}

std::atomic<int> s_signals{0};

void OnSignal(int) {
    ++s_signals;
}
}  // namespace

TEST_F(OxSocketInterrupted, CallsAreMadeAgain) {
    oxSocket::m_lpfnsocket = Socket;
    oxSocket::m_lpfnshutdown = Listen;
    oxSocket::m_lpfnaccept = Accept;
    oxSocket::m_lpfnlisten = Listen;
    oxSocket::m_lpfnbind = Bind;
    oxSocket::m_lpfnsend = Send;
    oxSocket::m_lpfnsendto = SendTo;
    oxSocket::m_lpfnrecv = Recv;
    oxSocket::m_lpfnrecvfrom = RecvFrom;
    oxSocket::m_lpfnioctl = IOCtl;
    oxSocket::m_lpfnsetsockopt = SetSockOpt;
    oxSocket::m_lpfngetsockopt = GetSockOpt;
    oxSocket::m_lpfngetsockname = GetName;
    oxSocket::m_lpfngetpeername = GetName;
    char byte = 0;
    oxSocket accepted;
    oxSockAddr address;
    socklen_t length = oxSockAddr::LENGTH;
    const struct {
        const char* name;
        std::function<bool(oxSocket&)> succeeds;
    } CASES[] = {
        {"Create", [&](oxSocket& s) { return s.Create(AF_INET, SOCK_STREAM, 0); }},
        {"Shutdown", [&](oxSocket& s) { return s.Shutdown(SHUT_WR); }},
        {"Bind", [&](oxSocket& s) { return s.Bind(); }},
        {"Listen", [&](oxSocket& s) { return s.Listen(1); }},
        {"Accept", [&](oxSocket& s) { return s.Accept(accepted, nullptr, nullptr) && accepted.Close(); }},
        {"Send", [&](oxSocket& s) { return s.Send(&byte, 1, 0) == 1; }},
        {"SendTo", [&](oxSocket& s) { return s.SendTo(&byte, 1, 0, nullptr, 0) == 1; }},
        {"Recv", [&](oxSocket& s) { return s.Recv(&byte, 1, 0) == 1; }},
        {"Peek", [&](oxSocket& s) { return s.Peek(&byte, 1) == 1; }},
        {"RecvFrom", [&](oxSocket& s) { return s.RecvFrom(&byte, 1, 0, nullptr, nullptr) == 1; }},
        {"IOCtl", [&](oxSocket& s) { return s.SetNonBlocking(true); }},
        {"SetSockOpt", [&](oxSocket& s) { return s.SetSockOpt(0, 0, nullptr, 0); }},
        {"GetSockOpt", [&](oxSocket& s) { return s.GetSockOpt(0, 0, nullptr, nullptr); }},
        {"GetSockName", [&](oxSocket& s) { return s.GetSockName(address.Raw(), &length); }},
        {"GetPeerName", [&](oxSocket& s) { return s.GetPeerName(address.Raw(), &length); }},
    };
    for (const auto& c : CASES) {
        oxSocket socket;
        s_left = 2;
        s_calls = 0;
        EXPECT_TRUE(c.succeeds(socket)) << c.name;
        EXPECT_EQ(0, socket.ErrorCode()) << c.name;
        EXPECT_EQ(3, s_calls) << c.name;
    }
}

TEST_F(OxSocketInterrupted, BlockedCallsGoOnAfterARealSignal) {
    struct sigaction action {};
    struct sigaction before {};
    action.sa_handler = OnSignal;  // without SA_RESTART
    ASSERT_EQ(0, ::sigaction(SIGUSR1, &action, &before));
    oxSocket near, far;
    MakePair(near, far);
    char first = 0;
    char second = 0;
    std::atomic<int> steps{0};
    std::thread reader([&] {
        EXPECT_EQ(Readiness::Ready, near.WaitReadable());
        ++steps;
        EXPECT_EQ(1, near.Recv(&first, 1, 0));
        ++steps;
        EXPECT_EQ(1, near.Recv(&second, 1, 0));
    });
    const auto interrupt = [&reader](int count) {
        const int end = s_signals + count;
        return Eventually([&reader, end] {
            ::pthread_kill(reader.native_handle(), SIGUSR1);
            return s_signals >= end;
        });
    };
    EXPECT_TRUE(interrupt(5));
    EXPECT_EQ(0, steps);
    EXPECT_EQ(1, far.Send("a", 1, 0));
    EXPECT_TRUE(Eventually([&steps] { return steps == 2; }));
    EXPECT_TRUE(interrupt(5));
    EXPECT_EQ(1, far.Send("b", 1, 0));
    reader.join();
    EXPECT_EQ('a', first);
    EXPECT_EQ('b', second);
    EXPECT_EQ(0, near.ErrorCode());
    ::sigaction(SIGUSR1, &before, nullptr);
}
