#include "net/socket.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <mutex>

#include "net/resolver.h"

int (*oxSocket::m_lpfnsocket)(int, int, int) = ::socket;
int (*oxSocket::m_lpfnshutdown)(int, int) = ::shutdown;
int (*oxSocket::m_lpfnlisten)(int, int) = ::listen;
hostent* (*oxSocket::m_lpfngethostbyname)(const char*) = ::gethostbyname;
hostent* (*oxSocket::m_lpfngethostbyaddr)(const void*, socklen_t, int) = ::gethostbyaddr;
servent* (*oxSocket::m_lpfngetservbyname)(const char*, const char*) = ::getservbyname;
int (*oxSocket::m_lpfnclose)(int) = ::close;
int (*oxSocket::m_lpfnioctl)(int, unsigned long, ...) = ::ioctl;
int (*oxSocket::m_lpfnconnect)(int, const sockaddr*, socklen_t) = ::connect;
int (*oxSocket::m_lpfnbind)(int, const sockaddr*, socklen_t) = ::bind;
ssize_t (*oxSocket::m_lpfnsend)(int, const void*, size_t, int) = ::send;
ssize_t (*oxSocket::m_lpfnsendto)(int, const void*, size_t, int, const sockaddr*, socklen_t) = ::sendto;
ssize_t (*oxSocket::m_lpfnrecv)(int, void*, size_t, int) = ::recv;
ssize_t (*oxSocket::m_lpfnrecvfrom)(int, void*, size_t, int, sockaddr*, socklen_t*) = ::recvfrom;
int (*oxSocket::m_lpfnaccept)(int, sockaddr*, socklen_t*) = ::accept;
int (*oxSocket::m_lpfnselect)(int, fd_set*, fd_set*, fd_set*, timeval*) = ::select;
int (*oxSocket::m_lpfnsetsockopt)(int, int, int, const void*, socklen_t) = ::setsockopt;
int (*oxSocket::m_lpfngetsockopt)(int, int, int, void*, socklen_t*) = ::getsockopt;
int (*oxSocket::m_lpfngetsockname)(int, sockaddr*, socklen_t*) = ::getsockname;
int (*oxSocket::m_lpfngetpeername)(int, sockaddr*, socklen_t*) = ::getpeername;

std::atomic<int> oxSocket::m_useCnt{0};
char oxSocket::m_szHostname[MAX_HOSTNAME + 1] = "";
std::atomic<bool> oxSocket::m_bDNSAvail{false};

namespace {
// Makes the call, again as long as a signal interrupts it.
template <typename Function, typename... Arguments>
auto Repeat(Function function, Arguments... arguments) {
    auto result = function(arguments...);
    while (result == -1 && errno == EINTR)
        result = function(arguments...);
    return result;
}

// The bytes to send; false with errno for a length that is none.
bool CountBytes(const void* buffer, int length, std::size_t& count) {
    if (length == -1) {
        count = std::strlen(static_cast<const char*>(buffer));
        return true;
    }
    if (length < 0) {
        errno = EINVAL;
        return false;
    }
    count = static_cast<std::size_t>(length);
    return true;
}

// Room for input; false with errno for a length that is none.
bool IsRoom(int length) {
    if (length < 0)
        errno = EINVAL;
    return length >= 0;
}

// An interrupted connect goes on by itself: waits for its outcome.
int FinishConnect(int handle) {
    if (WaitWritable(handle) != Readiness::Ready)
        return -1;
    int error = 0;
    socklen_t length = sizeof error;
    if (oxSocket::m_lpfngetsockopt(handle, SOL_SOCKET, SO_ERROR, &error, &length) == -1)
        return -1;
    errno = error;
    return error == 0 ? 0 : -1;
}

// Accepts a connection whose descriptor no concurrently started program inherits. An accept function put into the table
// cannot take the flag, so there it is set a moment later.
int AcceptClosedOnExec(int handle, sockaddr* address, socklen_t* length) {
    if (oxSocket::m_lpfnaccept == ::accept)
        return Repeat(::accept4, handle, address, length, SOCK_CLOEXEC);
    const int accepted = Repeat(oxSocket::m_lpfnaccept, handle, address, length);
    if (accepted != -1)
        ::fcntl(accepted, F_SETFD, FD_CLOEXEC);
    return accepted;
}
}  // namespace

int oxSockError::GetLastError() {
    m_errorCode = errno;
    return ErrorCode();
}

// One operation that is under way on a descriptor. The last one on a descriptor that the socket has given up closes it.
class oxSocket::Use {
public:
    enum Kind { OPERATION, TAKE_HANDLE };  // the second also takes the handle away from the socket

    explicit Use(oxSocket& socket, Kind kind = OPERATION) : m_socket(socket) {
        std::scoped_lock lock(socket.m_mutex);
        m_handle = socket.m_handle.load();
        if (m_handle == -1)
            return;
        if (kind == TAKE_HANDLE) {
            m_shared = IsUsed();
            socket.m_handle = -1;
        }
        m_next = socket.m_uses;
        socket.m_uses = this;
    }

    ~Use() {
        const int handle = m_handle;
        if (!Leave())
            return;
        const int error = errno;
        m_lpfnclose(handle);
        errno = error;
    }

    Use(const Use&) = delete;
    Use& operator=(const Use&) = delete;

    int Handle() const { return m_handle; }
    // Another operation was under way when the handle was taken.
    bool IsShared() const { return m_shared; }

    // Ends the use early; true when the descriptor is now the caller's to close.
    bool Leave() {
        if (m_handle == -1)
            return false;
        std::scoped_lock lock(m_socket.m_mutex);
        Use** link = &m_socket.m_uses;
        while (*link != this)
            link = &(*link)->m_next;
        *link = m_next;
        const bool last = m_socket.m_handle != m_handle && !IsUsed();
        m_handle = -1;
        return last;
    }

private:
    // As long as a descriptor is used it is not closed, so its number tells it from any later one.
    bool IsUsed() const {
        for (const Use* use = m_socket.m_uses; use != nullptr; use = use->m_next)
            if (use->m_handle == m_handle)
                return true;
        return false;
    }

    oxSocket& m_socket;
    int m_handle = -1;
    bool m_shared = false;
    Use* m_next = nullptr;
};

oxSocket::oxSocket() {
    if (m_useCnt.fetch_add(1) == 0)
        LookUpHost();
}

oxSocket::~oxSocket() {
    oxSocket::Close();
    m_useCnt.fetch_sub(1);
}

void oxSocket::LookUpHost() {
    in_addr address{};
    sa_family_t family = AF_INET;
    m_bDNSAvail = oxResolver::ReadHostName(m_szHostname, sizeof m_szHostname) &&
                  oxResolver::FindHost(m_szHostname, address, family);
}

int oxSocket::GetLastError() {
    return oxSockError::GetLastError();
}

bool oxSocket::Result(int result) {
    m_errorCode = result;
    if (result == -1)
        return GetLastError() == 0;
    return result == 0;
}

// For the operations that give a count: on success the error code stays.
int oxSocket::Count(ssize_t count) {
    if (count == -1)
        GetLastError();
    return static_cast<int>(count);
}

bool oxSocket::TakeIn(int handle, int family, int type, int protocol) {
    {
        std::scoped_lock lock(m_mutex);
        m_handle = handle;
    }
    m_family = family;
    m_type = type;
    m_protocol = protocol;
    return handle != -1;
}

oxSockAddr oxSocket::GetLocalAddress() {
    oxSockAddr address;
    socklen_t length = oxSockAddr::LENGTH;
    GetSockName(address.Raw(), &length);
    return address;
}

bool oxSocket::Create(int family, int type, int protocol) {
    if (GetHandle() != -1)
        Close();
    const int handle = Repeat(m_lpfnsocket, family, type | SOCK_CLOEXEC, protocol);
    if (handle == -1) {
        GetLastError();
        return false;
    }
    m_errorCode = 0;
    return TakeIn(handle, family, type, protocol);
}

bool oxSocket::Close() {
    Use use(*this, Use::TAKE_HANDLE);
    const int handle = use.Handle();
    if (handle == -1)
        return true;
    const bool shared = use.IsShared();
    if (shared) {
        // A connect that is about to begin would not notice that the socket was shut down before it.
        const timeval soon{.tv_sec = 0, .tv_usec = 1};
        m_lpfnsetsockopt(handle, SOL_SOCKET, SO_SNDTIMEO, &soon, sizeof soon);
        m_lpfnshutdown(handle, SHUT_RDWR);
    }
    if (!use.Leave())
        return true;
    // An interrupted close has closed; the number may belong to another file already.
    const int result = m_lpfnclose(handle);
    return shared || Result(result);  // the error code is the other user's
}

bool oxSocket::Shutdown(int how) {
    Use use(*this);
    return Result(Repeat(m_lpfnshutdown, use.Handle(), how));
}

bool oxSocket::Bind() {
    const oxSockAddr address;
    return Bind(address.Raw(), oxSockAddr::LENGTH, 1);
}

bool oxSocket::Bind(const sockaddr* address, socklen_t length, int attempts) {
    Use use(*this);
    int result;
    do
        result = Repeat(m_lpfnbind, use.Handle(), address, length);
    while (result == -1 && --attempts > 0);
    return Result(result);
}

bool oxSocket::Bind(const char* host, std::uint16_t port) {
    const oxSockAddr address(host, port);
    return Bind(address.Raw(), oxSockAddr::LENGTH, 1);
}

bool oxSocket::Bind(std::uint32_t address, const char* service, const char* protocol) {
    const oxSockAddr local(address, service, protocol);
    return Bind(local.Raw(), oxSockAddr::LENGTH, 1);
}

bool oxSocket::Bind(const char* host, const char* service, const char* protocol) {
    const oxSockAddr address(host, service, protocol);
    return Bind(address.Raw(), oxSockAddr::LENGTH, 1);
}

bool oxSocket::Connect(const sockaddr* address, socklen_t length) {
    Use use(*this);
    int result = m_lpfnconnect(use.Handle(), address, length);
    if (result == -1 && errno == EINTR)
        result = FinishConnect(use.Handle());
    if (GetHandle() != use.Handle()) {  // closed by another thread meanwhile
        errno = ECONNABORTED;
        result = -1;
    }
    return Result(result);
}

bool oxSocket::Listen(int backlog) {
    Use use(*this);
    return Result(Repeat(m_lpfnlisten, use.Handle(), backlog));
}

bool oxSocket::Accept(oxSocket& into, sockaddr* address, socklen_t* length) {
    Use use(*this);
    const int handle = AcceptClosedOnExec(use.Handle(), address, length);
    if (handle == -1) {
        GetLastError();
        return false;
    }
    m_errorCode = 0;
    if (into.GetHandle() != -1)
        into.Close();
    return into.TakeIn(handle, m_family, m_type, m_protocol);
}

int oxSocket::Accept(sockaddr* address, socklen_t* length) {
    Use use(*this);
    const int handle = AcceptClosedOnExec(use.Handle(), address, length);
    if (handle == -1)
        GetLastError();
    return handle;
}

int oxSocket::Send(const void* buffer, int length, int flags) {
    Use use(*this);
    std::size_t bytes = 0;
    ssize_t sent = -1;
    if (CountBytes(buffer, length, bytes))
        sent = Repeat(m_lpfnsend, use.Handle(), buffer, bytes, flags | MSG_NOSIGNAL);
    return Count(sent);
}

int oxSocket::SendTo(const void* buffer, int length, int flags, const sockaddr* to, socklen_t toLength) {
    Use use(*this);
    std::size_t bytes = 0;
    ssize_t sent = -1;
    if (CountBytes(buffer, length, bytes))
        sent = Repeat(m_lpfnsendto, use.Handle(), buffer, bytes, flags | MSG_NOSIGNAL, to, toLength);
    return Count(sent);
}

int oxSocket::SendMsg(const msghdr* message, int flags) {
    Use use(*this);
    return Count(Repeat(::sendmsg, use.Handle(), message, flags | MSG_NOSIGNAL));
}

int oxSocket::Recv(void* buffer, int length, int flags) {
    Use use(*this);
    ssize_t received = -1;
    if (IsRoom(length))
        received = Repeat(m_lpfnrecv, use.Handle(), buffer, static_cast<std::size_t>(length), flags);
    return Count(received);
}

int oxSocket::RecvFrom(void* buffer, int length, int flags, sockaddr* from, socklen_t* fromLength) {
    Use use(*this);
    ssize_t received = -1;
    if (IsRoom(length))
        received =
            Repeat(m_lpfnrecvfrom, use.Handle(), buffer, static_cast<std::size_t>(length), flags, from, fromLength);
    return Count(received);
}

int oxSocket::Peek(void* buffer, int length) {
    return Recv(buffer, length, MSG_PEEK);
}

bool oxSocket::SetSockOpt(int level, int name, const void* value, socklen_t length) {
    Use use(*this);
    return Result(Repeat(m_lpfnsetsockopt, use.Handle(), level, name, value, length));
}

bool oxSocket::GetSockOpt(int level, int name, void* value, socklen_t* length) {
    Use use(*this);
    return Result(Repeat(m_lpfngetsockopt, use.Handle(), level, name, value, length));
}

bool oxSocket::GetSockName(sockaddr* address, socklen_t* length) {
    Use use(*this);
    return Result(Repeat(m_lpfngetsockname, use.Handle(), address, length));
}

const char* oxSocket::GetSockHostName() {
    oxSockAddr address;
    socklen_t length = oxSockAddr::LENGTH;
    return GetSockName(address.Raw(), &length) ? address.HostName() : nullptr;
}

bool oxSocket::GetPeerName(sockaddr* address, socklen_t* length) {
    Use use(*this);
    return Result(Repeat(m_lpfngetpeername, use.Handle(), address, length));
}

const char* oxSocket::GetPeerHostName() {
    oxSockAddr address;
    socklen_t length = oxSockAddr::LENGTH;
    return GetPeerName(address.Raw(), &length) ? address.HostName() : nullptr;
}

bool oxSocket::IOCtl(unsigned long request, void* argument) {
    Use use(*this);
    return Result(Repeat(m_lpfnioctl, use.Handle(), request, argument));
}

int oxSocket::BytesAvailable() {
    int count = 0;
    return IOCtl(FIONREAD, &count) ? count : -1;
}

bool oxSocket::SetNonBlocking(bool on) {
    int flag = on ? 1 : 0;
    return IOCtl(FIONBIO, &flag);
}

bool oxSocket::SetAsync(bool on) {
    int flag = on ? 1 : 0;
    return IOCtl(FIOASYNC, &flag);
}

bool oxSocket::Create(int family, int type, int protocol, const char* host, std::uint16_t port) {
    if (!Create(family, type, protocol))
        return false;
    return host == nullptr || Bind(host, port);
}

bool oxSocket::Create(int family, int type, int protocol, const sockaddr* address, socklen_t length) {
    return Create(family, type, protocol) && Bind(address, length, 1);
}

bool oxSocket::Connect(const char* host, std::uint16_t port) {
    const oxSockAddr address(host, port);
    m_port = port;
    return Connect(address.Raw(), oxSockAddr::LENGTH);
}

bool oxSocket::Connect(std::uint32_t address, const char* service, const char* protocol) {
    const oxSockAddr peer(address, service, protocol);
    return Connect(peer.Raw(), oxSockAddr::LENGTH);
}

bool oxSocket::Connect(const char* host, const char* service, const char* protocol) {
    const oxSockAddr address(host, service, protocol);
    return Connect(address.Raw(), oxSockAddr::LENGTH);
}

Readiness oxSocket::WaitReadable(WaitLimit limit) {
    Use use(*this);
    if (use.Handle() == -1) {
        errno = EBADF;
        return Readiness::Failed;
    }
    return ::WaitReadable(use.Handle(), limit);
}

Readiness oxSocket::WaitWritable(WaitLimit limit) {
    Use use(*this);
    if (use.Handle() == -1) {
        errno = EBADF;
        return Readiness::Failed;
    }
    return ::WaitWritable(use.Handle(), limit);
}
