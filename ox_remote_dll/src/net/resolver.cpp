#include "net/resolver.h"

#include <netdb.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <mutex>

#include "net/socket.h"
#include "platform/mutex.h"

namespace {
MMutex s_lookUpMutex;
char s_hostName[oxSocket::MAX_HOSTNAME + 1];
}  // namespace

bool oxResolver::FindHost(const char* host, in_addr& address, sa_family_t& family) {
    std::scoped_lock lock(s_lookUpMutex);
    const hostent* entry = oxSocket::m_lpfngethostbyname(host);
    if (entry == nullptr || entry->h_addr_list == nullptr || entry->h_addr_list[0] == nullptr)
        return false;
    const auto length = static_cast<std::size_t>(std::max(entry->h_length, 0));
    std::memcpy(&address, entry->h_addr_list[0], std::min(length, sizeof address));
    family = static_cast<sa_family_t>(entry->h_addrtype);
    return true;
}

std::string oxResolver::NameOf(in_addr address, sa_family_t family) {
    std::scoped_lock lock(s_lookUpMutex);
    const hostent* entry = oxSocket::m_lpfngethostbyaddr(&address, sizeof address, family);
    if (entry == nullptr || entry->h_name == nullptr)
        return {};
    return entry->h_name;
}

bool oxResolver::FindService(const char* service, const char* protocol, in_port_t& port) {
    if (service == nullptr)
        return false;
    std::scoped_lock lock(s_lookUpMutex);
    const servent* entry = oxSocket::m_lpfngetservbyname(service, protocol);
    if (entry == nullptr)
        return false;
    port = static_cast<in_port_t>(entry->s_port);
    return true;
}

bool oxResolver::ReadHostName(char* name, std::size_t size) {
    const bool known = ::gethostname(name, size) == 0;
    name[size - 1] = '\0';
    return known;
}

void oxResolver::RefreshHostName() {
    std::scoped_lock lock(s_lookUpMutex);
    ReadHostName(s_hostName, sizeof s_hostName);
}
