// What the socket tests share: a function table that is put back, and a listener on the loop-back address.
#pragma once

#include <gtest/gtest.h>

#include "net/socket.h"

inline constexpr std::uint32_t LOOPBACK = 0x7f000001;

// Keeps the socket function table of before the test.
class TableTest : public ::testing::Test {
private:
    // Restores one entry.
    template <typename Function>
    class Kept {
    public:
        explicit Kept(Function& entry) : m_entry(entry), m_function(entry) {}
        ~Kept() { m_entry = m_function; }
        Kept(const Kept&) = delete;
        Kept& operator=(const Kept&) = delete;

    private:
        Function& m_entry;
        const Function m_function;
    };

    Kept<decltype(oxSocket::m_lpfnsocket)> m_socket{oxSocket::m_lpfnsocket};
    Kept<decltype(oxSocket::m_lpfnshutdown)> m_shutdown{oxSocket::m_lpfnshutdown};
    Kept<decltype(oxSocket::m_lpfnlisten)> m_listen{oxSocket::m_lpfnlisten};
    Kept<decltype(oxSocket::m_lpfngethostbyname)> m_gethostbyname{oxSocket::m_lpfngethostbyname};
    Kept<decltype(oxSocket::m_lpfngethostbyaddr)> m_gethostbyaddr{oxSocket::m_lpfngethostbyaddr};
    Kept<decltype(oxSocket::m_lpfngetservbyname)> m_getservbyname{oxSocket::m_lpfngetservbyname};
    Kept<decltype(oxSocket::m_lpfnclose)> m_close{oxSocket::m_lpfnclose};
    Kept<decltype(oxSocket::m_lpfnioctl)> m_ioctl{oxSocket::m_lpfnioctl};
    Kept<decltype(oxSocket::m_lpfnconnect)> m_connect{oxSocket::m_lpfnconnect};
    Kept<decltype(oxSocket::m_lpfnbind)> m_bind{oxSocket::m_lpfnbind};
    Kept<decltype(oxSocket::m_lpfnsend)> m_send{oxSocket::m_lpfnsend};
    Kept<decltype(oxSocket::m_lpfnsendto)> m_sendto{oxSocket::m_lpfnsendto};
    Kept<decltype(oxSocket::m_lpfnrecv)> m_recv{oxSocket::m_lpfnrecv};
    Kept<decltype(oxSocket::m_lpfnrecvfrom)> m_recvfrom{oxSocket::m_lpfnrecvfrom};
    Kept<decltype(oxSocket::m_lpfnaccept)> m_accept{oxSocket::m_lpfnaccept};
    Kept<decltype(oxSocket::m_lpfnsetsockopt)> m_setsockopt{oxSocket::m_lpfnsetsockopt};
    Kept<decltype(oxSocket::m_lpfngetsockopt)> m_getsockopt{oxSocket::m_lpfngetsockopt};
    Kept<decltype(oxSocket::m_lpfngetsockname)> m_getsockname{oxSocket::m_lpfngetsockname};
    Kept<decltype(oxSocket::m_lpfngetpeername)> m_getpeername{oxSocket::m_lpfngetpeername};
};

// Listens on a port that the system chooses.
inline oxSockAddr ListenOnLoopback(oxSocket& listener, int backlog = 128) {
    const oxSockAddr any(LOOPBACK);
    EXPECT_TRUE(listener.Create(AF_INET, SOCK_STREAM, 0, any.Raw(), oxSockAddr::LENGTH));
    EXPECT_TRUE(listener.Listen(backlog));
    return listener.GetLocalAddress();
}

// A connected pair: one end connected, the other accepted.
inline void MakePair(oxSocket& connected, oxSocket& accepted) {
    oxSocket listener;
    const oxSockAddr address = ListenOnLoopback(listener);
    ASSERT_TRUE(connected.Create(AF_INET, SOCK_STREAM, 0));
    ASSERT_TRUE(connected.Connect(address.Raw(), oxSockAddr::LENGTH));
    ASSERT_TRUE(listener.Accept(accepted, nullptr, nullptr));
}
