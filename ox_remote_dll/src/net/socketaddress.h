// An IPv4 socket address.
#pragma once

#include <netinet/in.h>
#include <sys/socket.h>

#include <cstdint>
#include <string>

// A value of exactly the 16 bytes of an IPv4 sockaddr_in. Numbers go in and come out in host order.
//
// A host text is taken as a dotted address first. Only a text that gives the all-ones value is looked up by name, so
// 255.255.255.255 goes to the name service too; a look-up that fails leaves the address all ones. Look-ups go through
// the socket's function table and may block.
class oxSockAddr {
public:
    oxSockAddr(std::uint32_t address = 0, std::uint16_t port = 0, int family = AF_INET);
    // The port of a named service ("http", "tcp"); left 0 when the service is not known.
    oxSockAddr(std::uint32_t address, const char* service, const char* protocol);
    oxSockAddr(const char* host, std::uint16_t port);
    oxSockAddr(const char* host, const char* service, const char* protocol);

    std::uint32_t Address() const;
    std::uint16_t Port() const;
    int Family() const { return m_address.sin_family; }
    std::string Dotted() const;

    sockaddr* Raw() { return reinterpret_cast<sockaddr*>(&m_address); }
    const sockaddr* Raw() const { return reinterpret_cast<const sockaddr*>(&m_address); }
    static constexpr socklen_t LENGTH = 16;

    // The host name of the address: "unknown" for the zero address, the empty text when it has no reverse entry. The
    // text belongs to the calling thread and is good until its next call.
    const char* HostName() const;

private:
    void Resolve(const char* host);
    void SetService(const char* service, const char* protocol);

    sockaddr_in m_address{};
};
static_assert(sizeof(oxSockAddr) == oxSockAddr::LENGTH);
