// What the tests of requests, replies and resources share: connected sockets, a log that keeps its lines, a clock moved
// by hand.
#pragma once

#include <arpa/inet.h>
#include <linux/sockios.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdarg>
#include <cstdio>
#include <mutex>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "net/socket.h"
#include "platform/file.h"
#include "support/errorsink.h"

// The first socket of a process looks up the machine's name; one that stays spares every test that.
inline const oxSocket FIRST_SOCKET;

class LineLog : public oxErrorSink {
public:
    void Error(const char* format, ...) override __attribute__((format(printf, 2, 3))) {
        char text[1024];
        va_list arguments;
        va_start(arguments, format);
        std::vsnprintf(text, sizeof text, format, arguments);
        va_end(arguments);
        m_lines.emplace_back(text);
    }
    const std::vector<std::string>& Lines() const { return m_lines; }

private:
    std::vector<std::string> m_lines;
};

// A connection: an oxSocket on the server's side, a plain descriptor on the peer's.
class Connection {
public:
    enum Kind {
        STREAM,
        // Each send of the peer is received by itself, so a text is cut exactly where the peer cut it.
        PIECES,
        TCP
    };

    explicit Connection(Kind kind = STREAM) {
        if (kind == TCP)
            OpenTcp();
        else
            OpenPair(kind == PIECES ? SOCK_SEQPACKET : SOCK_STREAM);
    }

    oxSocket& Server() { return m_server; }
    int Peer() const { return m_peer.Get(); }

    // False when the server's side is gone.
    bool PeerSend(std::string_view text) {
        while (!text.empty()) {
            const ssize_t sent = ::send(Peer(), text.data(), text.size(), MSG_NOSIGNAL);
            if (sent < 0)
                return false;
            text.remove_prefix(static_cast<std::size_t>(sent));
        }
        return true;
    }
    void PeerEnd() { ::shutdown(Peer(), SHUT_WR); }
    void PeerClose() { m_peer.Reset(); }
    void PeerReset() {
        const linger on{1, 0};
        ::setsockopt(Peer(), SOL_SOCKET, SO_LINGER, &on, sizeof on);
        PeerClose();
    }
    // Until the server has received all that the peer sent.
    void WaitUntilTaken() {
        for (int left = 1; left > 0; ::sched_yield())
            if (::ioctl(Peer(), SIOCOUTQ, &left) != 0)
                throw std::runtime_error("SIOCOUTQ");
    }
    // All that comes, up to the end.
    std::string PeerReadAll() {
        std::string all;
        char block[65536];
        for (;;) {
            const ssize_t count = ::recv(Peer(), block, sizeof block, 0);
            if (count <= 0)
                return all;
            all.append(block, static_cast<std::size_t>(count));
        }
    }

private:
    // The only way into an oxSocket for a descriptor that is open already. The entry is every thread's.
    void Adopt(int descriptor, int family, int type) {
        const std::scoped_lock lock(s_adopting);
        s_prepared = descriptor;
        const auto kept = oxSocket::m_lpfnsocket;
        oxSocket::m_lpfnsocket = [](int, int, int) { return s_prepared; };
        m_server.Create(family, type, 0);
        oxSocket::m_lpfnsocket = kept;
    }

    void OpenPair(int type) {
        int ends[2];
        if (::socketpair(AF_UNIX, type | SOCK_CLOEXEC, 0, ends) != 0)
            throw std::runtime_error("socketpair");
        m_peer.Reset(ends[1]);
        Adopt(ends[0], AF_UNIX, type);
    }
    void OpenTcp() {
        UniqueFd listener(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        auto* raw = reinterpret_cast<sockaddr*>(&address);
        m_peer.Reset(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        if (::bind(listener.Get(), raw, length) != 0 || ::listen(listener.Get(), 1) != 0 ||
            ::getsockname(listener.Get(), raw, &length) != 0 || ::connect(Peer(), raw, length) != 0)
            throw std::runtime_error("loopback");
        Adopt(::accept4(listener.Get(), nullptr, nullptr, SOCK_CLOEXEC), AF_INET, SOCK_STREAM);
    }

    static inline std::mutex s_adopting;
    static inline int s_prepared = -1;
    oxSocket m_server;
    UniqueFd m_peer;
};
