// One connection, served on a thread of its own.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>

#include "net/socket.h"
#include "platform/clock.h"
#include "platform/mutex.h"
#include "platform/thread.h"
#include "protocol/reply.h"
#include "protocol/request.h"

class oxHttpServer;
class oxResource;

// Accepts a connection for the listener, then, on its own thread, reads one request, sends one reply, writes the
// access-log line, closes the connection and marks itself finished. The server's registry owns and destroys it.
//
// Stopping a session (`StopSession`) marks it as closing and shuts its connection down, so that whatever its thread
// waits for returns; the thread then ends by itself, without sending anything more.
//
// Thread rules: `AcceptConnection`, `StartThread`, `StopSession` and the destructor belong to the listener (or to
// whoever stops the server after it); everything else happens on the session's thread. The readable state may be read
// from anywhere.
class oxHttpSession : public MThread {
public:
    enum State { STATE_NEW = 0, STATE_SERVING = -1, STATE_FINISHED = -2, STATE_CLOSING = -3 };

    static constexpr int ACCEPT_TRIES = 3;
    // What a client still sends after the answer to a request that was not read to its end is dropped within these
    // limits; without it the system would reset the connection and the client would not see the answer.
    static constexpr std::chrono::milliseconds DROP_TIME{2000};
    static constexpr std::size_t DROP_BYTES = std::size_t{4} * 1024 * 1024;
    static constexpr std::size_t DROP_BLOCK = 16384;

    oxHttpSession(oxHttpServer& server, std::uint32_t flags);
    ~oxHttpSession() override;

    // Waits for a connection and accepts it. False, with the listening socket's error code, when accepting failed or
    // the listening socket was closed.
    bool AcceptConnection(oxSocket& listening);
    // Starts serving the accepted connection. False when no thread could be started.
    bool StartThread();
    // Tells the session to end and waits for its thread, at most this long; true when it has ended. A finished session
    // stays finished. May be repeated to wait on.
    bool StopSession(std::chrono::milliseconds limit);
    // Whether `StopSession` was called; for the thread that calls it.
    bool WasStopped() const { return m_stopped; }

    State GetState() const { return m_state.load(); }
    void SetState(State value);
    const oxSockAddr& PeerAddress() const { return m_peerAddress; }
    std::int64_t LastActivity() const { return m_lastActivity.Seconds(); }
    // False once the reply is complete: what is left is closing the connection.
    bool IsActive() const { return m_active.load(); }

private:
    static void* CallSessionThread(void* session);
    void Abort();
    void Serve();
    void ServeRequest(oxRequest& request);
    std::unique_ptr<oxReply> ChooseReply(const oxRequest& request);
    void CloseConnection(const oxRequest& request);
    void DropUnread();

    oxHttpServer& m_server;
    const std::uint32_t m_flags;  // kept; sending a reply takes none
    oxTimeStamp m_lastActivity;
    std::atomic<State> m_state{STATE_NEW};
    oxSocket m_socket;
    oxSockAddr m_peerAddress;
    std::atomic<bool> m_active{true};
    bool m_stopped = false;
    std::atomic<bool> m_stopFlag{false};  // what the resource looks at while it waits
    MMutex m_mutex;  // guards the changes of the state; never held over closing the socket, which may wait
    std::unique_ptr<oxResource> m_resource;
    std::unique_ptr<oxReply> m_reply;
};
