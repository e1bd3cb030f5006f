#include "net/resolver.h"

#include <netdb.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <vector>

#include "net/socket.h"
#include "platform/mutex.h"

namespace {
// Guards the shared results of the C library's plain look-ups, which a table entry may stand for.
MMutex s_lookUpMutex;
constexpr std::size_t LOOK_UP_BUFFER = 8192;
constexpr std::size_t MAX_LOOK_UP_BUFFER = std::size_t{1024} * 1024;

// Makes a re-entrant look-up with as much room as its result needs. Each caller waits for its own answer only: a name
// service that is slow for one thread holds up no other.
template <typename LookUp>
const hostent* LookUpHost(hostent& entry, std::vector<char>& room, LookUp lookUp) {
    hostent* found = nullptr;
    int error = 0;
    for (room.resize(LOOK_UP_BUFFER);; room.resize(room.size() * 2)) {
        const int result = lookUp(&entry, room.data(), room.size(), &found, &error);
        if (result != ERANGE || room.size() >= MAX_LOOK_UP_BUFFER)
            return result == 0 ? found : nullptr;
    }
}
char s_hostName[oxSocket::MAX_HOSTNAME + 1];
}  // namespace

bool oxResolver::FindHost(const char* host, in_addr& address, sa_family_t& family) {
    std::unique_lock lock(s_lookUpMutex, std::defer_lock);
    hostent own;
    std::vector<char> room;
    const hostent* entry;
    if (oxSocket::m_lpfngethostbyname == ::gethostbyname) {
        entry = LookUpHost(own, room, [host](auto... arguments) { return gethostbyname_r(host, arguments...); });
    } else {
        lock.lock();
        entry = oxSocket::m_lpfngethostbyname(host);
    }
    if (entry == nullptr || entry->h_addr_list == nullptr || entry->h_addr_list[0] == nullptr)
        return false;
    const auto length = static_cast<std::size_t>(std::max(entry->h_length, 0));
    std::memcpy(&address, entry->h_addr_list[0], std::min(length, sizeof address));
    family = static_cast<sa_family_t>(entry->h_addrtype);
    return true;
}

std::string oxResolver::NameOf(in_addr address, sa_family_t family) {
    std::unique_lock lock(s_lookUpMutex, std::defer_lock);
    hostent own;
    std::vector<char> room;
    const hostent* entry;
    if (oxSocket::m_lpfngethostbyaddr == ::gethostbyaddr) {
        entry = LookUpHost(own, room, [&address, family](auto... arguments) {
            return gethostbyaddr_r(&address, sizeof address, family, arguments...);
        });
    } else {
        lock.lock();
        entry = oxSocket::m_lpfngethostbyaddr(&address, sizeof address, family);
    }
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
