// A browser in a few lines: raw bytes over loopback.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/file.h"

// A port that nothing listens on at the moment.
inline std::uint16_t FreePort() {
    const UniqueFd probe(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    if (bind(probe.Get(), reinterpret_cast<sockaddr*>(&address), length) != 0 ||
        getsockname(probe.Get(), reinterpret_cast<sockaddr*>(&address), &length) != 0)
        return 0;
    return ntohs(address.sin_port);
}

class Client {
public:
    // Connects at once; `Connected` tells. A receive buffer other than 0 is that many bytes.
    explicit Client(std::uint32_t port, std::uint32_t address = INADDR_LOOPBACK, int receiveBuffer = 0) {
        m_socket = UniqueFd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        if (receiveBuffer != 0)
            setsockopt(m_socket.Get(), SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
        const timeval patience{.tv_sec = 60, .tv_usec = 0};  // no test hangs on an answer that never comes
        setsockopt(m_socket.Get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        sockaddr_in to{};
        to.sin_family = AF_INET;
        to.sin_port = htons(static_cast<std::uint16_t>(port));
        to.sin_addr.s_addr = htonl(address);
        m_connected = connect(m_socket.Get(), reinterpret_cast<sockaddr*>(&to), sizeof to) == 0;
    }
    bool Connected() const { return m_connected; }
    int Descriptor() const { return m_socket.Get(); }
    bool Send(std::string_view bytes) const {
        while (!bytes.empty()) {
            const ssize_t sent = send(m_socket.Get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
            if (sent <= 0)
                return false;
            bytes.remove_prefix(static_cast<std::size_t>(sent));
        }
        return true;
    }
    void EndOfInput() const { shutdown(m_socket.Get(), SHUT_WR); }
    // Everything up to the end of the connection; `Reset` tells whether that came as a reset.
    std::string ReadAll() {
        std::string all;
        char block[65536];
        for (;;) {
            const ssize_t count = recv(m_socket.Get(), block, sizeof block, 0);
            if (count < 0 && errno == EINTR)
                continue;
            m_reset = count < 0;
            if (count <= 0)
                return all;
            all.append(block, static_cast<std::size_t>(count));
        }
    }
    bool Reset() const { return m_reset; }
    // Ends the connection with a reset.
    void Abort() {
        const linger now{.l_onoff = 1, .l_linger = 0};
        setsockopt(m_socket.Get(), SOL_SOCKET, SO_LINGER, &now, sizeof now);
        m_socket.Reset();
    }
    void Close() { m_socket.Reset(); }

private:
    UniqueFd m_socket;
    bool m_connected = false;
    bool m_reset = false;
};

inline std::string Ask(std::uint32_t port, std::string_view request) {
    Client client(port);
    client.Send(request);
    return client.ReadAll();
}
