#include "http/httpsession.h"

#include <cerrno>
#include <mutex>
#include <stdexcept>

#include "http/httpserver.h"
#include "resources/resource.h"

namespace {

// Errors that say nothing about this server: the client went away again, or another wake-up took the connection.
bool IsPassing(int error) {
    return error == EAGAIN || error == EINTR || error == ECONNABORTED;
}

}  // namespace

oxHttpSession::oxHttpSession(oxHttpServer& server, std::uint32_t flags)
    : MThread(Priority::Normal, Kept::Yes), m_server(server), m_flags(flags), m_lastActivity(server.Clock()) {
    static_cast<void>(m_flags);
}

oxHttpSession::~oxHttpSession() {
    Abort();
    Wait();
}

bool oxHttpSession::AcceptConnection(oxSocket& listening) {
    m_lastActivity.Touch();
    SetState(STATE_SERVING);
    // Tried before waiting: on a busy server a connection is there already.
    while (listening.GetHandle() != -1) {
        for (int attempt = 0; attempt < ACCEPT_TRIES && listening.GetHandle() != -1; ++attempt) {
            socklen_t length = oxSockAddr::LENGTH;
            if (listening.Accept(m_socket, m_peerAddress.Raw(), &length)) {
                // The linger time that the connection inherits would hold up whoever closes it while the client is
                // slow; without it the system still delivers what was sent.
                const linger off{};
                m_socket.SetSockOpt(SOL_SOCKET, SO_LINGER, &off, sizeof off);
                m_lastActivity.Touch();
                return true;
            }
            if (IsPassing(listening.ErrorCode()))
                break;
        }
        // The system fails for lack of descriptors also when nobody waits to be accepted.
        const bool failed = !IsPassing(listening.ErrorCode());
        if (failed && listening.WaitReadable(std::chrono::milliseconds(0)) != Readiness::TimedOut)
            break;
        if (!m_server.WaitForConnection())
            break;
    }
    SetState(STATE_FINISHED);
    return false;
}

bool oxHttpSession::StartThread() {
    if (Create(&oxHttpSession::CallSessionThread, this))
        return true;
    SetState(STATE_FINISHED);
    return false;
}

void oxHttpSession::Abort() {
    {
        const std::scoped_lock lock(m_mutex);
        if (m_state != STATE_FINISHED)
            m_state = STATE_CLOSING;
    }
    m_stopFlag = true;
    m_socket.Close();
}

bool oxHttpSession::StopSession(std::chrono::milliseconds limit) {
    if (!m_stopped)
        Abort();
    m_stopped = true;
    return Wait(limit);
}

void oxHttpSession::SetState(State value) {
    const std::scoped_lock lock(m_mutex);
    m_state = value;
}

void* oxHttpSession::CallSessionThread(void* session) {
    static_cast<oxHttpSession*>(session)->Serve();
    return nullptr;
}

void oxHttpSession::Serve() {
    oxHttpErrorLog& log = m_server.MessageLog();
    {
        oxRequest request;
        m_lastActivity.Touch();
        try {
            ServeRequest(request);
            CloseConnection(request);
        } catch (const std::runtime_error& error) {
            log.Error("Session 0x%X error - %s", CurrentId(), error.what());
        } catch (...) {
            log.Error("Session 0x%X - an unknown exeption occurred.", CurrentId());
        }
        try {
            CloseConnection(request);  // where an error left it open
        } catch (...) {
            log.Error("Session 0x%X - an unknown exception occurred during cleanup.", CurrentId());
        }
    }
    SetState(STATE_FINISHED);
}

void oxHttpSession::ServeRequest(oxRequest& request) {
    const bool good = request.Read(m_socket, m_server.MessageLog()) && request.Parse();
    if (good) {
        m_resource = m_server.CreateResource(request);
        if (!m_resource)
            throw std::runtime_error("unable to allocate request");
        m_resource->SetStopFlag(m_stopFlag);
    }
    // A read that ended because the connection was closed under it is neither good nor bad: nobody is left to answer.
    if (!good && request.GetStatus() == oxRequest::STATUS_GOOD)
        return;
    if (request.GetStatus() == oxRequest::STATUS_ABORTED || request.GetStatus() == oxRequest::STATUS_SOCKET_ERROR) {
        SetState(STATE_CLOSING);
        return;
    }
    m_reply = ChooseReply(request);
    if (!m_reply)
        throw std::runtime_error("unable to allocate reply");
    if (GetState() == STATE_CLOSING)
        return;
    m_lastActivity.Touch();
    m_reply->Send(m_socket, m_lastActivity, m_server.MessageLog());
    if (const auto accessLog = m_server.AccessLog())
        accessLog->LogRequest(m_peerAddress, request, m_reply.get(), m_server.Clock().Now());
}

std::unique_ptr<oxReply> oxHttpSession::ChooseReply(const oxRequest& request) {
    switch (request.GetStatus()) {
        case oxRequest::STATUS_GOOD:
            return m_resource->GetReply(request);
        case oxRequest::STATUS_TOO_LARGE:
            return std::make_unique<oxReply>(Http::REQUEST_ENTITY_TOO_LARGE_413);
        default:
            return std::make_unique<oxReply>(Http::BAD_REQUEST_400);
    }
}

void oxHttpSession::CloseConnection(const oxRequest& request) {
    m_active = false;  // before the client can see the end of its reply and come back
    if (GetState() != STATE_CLOSING && m_socket.GetHandle() != -1) {
        m_socket.Shutdown(SHUT_WR);
        char next;
        if (!request.IsComplete() || m_socket.Recv(&next, 1, MSG_DONTWAIT) > 0)
            DropUnread();
    }
    m_socket.Close();
    m_reply.reset();
    m_resource.reset();
}

void oxHttpSession::DropUnread() {
    const auto end = std::chrono::steady_clock::now() + DROP_TIME;
    std::size_t dropped = 0;
    char block[DROP_BLOCK];
    while (dropped < DROP_BYTES && GetState() != STATE_CLOSING) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        if (left.count() <= 0 || m_socket.WaitReadable(left) != Readiness::Ready)
            return;
        const int count = m_socket.Recv(block, sizeof block, MSG_DONTWAIT);
        if (count == 0 || (count < 0 && m_socket.ErrorCode() != EAGAIN))
            return;
        if (count > 0)
            dropped += static_cast<std::size_t>(count);
    }
}
