// What a socket hands on to the system.
#include <arpa/inet.h>

#include <cerrno>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "net/socket.h"
#include "net/support_table.h"

namespace {
using OxSocketCalls = TableTest;
using Texts = std::vector<std::string>;

constexpr std::uint16_t SERVICE_PORT = 4711;
constexpr std::uint32_t ANOTHER = 0x7f000002;
std::vector<std::string> s_calls;

int RecordAddress(const char* call, const sockaddr* address, socklen_t length) {
    sockaddr_in taken{};
    std::memcpy(&taken, address, sizeof taken);
    s_calls.push_back(std::string(call) + ' ' + std::to_string(taken.sin_family) + ' ' + ::inet_ntoa(taken.sin_addr) +
                      ':' + std::to_string(ntohs(taken.sin_port)) + ' ' + std::to_string(length));
    return 0;
}

servent* FindService(const char* service, const char* protocol) {
    static servent entry{};
    entry.s_port = htons(SERVICE_PORT);
    return std::string(service) == "service" && std::string(protocol) == "tcp" ? &entry : nullptr;
}
}  // namespace

TEST_F(OxSocketCalls, EachBindAndConnectNamesItsAddress) {
    oxSocket::m_lpfnbind = [](int, const sockaddr* address, socklen_t length) {
        return RecordAddress("bind", address, length);
    };
    oxSocket::m_lpfnconnect = [](int, const sockaddr* address, socklen_t length) {
        return RecordAddress("connect", address, length);
    };
    oxSocket::m_lpfngetservbyname = FindService;
    const oxSockAddr address(ANOTHER, 4712);
    const auto length = oxSockAddr::LENGTH;
    const struct {
        std::function<bool(oxSocket&)> call;
        const char* expected;
    } CASES[] = {
        {[](oxSocket& s) { return s.Bind(); }, "bind 2 0.0.0.0:0 16"},
        {[&](oxSocket& s) { return s.Bind(address.Raw(), length, 1); }, "bind 2 127.0.0.2:4712 16"},
        {[](oxSocket& s) { return s.Bind("127.0.0.3", 4713); }, "bind 2 127.0.0.3:4713 16"},
        {[](oxSocket& s) { return s.Bind(ANOTHER, "service", "tcp"); }, "bind 2 127.0.0.2:4711 16"},
        {[](oxSocket& s) { return s.Bind(ANOTHER, "service", "udp"); }, "bind 2 127.0.0.2:0 16"},
        {[](oxSocket& s) { return s.Bind("127.0.0.4", "service", "tcp"); }, "bind 2 127.0.0.4:4711 16"},
        {[&](oxSocket& s) { return s.Connect(address.Raw(), length); }, "connect 2 127.0.0.2:4712 16"},
        {[](oxSocket& s) { return s.Connect("127.0.0.5", 4714); }, "connect 2 127.0.0.5:4714 16"},
        {[](oxSocket& s) { return s.Connect(ANOTHER, "service", "tcp"); }, "connect 2 127.0.0.2:4711 16"},
        {[](oxSocket& s) { return s.Connect("127.0.0.6", "service", "tcp"); }, "connect 2 127.0.0.6:4711 16"},
        {[](oxSocket& s) { return s.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.7", 4715); }, "bind 2 127.0.0.7:4715 16"},
        {[&](oxSocket& s) { return s.Create(AF_INET, SOCK_STREAM, 0, address.Raw(), length); },
         "bind 2 127.0.0.2:4712 16"},
    };
    for (const auto& c : CASES) {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        s_calls.clear();
        EXPECT_TRUE(c.call(socket)) << c.expected;
        EXPECT_EQ(Texts{c.expected}, s_calls);
    }
}

TEST_F(OxSocketCalls, CreateAndBindMakesOneAttempt) {
    oxSocket::m_lpfnbind = [](int, const sockaddr* address, socklen_t length) {
        RecordAddress("bind", address, length);
        errno = EADDRINUSE;
        return -1;
    };
    const oxSockAddr address(ANOTHER, 4712);
    const Texts once{"bind 2 127.0.0.2:4712 16"};
    oxSocket socket;
    s_calls.clear();
    EXPECT_FALSE(socket.Create(AF_INET, SOCK_STREAM, 0, address.Raw(), oxSockAddr::LENGTH));
    EXPECT_EQ(once, s_calls);
    EXPECT_EQ(EADDRINUSE, socket.ErrorCode());
    EXPECT_NE(-1, socket.GetHandle());
    s_calls.clear();
    EXPECT_FALSE(socket.Create(AF_INET, SOCK_STREAM, 0, "127.0.0.2", 4712));
    EXPECT_EQ(once, s_calls);
    EXPECT_EQ(EADDRINUSE, socket.ErrorCode());
}

TEST_F(OxSocketCalls, ShutdownAndListenPassTheirNumberOn) {
    static std::vector<int> s_numbers;
    const auto record = [](int, int number) {
        s_numbers.push_back(number);
        return 0;
    };
    static const struct {
        bool (oxSocket::*call)(int);
        int (**entry)(int, int);
        int number;
    } CASES[] = {
        {&oxSocket::Shutdown, &oxSocket::m_lpfnshutdown, SHUT_RD},
        {&oxSocket::Shutdown, &oxSocket::m_lpfnshutdown, SHUT_WR},
        {&oxSocket::Shutdown, &oxSocket::m_lpfnshutdown, SHUT_RDWR},
        {&oxSocket::Listen, &oxSocket::m_lpfnlisten, 0},
        {&oxSocket::Listen, &oxSocket::m_lpfnlisten, 5},
        {&oxSocket::Listen, &oxSocket::m_lpfnlisten, 128},
    };
    for (const auto& c : CASES) {
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        const auto own = *c.entry;
        *c.entry = record;
        s_numbers.clear();
        EXPECT_TRUE((socket.*c.call)(c.number));
        EXPECT_EQ(std::vector<int>{c.number}, s_numbers);
        *c.entry = own;
    }
}
