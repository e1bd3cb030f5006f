// The client of the remote service.
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "app/oxxhttpserver.h"
#include "app/remotereply.h"
#include "net/resolver.h"
#include "platform/text.h"
#include "remotescript.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr std::string_view EMPTY_ARGUMENT = "x";
constexpr std::size_t RECEIVE_BUFFER = oxRemoteReply::MAX_REPLY;
// What is read and dropped of a reply that is too large.
constexpr int DRAIN_BYTES = 4;
constexpr int DRAIN_READS = 10;
constexpr milliseconds LONGEST_EXCHANGE = std::chrono::hours(24 * 365);

std::string RequestLine(std::string_view contextString, int command, std::string_view argumentText) {
    std::string line(contextString);
    line += oxRemoteReply::SEPARATOR;
    line += IntToText(command);
    line += oxRemoteReply::SEPARATOR;
    line += argumentText.empty() ? EMPTY_ARGUMENT : argumentText;
    line += oxRemoteReply::SEPARATOR;
    line += oxRemoteReply::END_MARKER;
    return line;
}

// A machine whose own name the name service does not know reaches itself all the same.
oxSockAddr FindAddress(const oxRemoteAddress& remote) {
    const oxSockAddr address(remote.host.c_str(), remote.port);
    char ownName[oxSocket::MAX_HOSTNAME + 1] = "";
    if (address.Address() == INADDR_NONE && oxResolver::ReadHostName(ownName, sizeof ownName) && remote.host == ownName)
        return {INADDR_LOOPBACK, remote.port};
    return address;
}

// One exchange of request and reply. Whatever the service does, all of it ends within the time-out times the retries,
// counted from the construction, and soon after nobody waits for the answer any more.
class Exchange {
public:
    Exchange(oxHttpErrorLog& log, const oxxSetup& setup) : m_log(log), m_end(steady_clock::now() + Patience(setup)) {}

    // Makes and connects the socket; 0, or the error number of what failed.
    int Connect(oxSocket& socket, const oxSockAddr& address) const {
        if (!socket.Create(AF_INET, SOCK_STREAM, IPPROTO_TCP))
            return socket.ErrorCode();
        const int on = 1;
        socket.SetSockOpt(IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
        socket.SetSockOpt(SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
        if (!socket.SetNonBlocking(true))
            return socket.ErrorCode();
        if (socket.Connect(address.Raw(), oxSockAddr::LENGTH))
            return 0;
        if (socket.ErrorCode() != EINPROGRESS)
            return socket.ErrorCode();
        const Readiness outcome = Await(socket, &oxSocket::WaitWritable);
        if (outcome != Readiness::Ready)
            return outcome == Readiness::TimedOut ? ETIMEDOUT : socket.GetLastError();
        int error = 0;
        socklen_t length = sizeof error;
        return socket.GetSockOpt(SOL_SOCKET, SO_ERROR, &error, &length) ? error : socket.ErrorCode();
    }

    // Gives up silently: what went wrong shows when the reply is read.
    void Send(oxSocket& socket, std::string_view text) const {
        while (!text.empty()) {
            const int sent = socket.Send(text.data(), static_cast<int>(text.size()), MSG_DONTWAIT);
            if (sent >= 0)
                text.remove_prefix(static_cast<std::size_t>(sent));
            else if (socket.ErrorCode() != EAGAIN || Await(socket, &oxSocket::WaitWritable) != Readiness::Ready)
                return;
        }
    }

    int ProcessReply(oxSocket& socket, char* reply, std::size_t replySize) const {
        // As many waits of the time-out as there are retries are one wait for what is left.
        if (Await(socket, &oxSocket::WaitReadable) != Readiness::Ready || socket.GetHandle() == -1)
            return oxxHttpServer::ERS_UNREACHABLE;
        char buffer[RECEIVE_BUFFER] = {};
        if (!Receive(socket, buffer, sizeof buffer)) {
            m_log.Log(1, "oxxHttpServer::ProcessReply : unable to receive request.\n");
            return oxxHttpServer::ERS_UNREACHABLE;
        }
        oxRemoteReply parsed;
        if (!parsed.Parse({buffer, sizeof buffer})) {
            m_log.Log(1, "oxxHttpServer::ProcessReply : unable to parse relpy.\n");
            return oxxHttpServer::ERS_UNREACHABLE;
        }
        CopyText(reply, replySize, parsed.Text());
        return parsed.Status();
    }

    bool Receive(oxSocket& socket, char* buffer, std::size_t size) const {
        std::size_t count = 0;
        for (;;) {
            int arrived = socket.Recv(buffer + count, static_cast<int>(size - count), MSG_DONTWAIT);
            if (arrived < 0 && socket.ErrorCode() == EAGAIN) {
                const Readiness outcome = Await(socket, &oxSocket::WaitReadable);
                if (outcome == Readiness::Ready)
                    continue;
                if (outcome == Readiness::Failed)
                    socket.GetLastError();
            }
            if (arrived < 0)
                return FailReceive(socket.ErrorCode());
            if (arrived == 0)
                return true;
            const std::size_t before = count;
            count += static_cast<std::size_t>(arrived);
            if (count == size)
                return FailTooLarge(socket);
            buffer[count] = '\0';
            // The marker may have begun in what came before.
            const std::size_t from = before - std::min(before, oxRemoteReply::END_MARKER.size() - 1);
            if (std::string_view(buffer + from, count - from).find(oxRemoteReply::END_MARKER) != std::string_view::npos)
                return true;
        }
    }

private:
    static milliseconds Patience(const oxxSetup& setup) {
        const auto longest = std::chrono::duration_cast<std::chrono::seconds>(LONGEST_EXCHANGE);
        return std::min(std::chrono::seconds(setup.ersTimeout) * std::int64_t{setup.ersRetries}, longest);
    }
    // Timed out also when the script that asked has come to its end, or is to end.
    Readiness Await(oxSocket& socket, Readiness (oxSocket::*wait)(WaitLimit)) const {
        for (;;) {
            const milliseconds left = Left();
            const Readiness outcome = (socket.*wait)(std::min(left, oxRemoteScript::STOP_TICK));
            if (outcome != Readiness::TimedOut || left <= oxRemoteScript::STOP_TICK ||
                oxRemoteScript::IsCurrentRunOver())
                return outcome;
        }
    }
    milliseconds Left() const {
        return std::max(std::chrono::ceil<milliseconds>(m_end - steady_clock::now()), milliseconds(0));
    }

    bool FailReceive(int error) const {
        if (error == ECONNABORTED || error == ECONNRESET)
            m_log.Log(1, "oxxHttpServer::Receive: error - client disconnected - socket error = %d\n", error);
        else
            m_log.Log(1, "oxxHttpServer::Receive: error reading request from socket - socket error = %d\n", error);
        return false;
    }
    bool FailTooLarge(oxSocket& socket) const {
        char dropped[DRAIN_BYTES];
        for (int reads = 0; reads < DRAIN_READS; ++reads)
            if (socket.Recv(dropped, DRAIN_BYTES, MSG_DONTWAIT) != DRAIN_BYTES)
                break;
        m_log.Log(1, "oxxHttpServer::Receive: error reading request - the request was too large\n");
        return false;
    }

    oxHttpErrorLog& m_log;
    const steady_clock::time_point m_end;
};

}  // namespace

int oxxHttpServer::SendERSRequest(const char* contextString, int command, const char* argumentText, char* reply,
                                  std::size_t replySize) {
    const auto setup = Setup();
    oxSocket socket;
    // A host or port that could not be made out of the configured text cannot be connected to.
    int error = EDESTADDRREQ;
    if (!setup->remote.host.empty() && setup->remote.port != 0) {
        const oxSockAddr address = FindAddress(setup->remote);  // by the name service's time, not the exchange's
        const Exchange exchange(MessageLog(), *setup);
        error = exchange.Connect(socket, address);
        if (error == 0) {
            exchange.Send(socket, RequestLine(contextString, command, argumentText));
            const int status = exchange.ProcessReply(socket, reply, replySize);
            socket.Shutdown(SHUT_RDWR);
            socket.Close();
            return status;
        }
    }
    MessageLog().Error("oxxHttpServer::SendERSRequest : connect failed - socket error = %d %s", error,
                       GetLastErrorText(error));
    socket.Close();
    return ERS_UNREACHABLE;
}

int oxxHttpServer::ProcessReply(oxSocket& socket, char* reply, std::size_t replySize) {
    return Exchange(MessageLog(), *Setup()).ProcessReply(socket, reply, replySize);
}

bool oxxHttpServer::Receive(oxSocket& socket, char* buffer, std::size_t size) {
    return Exchange(MessageLog(), *Setup()).Receive(socket, buffer, size);
}
