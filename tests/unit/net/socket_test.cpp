// One thread's view of a socket.
#include "net/socket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdarg>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "net/support_table.h"
#include "platform/file.h"

namespace {
using OxSocket = TableTest;

// What the replaced table functions saw and what they answer. Each test sets what it uses.
std::vector<std::string> s_calls;
std::vector<int> s_errors;  // one for each call; the last one stays
std::size_t s_callCount = 0;
int s_flags = 0;
std::string s_bytes;

int Fail() {
    errno = s_errors[std::min(s_callCount, s_errors.size() - 1)];
    ++s_callCount;
    return -1;
}

void FailWith(std::vector<int> errors) {
    s_errors = std::move(errors);
    s_callCount = 0;
}

int FailingBind(int, const sockaddr*, socklen_t) {
    return Fail();
}

int LateBind(int handle, const sockaddr* address, socklen_t length) {
    return ++s_callCount < 3 ? (errno = EADDRINUSE, -1) : ::bind(handle, address, length);
}

int FailingClose(int handle) {
    ::close(handle);
    return Fail();
}

int RecordingSocket(int family, int type, int protocol) {
    s_calls.push_back("socket");
    return ::socket(family, type, protocol);
}

int RecordingClose(int handle) {
    s_calls.push_back("close");
    return ::close(handle);
}

ssize_t RecordingSend(int, const void* buffer, size_t length, int flags) {
    s_bytes.assign(static_cast<const char*>(buffer), length);
    s_flags = flags;
    return static_cast<ssize_t>(length);
}

ssize_t RecordingSendTo(int handle, const void* buffer, size_t length, int flags, const sockaddr*, socklen_t) {
    return RecordingSend(handle, buffer, length, flags);
}

unsigned long s_request = 0;
int s_argument = -1;

int RecordingIOCtl(int, unsigned long request, ...) {
    std::va_list arguments;
    va_start(arguments, request);
    s_argument = *va_arg(arguments, int*);
    va_end(arguments);
    s_request = request;
    return 0;
}

int PositiveIOCtl(int, unsigned long, ...) {
    return 7;
}

int PlainAccept(int handle, sockaddr* address, socklen_t* length) {
    return ::accept(handle, address, length);
}

int ConnectThenInterrupt(int handle, const sockaddr* address, socklen_t length) {
    ++s_callCount;
    if (::connect(handle, address, length) == 0)
        errno = EINTR;
    return -1;
}

int RefusedGetSockOpt(int, int level, int name, void* value, socklen_t*) {
    EXPECT_EQ(SOL_SOCKET, level);
    EXPECT_EQ(SO_ERROR, name);
    *static_cast<int*>(value) = ECONNREFUSED;
    return 0;
}

int s_hostLookUps = 0;

hostent* CountHost(const char* name) {
    ++s_hostLookUps;
    s_bytes = name;
    return nullptr;
}

hostent* CountKnownHost(const char* name) {
    CountHost(name);
    static char bytes[] = "\x7f\x00\x00\x01";
    static char* list[] = {bytes, nullptr};
    static hostent entry{};
    entry.h_addrtype = AF_INET;
    entry.h_length = 4;
    entry.h_addr_list = list;
    return &entry;
}

hostent* NameOfLoopback(const void* address, socklen_t, int) {
    static char name[] = "loop.example";
    static hostent entry{};
    entry.h_name = name;
    return std::memcmp(address, "\x7f\x00\x00\x01", 4) == 0 ? &entry : nullptr;
}

std::uint16_t s_servicePort = 0;

servent* FindService(const char*, const char*) {
    static servent entry{};
    entry.s_port = htons(s_servicePort);
    return &entry;
}

bool IsClosedOnExec(int handle) {
    return (::fcntl(handle, F_GETFD) & FD_CLOEXEC) != 0;
}

bool IsOpen(int handle) {
    return ::fcntl(handle, F_GETFD) != -1;
}

std::string Receive(oxSocket& socket, std::size_t length) {
    std::string bytes(length, '\0');
    EXPECT_EQ(static_cast<int>(length), socket.Recv(bytes.data(), static_cast<int>(length), MSG_WAITALL));
    return bytes;
}
}  // namespace

TEST_F(OxSocket, StartsWithNothing) {
    const oxSocket socket;
    EXPECT_EQ(-1, socket.GetHandle());
    EXPECT_EQ(0, socket.ErrorCode());
    EXPECT_EQ(0u, socket.GetPort());
    EXPECT_EQ(0, socket.GetFamily());
    EXPECT_EQ(0, socket.GetType());
    EXPECT_EQ(0, socket.GetProtocol());
}

TEST_F(OxSocket, FirstOneLooksUpThisMachine) {
    ASSERT_EQ(0, oxSocket::UseCount());
    char name[260] = "";
    ASSERT_EQ(0, ::gethostname(name, sizeof name));
    s_hostLookUps = 0;
    oxSocket::m_lpfngethostbyname = CountKnownHost;
    {
        const oxSocket first;
        EXPECT_EQ(1, oxSocket::UseCount());
        EXPECT_EQ(1, s_hostLookUps);
        EXPECT_EQ(name, s_bytes);
        EXPECT_STREQ(name, oxSocket::HostName());
        EXPECT_TRUE(oxSocket::IsDNSAvailable());
        const oxSocket second;
        EXPECT_EQ(2, oxSocket::UseCount());
        EXPECT_EQ(1, s_hostLookUps);
    }
    EXPECT_EQ(0, oxSocket::UseCount());
    oxSocket::m_lpfngethostbyname = CountHost;
    const oxSocket again;
    EXPECT_EQ(2, s_hostLookUps);
    EXPECT_FALSE(oxSocket::IsDNSAvailable());
}

TEST_F(OxSocket, CreateRemembersTheTypeAsGivenAndClosesOnExec) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, IPPROTO_TCP));
    EXPECT_TRUE(IsClosedOnExec(socket.GetHandle()));
    EXPECT_EQ(AF_INET, socket.GetFamily());
    EXPECT_EQ(SOCK_STREAM, socket.GetType());
    EXPECT_EQ(IPPROTO_TCP, socket.GetProtocol());
    EXPECT_EQ(0u, socket.GetPort());
}

TEST_F(OxSocket, FailedCreateKeepsTheErrorAndTheOldKind) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_DGRAM, IPPROTO_UDP));
    const int old = socket.GetHandle();
    EXPECT_FALSE(socket.Create(-5, SOCK_STREAM, 0));
    EXPECT_EQ(EAFNOSUPPORT, socket.ErrorCode());
    EXPECT_EQ(-1, socket.GetHandle());
    EXPECT_FALSE(IsOpen(old));
    EXPECT_EQ(AF_INET, socket.GetFamily());
    EXPECT_EQ(SOCK_DGRAM, socket.GetType());
    EXPECT_EQ(IPPROTO_UDP, socket.GetProtocol());
    EXPECT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_EQ(0, socket.ErrorCode());
}

TEST_F(OxSocket, CreateOnAnOpenOneClosesItFirst) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    s_calls.clear();
    oxSocket::m_lpfnsocket = RecordingSocket;
    oxSocket::m_lpfnclose = RecordingClose;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_DGRAM, 0));
    EXPECT_EQ((std::vector<std::string>{"close", "socket"}), s_calls);
    EXPECT_EQ(SOCK_DGRAM, socket.GetType());
}

TEST_F(OxSocket, CloseOfNoneIsTrueAndLeavesTheErrorCode) {
    oxSocket socket;
    EXPECT_TRUE(socket.Close());
    EXPECT_EQ(0, socket.ErrorCode());
    EXPECT_FALSE(socket.Create(-5, SOCK_STREAM, 0));
    EXPECT_TRUE(socket.Close());
    EXPECT_EQ(EAFNOSUPPORT, socket.ErrorCode());
}

TEST_F(OxSocket, CloseClosesAndClearsTheErrorCode) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_FALSE(socket.Shutdown(SHUT_RDWR));
    EXPECT_EQ(ENOTCONN, socket.ErrorCode());
    const int handle = socket.GetHandle();
    EXPECT_TRUE(socket.Close());
    EXPECT_EQ(0, socket.ErrorCode());
    EXPECT_EQ(-1, socket.GetHandle());
    EXPECT_FALSE(IsOpen(handle));
    EXPECT_TRUE(socket.Close());
}

TEST_F(OxSocket, FailedCloseKeepsTheErrorButNotTheHandle) {
    for (const int error : {EIO, EINTR}) {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        oxSocket::m_lpfnclose = FailingClose;
        FailWith({error});
        EXPECT_FALSE(socket.Close());
        EXPECT_EQ(error, socket.ErrorCode());
        EXPECT_EQ(-1, socket.GetHandle());
        EXPECT_EQ(1u, s_callCount);
    }
}

TEST_F(OxSocket, DestructionCloses) {
    int handle = -1;
    {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        handle = socket.GetHandle();
    }
    EXPECT_FALSE(IsOpen(handle));
}

TEST_F(OxSocket, EveryOperationOnAClosedOneFailsWithBadDescriptor) {
    char buffer[4] = "abc";
    const oxSockAddr address(LOOPBACK, 9);
    socklen_t length = oxSockAddr::LENGTH;
    oxSocket other;
    int value = 0;
    msghdr message{};
    oxSockAddr filled;
    const struct {
        const char* name;
        std::function<bool(oxSocket&)> failed;
    } CASES[] = {
        {"Shutdown", [&](oxSocket& s) { return !s.Shutdown(SHUT_WR); }},
        {"Bind", [&](oxSocket& s) { return !s.Bind(); }},
        {"Bind address", [&](oxSocket& s) { return !s.Bind(address.Raw(), length, 2); }},
        {"Bind host", [&](oxSocket& s) { return !s.Bind("127.0.0.1", std::uint16_t{0}); }},
        {"Bind service", [&](oxSocket& s) { return !s.Bind(LOOPBACK, "no such", "tcp"); }},
        {"Bind host service", [&](oxSocket& s) { return !s.Bind("127.0.0.1", "no such", "tcp"); }},
        {"Connect", [&](oxSocket& s) { return !s.Connect(address.Raw(), length); }},
        {"Connect host", [&](oxSocket& s) { return !s.Connect("127.0.0.1", std::uint16_t{9}); }},
        {"Connect service", [&](oxSocket& s) { return !s.Connect(LOOPBACK, "no such", "tcp"); }},
        {"Connect host service", [&](oxSocket& s) { return !s.Connect("127.0.0.1", "no such", "tcp"); }},
        {"Listen", [&](oxSocket& s) { return !s.Listen(1); }},
        {"Accept into", [&](oxSocket& s) { return !s.Accept(other, nullptr, nullptr); }},
        {"Accept", [&](oxSocket& s) { return s.Accept(nullptr, nullptr) == -1; }},
        {"Send", [&](oxSocket& s) { return s.Send(buffer, 1, 0) == -1; }},
        {"SendTo", [&](oxSocket& s) { return s.SendTo(buffer, 1, 0, address.Raw(), length) == -1; }},
        {"SendMsg", [&](oxSocket& s) { return s.SendMsg(&message, 0) == -1; }},
        {"Recv", [&](oxSocket& s) { return s.Recv(buffer, 1, 0) == -1; }},
        {"RecvFrom", [&](oxSocket& s) { return s.RecvFrom(buffer, 1, 0, nullptr, nullptr) == -1; }},
        {"Peek", [&](oxSocket& s) { return s.Peek(buffer, 1) == -1; }},
        {"SetSockOpt", [&](oxSocket& s) { return !s.SetSockOpt(SOL_SOCKET, SO_REUSEADDR, &value, sizeof value); }},
        {"GetSockOpt", [&](oxSocket& s) { return !s.GetSockOpt(SOL_SOCKET, SO_REUSEADDR, &value, &length); }},
        {"GetSockName", [&](oxSocket& s) { return !s.GetSockName(filled.Raw(), &length); }},
        {"GetSockHostName", [&](oxSocket& s) { return s.GetSockHostName() == nullptr; }},
        {"GetPeerName", [&](oxSocket& s) { return !s.GetPeerName(filled.Raw(), &length); }},
        {"GetPeerHostName", [&](oxSocket& s) { return s.GetPeerHostName() == nullptr; }},
        {"GetLocalAddress", [&](oxSocket& s) { return s.GetLocalAddress().Address() == 0; }},
        {"IOCtl", [&](oxSocket& s) { return !s.IOCtl(FIONREAD, &value); }},
        {"BytesAvailable", [&](oxSocket& s) { return s.BytesAvailable() == -1; }},
        {"SetNonBlocking", [&](oxSocket& s) { return !s.SetNonBlocking(true); }},
        {"SetAsync", [&](oxSocket& s) { return !s.SetAsync(true); }},
    };
    for (const auto& c : CASES) {
        oxSocket socket;
        EXPECT_TRUE(c.failed(socket)) << c.name;
        EXPECT_EQ(EBADF, socket.ErrorCode()) << c.name;
    }
    EXPECT_EQ(-1, other.GetHandle());
}

TEST_F(OxSocket, CountsLeaveTheErrorCodeAloneAndBoolsClearIt) {
    oxSocket near, far;
    MakePair(near, far);
    EXPECT_FALSE(near.SetSockOpt(SOL_SOCKET, -1, nullptr, 0));
    const int error = near.ErrorCode();
    EXPECT_NE(0, error);
    EXPECT_EQ(1, near.Send("x", 1, 0));
    EXPECT_EQ(1, near.SendTo("y", 1, 0, nullptr, 0));
    EXPECT_EQ(1, far.Send("z", 1, 0));
    char byte = 0;
    EXPECT_EQ(1, near.Recv(&byte, 1, 0));
    EXPECT_EQ('z', byte);
    EXPECT_EQ(error, near.ErrorCode());
    EXPECT_TRUE(near.Shutdown(SHUT_WR));
    EXPECT_EQ(0, near.ErrorCode());
}

TEST_F(OxSocket, BoolIsTrueOnlyForTheResultZero) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    oxSocket::m_lpfnioctl = PositiveIOCtl;
    int value = 0;
    EXPECT_FALSE(socket.IOCtl(FIONREAD, &value));
    EXPECT_EQ(7, socket.ErrorCode());
    EXPECT_EQ(-1, socket.BytesAvailable());
}

TEST_F(OxSocket, GetLastErrorTakesTheSystemsNumber) {
    oxSocket socket;
    errno = ENOSPC;
    EXPECT_EQ(ENOSPC, socket.GetLastError());
    EXPECT_EQ(ENOSPC, socket.ErrorCode());
}

TEST_F(OxSocket, BindMakesAllAttemptsAndKeepsTheLastError) {
    static const struct {
        int attempts;
        std::size_t calls;
        int error;
    } CASES[] = {{1, 1, EADDRINUSE}, {2, 2, EACCES}, {3, 3, EINVAL}, {0, 1, EADDRINUSE}};
    const oxSockAddr address(LOOPBACK);
    for (const auto& c : CASES) {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        FailWith({EADDRINUSE, EACCES, EINVAL});
        oxSocket::m_lpfnbind = FailingBind;
        EXPECT_FALSE(socket.Bind(address.Raw(), oxSockAddr::LENGTH, c.attempts));
        EXPECT_EQ(c.calls, s_callCount);
        EXPECT_EQ(c.error, socket.ErrorCode());
    }
}

TEST_F(OxSocket, BindStopsAtTheFirstSuccess) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    s_callCount = 0;
    oxSocket::m_lpfnbind = LateBind;
    const oxSockAddr address(LOOPBACK);
    EXPECT_TRUE(socket.Bind(address.Raw(), oxSockAddr::LENGTH, 5));
    EXPECT_EQ(3u, s_callCount);
    EXPECT_EQ(0, socket.ErrorCode());
}

TEST_F(OxSocket, OtherBindsMakeOneAttempt) {
    static const std::function<bool(oxSocket&)> BINDS[] = {
        [](oxSocket& s) { return s.Bind(); },
        [](oxSocket& s) { return s.Bind("127.0.0.1", std::uint16_t{0}); },
        [](oxSocket& s) { return s.Bind(LOOPBACK, "no such", "tcp"); },
        [](oxSocket& s) { return s.Bind("127.0.0.1", "no such", "tcp"); },
    };
    for (const auto& bind : BINDS) {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        FailWith({EADDRINUSE});
        oxSocket::m_lpfnbind = FailingBind;
        EXPECT_FALSE(bind(socket));
        EXPECT_EQ(1u, s_callCount);
        oxSocket::m_lpfnbind = ::bind;
        EXPECT_TRUE(bind(socket));
        EXPECT_NE(0, socket.GetLocalAddress().Port());
    }
}

TEST_F(OxSocket, BindToAPortInUseFails) {
    oxSocket listener, second;
    const oxSockAddr address = ListenOnLoopback(listener);
    ASSERT_TRUE(second.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_FALSE(second.Bind(address.Raw(), oxSockAddr::LENGTH, 3));
    EXPECT_EQ(EADDRINUSE, second.ErrorCode());
    EXPECT_FALSE(second.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.1", address.Port()));
    EXPECT_EQ(EADDRINUSE, second.ErrorCode());
    EXPECT_NE(-1, second.GetHandle());
}

TEST_F(OxSocket, CreateBindsOnlyWhenAHostIsGiven) {
    oxSocket socket;
    const char* const noHost = nullptr;
    EXPECT_FALSE(socket.Create(-5, SOCK_STREAM, 0, noHost, 0));
    EXPECT_EQ(EAFNOSUPPORT, socket.ErrorCode());
    EXPECT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0, noHost, 0));
    EXPECT_EQ(0, socket.GetLocalAddress().Port());
    EXPECT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.1", 0));
    EXPECT_EQ(LOOPBACK, socket.GetLocalAddress().Address());
    EXPECT_NE(0, socket.GetLocalAddress().Port());
}

TEST_F(OxSocket, ConnectByHostAndPortRemembersThePort) {
    oxSocket listener, socket;
    const oxSockAddr address = ListenOnLoopback(listener);
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(socket.Connect("127.0.0.1", address.Port()));
    EXPECT_EQ(address.Port(), socket.GetPort());
    s_servicePort = address.Port();
    oxSocket::m_lpfngetservbyname = FindService;
    oxSocket other;
    ASSERT_TRUE(other.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(other.Connect(LOOPBACK, "service", "tcp"));
    ASSERT_TRUE(other.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(other.Connect("127.0.0.1", "service", "tcp"));
    EXPECT_EQ(0u, other.GetPort());
}

TEST_F(OxSocket, RefusedConnectKeepsTheError) {
    oxSocket listener, socket;
    const oxSockAddr address = ListenOnLoopback(listener);
    listener.Close();
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_FALSE(socket.Connect("127.0.0.1", address.Port()));
    EXPECT_EQ(ECONNREFUSED, socket.ErrorCode());
}

TEST_F(OxSocket, InterruptedConnectWaitsForItsOutcome) {
    oxSocket listener, socket;
    const oxSockAddr address = ListenOnLoopback(listener);
    oxSocket::m_lpfnconnect = ConnectThenInterrupt;
    s_callCount = 0;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_TRUE(socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_EQ(0, socket.ErrorCode());
    EXPECT_EQ(1u, s_callCount);

    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    oxSocket::m_lpfngetsockopt = RefusedGetSockOpt;
    EXPECT_FALSE(socket.Connect(address.Raw(), oxSockAddr::LENGTH));
    EXPECT_EQ(ECONNREFUSED, socket.ErrorCode());
    EXPECT_EQ(2u, s_callCount);
}

TEST_F(OxSocket, AcceptFillsTheOther) {
    for (const bool ownAccept : {true, false}) {
        oxSocket::m_lpfnaccept = ownAccept ? ::accept : PlainAccept;
        oxSocket listener, client, accepted;
        ASSERT_TRUE(listener.Create(AF_INET, SOCK_STREAM, IPPROTO_TCP, "127.0.0.1", 0));
        ASSERT_TRUE(listener.Listen(1));
        const oxSockAddr address = listener.GetLocalAddress();
        ASSERT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
        ASSERT_TRUE(client.Connect(address.Raw(), oxSockAddr::LENGTH));
        EXPECT_FALSE(listener.SetSockOpt(SOL_SOCKET, -1, nullptr, 0));
        oxSockAddr peer;
        socklen_t length = oxSockAddr::LENGTH;
        ASSERT_TRUE(listener.Accept(accepted, peer.Raw(), &length));
        EXPECT_EQ(0, listener.ErrorCode());
        EXPECT_EQ(client.GetLocalAddress().Port(), peer.Port());
        EXPECT_EQ(LOOPBACK, peer.Address());
        EXPECT_EQ(AF_INET, accepted.GetFamily());
        EXPECT_EQ(SOCK_STREAM, accepted.GetType());
        EXPECT_EQ(IPPROTO_TCP, accepted.GetProtocol());
        EXPECT_TRUE(IsClosedOnExec(accepted.GetHandle()));
        ASSERT_EQ(5, client.Send("hello", 5, 0));
        EXPECT_EQ("hello", Receive(accepted, 5));
    }
}

TEST_F(OxSocket, AcceptIntoAnOpenOneClosesIt) {
    oxSocket listener, client, accepted;
    const oxSockAddr address = ListenOnLoopback(listener);
    ASSERT_TRUE(accepted.Create(AF_INET, SOCK_DGRAM, 0));
    const int old = accepted.GetHandle();
    ASSERT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(client.Connect(address.Raw(), oxSockAddr::LENGTH));
    ASSERT_TRUE(listener.Accept(accepted, nullptr, nullptr));
    EXPECT_NE(old, accepted.GetHandle());
    EXPECT_FALSE(IsOpen(old));
    EXPECT_EQ(SOCK_STREAM, accepted.GetType());
}

TEST_F(OxSocket, FailedAcceptLeavesTheOtherUntouched) {
    oxSocket socket, other;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(other.Create(AF_INET, SOCK_DGRAM, 0));
    const int handle = other.GetHandle();
    EXPECT_FALSE(socket.Accept(other, nullptr, nullptr));
    EXPECT_EQ(EINVAL, socket.ErrorCode());
    EXPECT_EQ(handle, other.GetHandle());
    EXPECT_EQ(SOCK_DGRAM, other.GetType());
    EXPECT_EQ(0, other.ErrorCode());
}

TEST_F(OxSocket, AcceptGivesTheHandle) {
    for (const bool ownAccept : {true, false}) {
        oxSocket::m_lpfnaccept = ownAccept ? ::accept : PlainAccept;
        oxSocket listener, client;
        const oxSockAddr address = ListenOnLoopback(listener);
        ASSERT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
        ASSERT_TRUE(client.Connect(address.Raw(), oxSockAddr::LENGTH));
        const UniqueFd accepted(listener.Accept(nullptr, nullptr));
        ASSERT_TRUE(accepted);
        EXPECT_TRUE(IsClosedOnExec(accepted.Get()));
        EXPECT_EQ(0, listener.ErrorCode());
    }
}

TEST_F(OxSocket, SendOfLengthMinusOneStopsAtTheZero) {
    oxSocket near, far;
    MakePair(near, far);
    EXPECT_EQ(5, near.Send("hello\0more", -1, 0));
    EXPECT_EQ(0, near.Send("", -1, 0));
    EXPECT_EQ(3, near.Send("\0ab", 3, 0));
    EXPECT_EQ(2, near.SendTo("to\0more", -1, 0, nullptr, 0));
    EXPECT_TRUE(near.Shutdown(SHUT_WR));
    EXPECT_EQ(std::string("hello\0abto", 10), Receive(far, 10));
    char byte = 0;
    EXPECT_EQ(0, far.Recv(&byte, 1, 0));
}

TEST_F(OxSocket, NegativeLengthsAreRefused) {
    oxSocket near, far;
    MakePair(near, far);
    char byte = 0;
    EXPECT_EQ(-1, near.Send("x", -2, 0));
    EXPECT_EQ(EINVAL, near.ErrorCode());
    EXPECT_EQ(-1, far.SendTo("x", -2, 0, nullptr, 0));
    EXPECT_EQ(EINVAL, far.ErrorCode());
    oxSocket near2, far2;
    MakePair(near2, far2);
    EXPECT_EQ(-1, near2.Recv(&byte, -1, 0));
    EXPECT_EQ(EINVAL, near2.ErrorCode());
    EXPECT_EQ(-1, far2.RecvFrom(&byte, -1, 0, nullptr, nullptr));
    EXPECT_EQ(EINVAL, far2.ErrorCode());
}

TEST_F(OxSocket, SendingNeverRaisesASignal) {
    oxSocket near, far;
    MakePair(near, far);
    oxSocket::m_lpfnsend = RecordingSend;
    oxSocket::m_lpfnsendto = RecordingSendTo;
    EXPECT_EQ(2, near.Send("ab", 2, MSG_MORE));
    EXPECT_EQ(MSG_MORE | MSG_NOSIGNAL, s_flags);
    EXPECT_EQ("ab", s_bytes);
    EXPECT_EQ(3, near.SendTo("cde", -1, MSG_DONTWAIT, nullptr, 0));
    EXPECT_EQ(MSG_DONTWAIT | MSG_NOSIGNAL, s_flags);
    EXPECT_EQ("cde", s_bytes);
    oxSocket::m_lpfnsend = ::send;
    oxSocket::m_lpfnsendto = ::sendto;

    ASSERT_TRUE(near.Shutdown(SHUT_WR));
    iovec bytes{s_bytes.data(), s_bytes.size()};
    msghdr message{};
    message.msg_iov = &bytes;
    message.msg_iovlen = 1;
    EXPECT_EQ(-1, near.Send("x", 1, 0));
    EXPECT_EQ(EPIPE, near.ErrorCode());
    EXPECT_EQ(-1, near.SendTo("x", 1, 0, nullptr, 0));
    EXPECT_EQ(-1, near.SendMsg(&message, 0));
    EXPECT_EQ(EPIPE, near.ErrorCode());
    EXPECT_EQ(3, far.SendMsg(&message, 0));
    EXPECT_EQ("cde", Receive(near, 3));
}

TEST_F(OxSocket, PeekLeavesTheBytes) {
    oxSocket near, far;
    MakePair(near, far);
    ASSERT_EQ(3, near.Send("abc", 3, 0));
    ASSERT_EQ(Readiness::Ready, far.WaitReadable());
    char bytes[3] = {};
    EXPECT_EQ(2, far.Peek(bytes, 2));
    EXPECT_EQ('a', bytes[0]);
    EXPECT_EQ(3, far.BytesAvailable());
    EXPECT_EQ("abc", Receive(far, 3));
    EXPECT_EQ(0, far.BytesAvailable());
    near.Close();
    EXPECT_EQ(0, far.Peek(bytes, 1));
}

TEST_F(OxSocket, DatagramsCarryTheSender) {
    oxSocket one, two;
    ASSERT_TRUE(one.Create(AF_INET, SOCK_DGRAM, 0, "127.0.0.1", 0));
    ASSERT_TRUE(two.Create(AF_INET, SOCK_DGRAM, 0, "127.0.0.1", 0));
    const oxSockAddr to = two.GetLocalAddress();
    ASSERT_EQ(4, one.SendTo("data", -1, 0, to.Raw(), oxSockAddr::LENGTH));
    char bytes[8] = {};
    oxSockAddr from;
    socklen_t length = oxSockAddr::LENGTH;
    ASSERT_EQ(4, two.RecvFrom(bytes, sizeof bytes, 0, from.Raw(), &length));
    EXPECT_STREQ("data", bytes);
    EXPECT_EQ(one.GetLocalAddress().Port(), from.Port());
}

TEST_F(OxSocket, OptionsAreSetAndRead) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    int value = 1;
    EXPECT_TRUE(socket.SetSockOpt(SOL_SOCKET, SO_KEEPALIVE, &value, sizeof value));
    value = 0;
    socklen_t length = sizeof value;
    EXPECT_TRUE(socket.GetSockOpt(SOL_SOCKET, SO_KEEPALIVE, &value, &length));
    EXPECT_EQ(1, value);
}

TEST_F(OxSocket, NonBlockingIsSwitched) {
    oxSocket near, far;
    MakePair(near, far);
    char byte = 0;
    ASSERT_TRUE(near.SetNonBlocking(true));
    EXPECT_EQ(-1, near.Recv(&byte, 1, 0));
    EXPECT_EQ(EAGAIN, near.ErrorCode());
    ASSERT_TRUE(near.SetNonBlocking(false));
    EXPECT_EQ(0, ::fcntl(near.GetHandle(), F_GETFL) & O_NONBLOCK);
}

TEST_F(OxSocket, FlagsGoToTheirRequests) {
    oxSocket socket;
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    oxSocket::m_lpfnioctl = RecordingIOCtl;
    static const struct {
        bool (oxSocket::*set)(bool);
        bool on;
        unsigned long request;
    } CASES[] = {
        {&oxSocket::SetNonBlocking, true, FIONBIO},
        {&oxSocket::SetNonBlocking, false, FIONBIO},
        {&oxSocket::SetAsync, true, FIOASYNC},
        {&oxSocket::SetAsync, false, FIOASYNC},
    };
    for (const auto& c : CASES) {
        s_argument = -1;
        EXPECT_TRUE((socket.*c.set)(c.on));
        EXPECT_EQ(c.request, s_request);
        EXPECT_EQ(c.on ? 1 : 0, s_argument);
    }
}

TEST_F(OxSocket, AddressesAndNamesOfBothEnds) {
    oxSocket::m_lpfngethostbyaddr = NameOfLoopback;
    oxSocket near, far;
    MakePair(near, far);
    oxSockAddr peer;
    socklen_t length = oxSockAddr::LENGTH;
    ASSERT_TRUE(near.GetPeerName(peer.Raw(), &length));
    EXPECT_EQ(far.GetLocalAddress().Port(), peer.Port());
    EXPECT_EQ(LOOPBACK, near.GetLocalAddress().Address());
    EXPECT_STREQ("loop.example", near.GetSockHostName());
    EXPECT_STREQ("loop.example", near.GetPeerHostName());

    oxSocket unbound;
    ASSERT_TRUE(unbound.Create(AF_INET, SOCK_STREAM, 0));
    EXPECT_STREQ("unknown", unbound.GetSockHostName());
    EXPECT_EQ(nullptr, unbound.GetPeerHostName());
    EXPECT_EQ(ENOTCONN, unbound.ErrorCode());
}

TEST_F(OxSocket, WaitsTellWhatTheyFound) {
    oxSocket near, far;
    EXPECT_EQ(Readiness::Failed, near.WaitReadable());
    errno = 0;
    EXPECT_EQ(Readiness::Failed, near.WaitWritable());
    EXPECT_EQ(EBADF, errno);
    MakePair(near, far);
    EXPECT_EQ(Readiness::TimedOut, near.WaitReadable(std::chrono::milliseconds(1)));
    EXPECT_EQ(Readiness::Ready, near.WaitWritable());
    ASSERT_EQ(1, far.Send("x", 1, 0));
    EXPECT_EQ(Readiness::Ready, near.WaitReadable());
}
