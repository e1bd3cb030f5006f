// A socket that reports what happens on it by itself.
#pragma once

#include <sys/socket.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <utility>

#include "net/socket.h"
#include "platform/mutex.h"
#include "platform/poll.h"
#include "platform/thread.h"

// A non-blocking socket with a thread of its own, the select thread, that calls an event handler whenever the socket is
// ready. A user derives from it, overrides the handlers it needs and asks for events with `SetAsyncSelect`.
//
// Readiness is reported again and again as long as it lasts: a handler reads or writes, closes the socket or takes the
// event out of the mask. The thread ends, and no more events come, once the socket's error code is set when an event
// arrives: so after any operation that failed, be it a `Recv` that found nothing to read.
//
// Thread rules: as its base. Handlers run on the select thread and must not throw. A handler may call any operation,
// but not destroy the object, and cannot start the select thread again once it has stopped it. `Close` on any other
// thread waits until a handler that runs has returned, so the caller must hold no lock that a handler takes.
//
// Life: a derived class calls `Close` at the latest in its own destructor; later its handlers would run on an object
// that is half gone.
class oxAsynchSocket : public oxSocket {
public:
    // The bits of the event mask; any bit of a group asks for the whole group.
    static constexpr std::uint32_t READ_EVENTS = 0x01 | 0x02 | 0x04;
    static constexpr std::uint32_t WRITE_EVENTS = 0x08 | 0x10;
    static constexpr std::uint32_t OUT_OF_BAND_EVENT = 0x20;
    // The longest single wait of the select thread.
    static constexpr std::chrono::seconds SELECT_TIME{1};

    oxAsynchSocket() = default;
    ~oxAsynchSocket() override;

    using oxSocket::Connect;
    using oxSocket::Create;
    // The new socket is non-blocking.
    bool Create(int family, int type, int protocol) override;
    // Stops the select thread first.
    bool Close() override;
    // A connect that has only begun is a success; its outcome comes as `OnConnect` (ask for SO_ERROR there).
    bool Connect(const sockaddr* address, socklen_t length) override;
    bool Listen(int backlog) override;

    // Starts the select thread and returns whether this call started it; one that runs goes on with the new mask. 0
    // stops it and returns false; no handler runs any more then, but the one that makes this call.
    virtual bool SetAsyncSelect(std::uint32_t mask);

    // `count` is the number of kinds of events (read, write, out of band) that came together.
    virtual void OnReserved(oxAsynchSocket& socket, int count);  // never called; keeps its place
    virtual void OnRead(oxAsynchSocket& socket, int count);
    virtual void OnWrite(oxAsynchSocket& socket, int count);
    virtual void OnOutOfBand(oxAsynchSocket& socket, int count);
    virtual void OnAccept(oxAsynchSocket& socket, int count);
    virtual void OnConnect(oxAsynchSocket& socket, int count);
    virtual void OnClose(oxAsynchSocket& socket, int count);

    // Seconds after its start at which the select thread ends without an event: the smaller of the two that are set. 0
    // is unset. A thread that runs keeps the limit it was started with.
    void SetTimeLimitA(std::uint32_t seconds) { m_timeLimitA = seconds; }
    std::uint32_t GetTimeLimitA() const { return m_timeLimitA; }
    void SetTimeLimitB(std::uint32_t seconds) { m_timeLimitB = seconds; }
    std::uint32_t GetTimeLimitB() const { return m_timeLimitB; }

    bool IsSelecting() const { return m_selectThread.IsRunning(); }

private:
    using TimePoint = std::chrono::steady_clock::time_point;
    class Change;

    static void* AsynchSelectThread(void* socket);
    void Select();
    std::optional<TimePoint> Deadline() const;
    int AwaitEvents(WaitLimit limit, std::uint32_t& ready);
    void CallHandlers(std::uint32_t ready, int count);
    bool IsAsked(std::uint32_t ready, std::uint32_t events) const;
    bool TakePending(std::uint32_t flag);
    bool Pending(bool done, std::uint32_t flag);

    std::atomic<std::uint32_t> m_eventMask{0};
    MThread m_selectThread{MThread::Priority::Normal};
    std::atomic<std::uint32_t> m_pendingFlags{0};
    std::atomic<std::uint32_t> m_timeLimitA{0};
    std::atomic<std::uint32_t> m_timeLimitB{0};
    std::atomic<std::uint32_t> m_changes{0};  // odd while the socket is being changed
    MMutex m_startMutex;                      // over starting and stopping the select thread, which never takes it
    std::atomic<unsigned> m_selectThreadId{0};
    std::optional<oxWakeup> m_wakeup{std::in_place};  // there until the destructor is done
};
