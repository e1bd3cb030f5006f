#include "net/socketaddress.h"

#include <arpa/inet.h>

#include "net/resolver.h"

oxSockAddr::oxSockAddr(std::uint32_t address, std::uint16_t port, int family) {
    m_address.sin_family = static_cast<sa_family_t>(family);
    m_address.sin_port = htons(port);
    m_address.sin_addr.s_addr = htonl(address);
}

oxSockAddr::oxSockAddr(std::uint32_t address, const char* service, const char* protocol) : oxSockAddr(address) {
    SetService(service, protocol);
}

oxSockAddr::oxSockAddr(const char* host, std::uint16_t port) : oxSockAddr(INADDR_ANY, port) {
    Resolve(host);
}

oxSockAddr::oxSockAddr(const char* host, const char* service, const char* protocol) : oxSockAddr(INADDR_ANY) {
    Resolve(host);
    SetService(service, protocol);
}

std::uint32_t oxSockAddr::Address() const {
    return ntohl(m_address.sin_addr.s_addr);
}

std::uint16_t oxSockAddr::Port() const {
    return ntohs(m_address.sin_port);
}

std::string oxSockAddr::Dotted() const {
    char text[INET_ADDRSTRLEN] = "";
    ::inet_ntop(AF_INET, &m_address.sin_addr, text, sizeof text);
    return text;
}

const char* oxSockAddr::HostName() const {
    // This machine's name is read for the zero address, and on purpose not given: it would pretend to know who is
    // there.
    if (m_address.sin_addr.s_addr == INADDR_ANY) {
        oxResolver::RefreshHostName();
        return "unknown";
    }
    static thread_local std::string t_name;
    t_name = oxResolver::NameOf(m_address.sin_addr, m_address.sin_family);
    return t_name.c_str();
}

void oxSockAddr::Resolve(const char* host) {
    m_address.sin_addr.s_addr = INADDR_NONE;
    if (host == nullptr)
        return;
    m_address.sin_addr.s_addr = ::inet_addr(host);
    // The all-ones address cannot be told from a text that is no address: it is looked up by name as well.
    if (m_address.sin_addr.s_addr == INADDR_NONE)
        oxResolver::FindHost(host, m_address.sin_addr, m_address.sin_family);
}

void oxSockAddr::SetService(const char* service, const char* protocol) {
    oxResolver::FindService(service, protocol, m_address.sin_port);
}
