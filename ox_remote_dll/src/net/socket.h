// The wrapper around one Berkeley socket.
#pragma once

#include <netdb.h>
#include <sys/select.h>
#include <sys/socket.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "net/socketaddress.h"
#include "platform/mutex.h"
#include "platform/poll.h"

// Keeps the error number of the last failure.
class oxSockError {
public:
    // Takes the system's current error number (errno) into the error code and returns it.
    virtual int GetLastError();
    int ErrorCode() const { return m_errorCode.load(std::memory_order_relaxed); }

protected:
    ~oxSockError() = default;
    std::atomic<int> m_errorCode{0};
};

// One socket, closed on exec. No operation throws or prints: failures are false, -1 or a null text with the system's
// error number in the error code. The operations that return bool overwrite the error code with their result (success
// clears it); those that return a count or a handle leave it alone on success.
//
// Thread rules: one thread owns a socket. Any other thread may `Close` or `Shutdown` it to make the owner give up: the
// handle reads -1 at once, the connection is shut down both ways so that a blocked call returns, and the descriptor
// itself is closed by whoever uses it last, so its number is not given to another file while the owner may still use
// it. A `Close` that finds an operation under way returns true and leaves the error code to the owner.
//
// Sending never raises SIGPIPE. Interrupted calls are repeated.
class oxSocket : public oxSockError {
public:
    oxSocket();
    int GetLastError() override;
    virtual ~oxSocket();
    oxSocket(const oxSocket&) = delete;
    oxSocket& operator=(const oxSocket&) = delete;

    virtual oxSockAddr GetLocalAddress();
    virtual bool Create(int family, int type, int protocol);
    virtual bool Close();
    virtual bool Shutdown(int how);
    virtual bool Bind();
    // Tries up to `attempts` times, without a pause; the error is the last attempt's.
    virtual bool Bind(const sockaddr* address, socklen_t length, int attempts);
    virtual bool Bind(const char* host, std::uint16_t port);
    virtual bool Bind(std::uint32_t address, const char* service, const char* protocol);
    virtual bool Bind(const char* host, const char* service, const char* protocol);
    // Fails with ECONNABORTED when another thread closed the socket meanwhile.
    virtual bool Connect(const sockaddr* address, socklen_t length);
    virtual bool Listen(int backlog);
    // On success the other object has the new handle and this socket's family, type and protocol; on failure it is
    // untouched.
    virtual bool Accept(oxSocket& into, sockaddr* address, socklen_t* length);
    virtual int Accept(sockaddr* address, socklen_t* length);
    // A length of -1 means up to the terminating zero. The count sent may be smaller than asked for.
    virtual int Send(const void* buffer, int length, int flags);
    virtual int SendTo(const void* buffer, int length, int flags, const sockaddr* to, socklen_t toLength);
    virtual int SendMsg(const msghdr* message, int flags);
    virtual int Recv(void* buffer, int length, int flags);
    virtual int RecvFrom(void* buffer, int length, int flags, sockaddr* from, socklen_t* fromLength);
    virtual int Peek(void* buffer, int length);
    virtual bool SetSockOpt(int level, int name, const void* value, socklen_t length);
    virtual bool GetSockOpt(int level, int name, void* value, socklen_t* length);
    virtual bool GetSockName(sockaddr* address, socklen_t* length);
    // Texts as oxSockAddr::HostName gives them; null when the address could not be read.
    virtual const char* GetSockHostName();
    virtual bool GetPeerName(sockaddr* address, socklen_t* length);
    virtual const char* GetPeerHostName();
    virtual bool IOCtl(unsigned long request, void* argument);
    virtual int BytesAvailable();
    virtual bool SetNonBlocking(bool on);
    virtual bool SetAsync(bool on);

    // Create, then bind when a host text is given.
    bool Create(int family, int type, int protocol, const char* host, std::uint16_t port);
    bool Create(int family, int type, int protocol, const sockaddr* address, socklen_t length);
    // Also remembers the port, as GetPort.
    bool Connect(const char* host, std::uint16_t port);
    bool Connect(std::uint32_t address, const char* service, const char* protocol);
    bool Connect(const char* host, const char* service, const char* protocol);

    // -1 when no socket is open, or another thread closed it.
    int GetHandle() const { return m_handle.load(); }
    std::uint32_t GetPort() const { return m_port; }
    int GetFamily() const { return m_family; }
    int GetType() const { return m_type; }
    int GetProtocol() const { return m_protocol; }

    // Waits until the socket can be read (written); a `Close` by another thread ends the wait. Failed when no socket is
    // open; look at GetHandle after every wait.
    Readiness WaitReadable(WaitLimit limit = std::nullopt);
    Readiness WaitWritable(WaitLimit limit = std::nullopt);

    // The use count of live sockets, and the name of this machine, read when the count rises to 1.
    static int UseCount() { return m_useCnt.load(); }
    static const char* HostName() { return m_szHostname; }
    static bool IsDNSAvailable() { return m_bDNSAvail.load(); }

    // The socket calls that every operation goes through (SendMsg alone calls sendmsg directly).
    static int (*m_lpfnsocket)(int, int, int);
    static int (*m_lpfnshutdown)(int, int);
    static int (*m_lpfnlisten)(int, int);
    static hostent* (*m_lpfngethostbyname)(const char*);
    static hostent* (*m_lpfngethostbyaddr)(const void*, socklen_t, int);
    static servent* (*m_lpfngetservbyname)(const char*, const char*);
    static int (*m_lpfnclose)(int);
    static int (*m_lpfnioctl)(int, unsigned long, ...);
    static int (*m_lpfnconnect)(int, const sockaddr*, socklen_t);
    static int (*m_lpfnbind)(int, const sockaddr*, socklen_t);
    static ssize_t (*m_lpfnsend)(int, const void*, size_t, int);
    static ssize_t (*m_lpfnsendto)(int, const void*, size_t, int, const sockaddr*, socklen_t);
    static ssize_t (*m_lpfnrecv)(int, void*, size_t, int);
    static ssize_t (*m_lpfnrecvfrom)(int, void*, size_t, int, sockaddr*, socklen_t*);
    static int (*m_lpfnaccept)(int, sockaddr*, socklen_t*);
    static int (*m_lpfnselect)(int, fd_set*, fd_set*, fd_set*, timeval*);
    static int (*m_lpfnsetsockopt)(int, int, int, const void*, socklen_t);
    static int (*m_lpfngetsockopt)(int, int, int, void*, socklen_t*);
    static int (*m_lpfngetsockname)(int, sockaddr*, socklen_t*);
    static int (*m_lpfngetpeername)(int, sockaddr*, socklen_t*);

    static constexpr std::size_t MAX_HOSTNAME = 259;

private:
    class Use;  // an operation that is under way; keeps the descriptor open
    bool Result(int result);
    int Count(ssize_t count);
    bool TakeIn(int handle, int family, int type, int protocol);
    static void LookUpHost();

    // Guards the two below; never held over a system call.
    MMutex m_mutex;
    std::atomic<int> m_handle{-1};  // changed under the mutex, read without it
    Use* m_uses = nullptr;          // the operations under way, on the stacks of their threads

    std::uint32_t m_port = 0;
    int m_family = 0;
    int m_type = 0;
    int m_protocol = 0;

    static std::atomic<int> m_useCnt;
    static char m_szHostname[MAX_HOSTNAME + 1];
    static std::atomic<bool> m_bDNSAvail;
};
