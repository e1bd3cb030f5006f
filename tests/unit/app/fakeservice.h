// A remote service that answers as a test tells it.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>

#include <functional>
#include <mutex>
#include <stdexcept>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/file.h"

// Listens on loopback and serves one connection after the other.
class FakeService {
public:
    // The service's end of one connection.
    class Peer {
    public:
        explicit Peer(UniqueFd socket) : m_socket(std::move(socket)) {}

        // False when the client is gone.
        bool Send(std::string_view text) const {
            while (!text.empty()) {
                const ssize_t sent = ::send(m_socket.Get(), text.data(), text.size(), MSG_NOSIGNAL);
                if (sent < 0)
                    return false;
                text.remove_prefix(static_cast<std::size_t>(sent));
            }
            return true;
        }
        // One request: up to the marker, or to the end.
        std::string ReadRequest() const {
            std::string request;
            char block[65536];
            while (!request.ends_with("|EOT")) {
                const ssize_t count = ::recv(m_socket.Get(), block, sizeof block, 0);
                if (count <= 0)
                    break;
                request.append(block, static_cast<std::size_t>(count));
            }
            return request;
        }
        // True when the client ends the connection within the time; -1 waits without a limit.
        bool WaitForEnd(int milliseconds = -1) const {
            pollfd entry{m_socket.Get(), POLLRDHUP, 0};
            return ::poll(&entry, 1, milliseconds) > 0;
        }
        // Ends the connection with a reset.
        void Abort() {
            const linger now{.l_onoff = 1, .l_linger = 0};
            ::setsockopt(m_socket.Get(), SOL_SOCKET, SO_LINGER, &now, sizeof now);
            m_socket.Reset();
        }

    private:
        UniqueFd m_socket;
    };

    // The connection is closed when the function returns.
    using Serve = std::function<void(Peer& peer, const std::string& request)>;

    // With a receive buffer other than 0, of about that many bytes.
    explicit FakeService(Serve serve, bool readsRequests = true, int receiveBuffer = 0)
        : m_serve(std::move(serve)), m_readsRequests(readsRequests) {
        if (receiveBuffer != 0)
            ::setsockopt(m_listener.Get(), SOL_SOCKET, SO_RCVBUF, &receiveBuffer, sizeof receiveBuffer);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        auto* raw = reinterpret_cast<sockaddr*>(&address);
        if (::bind(m_listener.Get(), raw, length) != 0 || ::listen(m_listener.Get(), SOMAXCONN) != 0 ||
            ::getsockname(m_listener.Get(), raw, &length) != 0)
            throw std::runtime_error("loopback");
        m_port = ntohs(address.sin_port);
        m_thread = std::jthread([this] { Run(); });
    }
    // Answers every request with this text.
    explicit FakeService(std::string answer)
        : FakeService([answer = std::move(answer)](Peer& peer, const std::string&) { peer.Send(answer); }) {}
    ~FakeService() { ::shutdown(m_listener.Get(), SHUT_RDWR); }

    int Port() const { return m_port; }
    std::string Address() const { return "127.0.0.1:" + std::to_string(m_port); }
    std::vector<std::string> Requests() {
        const std::scoped_lock lock(m_mutex);
        return m_requests;
    }

private:
    void Run() {
        for (;;) {
            UniqueFd socket(::accept4(m_listener.Get(), nullptr, nullptr, SOCK_CLOEXEC));
            if (!socket)
                return;
            Peer peer(std::move(socket));
            const std::string request = m_readsRequests ? peer.ReadRequest() : std::string();
            {
                const std::scoped_lock lock(m_mutex);
                m_requests.push_back(request);
            }
            m_serve(peer, request);
        }
    }

    const Serve m_serve;
    const bool m_readsRequests;
    UniqueFd m_listener{::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    int m_port = 0;
    std::mutex m_mutex;
    std::vector<std::string> m_requests;
    std::jthread m_thread;  // ended before the rest goes
};
