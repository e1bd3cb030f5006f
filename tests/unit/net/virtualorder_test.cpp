// The sockets' virtual operations keep their places: programs that were built against an older library call by them.
#include <gtest/gtest.h>

#include <type_traits>

#include "net/asynchsocket.h"
#include "testing/slots.h"

namespace {
constexpr std::size_t BEHIND_OX_SOCKET = 32;
}

TEST(OxSockErrorOrder, GetLastErrorIsTheOnlyOne) {
    EXPECT_EQ(0u, SlotOf(&oxSockError::GetLastError));
    EXPECT_FALSE(std::has_virtual_destructor_v<oxSockError>);
}

TEST(OxSocketOrder, OperationsStandInTheirPlaces) {
    using S = oxSocket;
    using Length = socklen_t*;
    EXPECT_TRUE(std::has_virtual_destructor_v<S>);  // places 1 and 2
    const std::size_t places[] = {
        SlotOf(&S::GetLocalAddress),
        SlotOf<bool(int, int, int)>(&S::Create),
        SlotOf(&S::Close),
        SlotOf(&S::Shutdown),
        SlotOf<bool()>(&S::Bind),
        SlotOf<bool(const sockaddr*, socklen_t, int)>(&S::Bind),
        SlotOf<bool(const char*, std::uint16_t)>(&S::Bind),
        SlotOf<bool(std::uint32_t, const char*, const char*)>(&S::Bind),
        SlotOf<bool(const char*, const char*, const char*)>(&S::Bind),
        SlotOf<bool(const sockaddr*, socklen_t)>(&S::Connect),
        SlotOf(&S::Listen),
        SlotOf<bool(S&, sockaddr*, Length)>(&S::Accept),
        SlotOf<int(sockaddr*, Length)>(&S::Accept),
        SlotOf(&S::Send),
        SlotOf(&S::SendTo),
        SlotOf(&S::SendMsg),
        SlotOf(&S::Recv),
        SlotOf(&S::RecvFrom),
        SlotOf(&S::Peek),
        SlotOf(&S::SetSockOpt),
        SlotOf(&S::GetSockOpt),
        SlotOf(&S::GetSockName),
        SlotOf(&S::GetSockHostName),
        SlotOf(&S::GetPeerName),
        SlotOf(&S::GetPeerHostName),
        SlotOf(&S::IOCtl),
        SlotOf(&S::BytesAvailable),
        SlotOf(&S::SetNonBlocking),
        SlotOf(&S::SetAsync),
    };
    EXPECT_EQ(0u, SlotOf(&S::GetLastError));
    std::size_t expected = 3;
    for (const std::size_t place : places)
        EXPECT_EQ(expected++, place);
    EXPECT_EQ(BEHIND_OX_SOCKET, expected);
}

TEST(OxAsynchSocketOrder, ItsOwnOperationsFollowThoseOfTheSocket) {
    using S = oxAsynchSocket;
    const std::size_t places[] = {
        SlotOf(&S::SetAsyncSelect), SlotOf(&S::OnReserved), SlotOf(&S::OnRead),    SlotOf(&S::OnWrite),
        SlotOf(&S::OnOutOfBand),    SlotOf(&S::OnAccept),   SlotOf(&S::OnConnect), SlotOf(&S::OnClose),
    };
    std::size_t expected = BEHIND_OX_SOCKET;
    for (const std::size_t place : places)
        EXPECT_EQ(expected++, place);
}
