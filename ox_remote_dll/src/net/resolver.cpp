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

// One look-up of a host. The C library's own function is called in its re-entrant form, with as much room as the result
// needs, so each caller waits for its own answer only: a name service that is slow for one thread holds up no other.
// Another function in the table is called as it is, one call at a time.
class HostLookUp {
public:
    template <typename Function, typename Reentrant, typename... Arguments>
    HostLookUp(Function entry, Function own, Reentrant reentrant, Arguments... arguments) {
        if (entry != own) {
            m_lock.lock();
            m_found = entry(arguments...);
            return;
        }
        int result = ERANGE;
        int error = 0;
        hostent* found = nullptr;
        for (std::size_t room = LOOK_UP_BUFFER; result == ERANGE && room <= MAX_LOOK_UP_BUFFER; room *= 2) {
            m_room.resize(room);
            result = reentrant(arguments..., &m_own, m_room.data(), m_room.size(), &found, &error);
        }
        m_found = result == 0 ? found : nullptr;
    }
    // Null when nothing was found; lives as long as this object.
    const hostent* Found() const { return m_found; }

private:
    std::unique_lock<MMutex> m_lock{s_lookUpMutex, std::defer_lock};
    hostent m_own{};
    std::vector<char> m_room;
    const hostent* m_found = nullptr;
};

char s_hostName[oxSocket::MAX_HOSTNAME + 1];
}  // namespace

bool oxResolver::FindHost(const char* host, in_addr& address, sa_family_t& family) {
    const HostLookUp lookUp(oxSocket::m_lpfngethostbyname, &::gethostbyname, &::gethostbyname_r, host);
    const hostent* entry = lookUp.Found();
    if (entry == nullptr || entry->h_addr_list == nullptr || entry->h_addr_list[0] == nullptr)
        return false;
    const auto length = static_cast<std::size_t>(std::max(entry->h_length, 0));
    std::memcpy(&address, entry->h_addr_list[0], std::min(length, sizeof address));
    family = static_cast<sa_family_t>(entry->h_addrtype);
    return true;
}

std::string oxResolver::NameOf(in_addr address, sa_family_t family) {
    const HostLookUp lookUp(oxSocket::m_lpfngethostbyaddr, &::gethostbyaddr, &::gethostbyaddr_r, &address,
                            socklen_t{sizeof address}, int{family});
    const hostent* entry = lookUp.Found();
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
