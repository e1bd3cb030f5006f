#include "net/asynchsocket.h"

#include <poll.h>
#include <pthread.h>

#include <algorithm>
#include <bit>
#include <cerrno>
#include <mutex>
#include <span>

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr std::uint32_t CONNECT_PENDING = 0x1;
constexpr std::uint32_t LISTEN_PENDING = 0x2;

// The kinds of readiness.
constexpr std::uint32_t READABLE = 0x1;
constexpr std::uint32_t WRITABLE = 0x2;
constexpr std::uint32_t EXCEPTIONAL = 0x4;

// What poll reports for each of them, as select tells them apart.
constexpr short READ_RESULTS = POLLIN | POLLHUP | POLLERR;
constexpr short WRITE_RESULTS = POLLOUT | POLLERR;
constexpr short EXCEPTION_RESULTS = POLLPRI;

// Destructors do not wait where the thread may be cancelled: unwinding out of them ends the process.
class CancellationOff {
public:
    CancellationOff() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &m_before); }
    ~CancellationOff() { pthread_setcancelstate(m_before, nullptr); }
    CancellationOff(const CancellationOff&) = delete;
    CancellationOff& operator=(const CancellationOff&) = delete;

private:
    int m_before = PTHREAD_CANCEL_ENABLE;
};

}  // namespace

// An operation that changes what events mean. Readiness seen before or during it is not reported: it would be taken for
// the outcome of the operation, and the error code is not settled.
class oxAsynchSocket::Change {
public:
    explicit Change(oxAsynchSocket& socket) : m_socket(socket) { ++m_socket.m_changes; }
    ~Change() {
        ++m_socket.m_changes;
        m_socket.m_wakeup->Wake();
    }
    Change(const Change&) = delete;
    Change& operator=(const Change&) = delete;

private:
    oxAsynchSocket& m_socket;
};

oxAsynchSocket::~oxAsynchSocket() {
    const CancellationOff off;
    oxAsynchSocket::SetAsyncSelect(0);
    // These close descriptors, which would be cancellation points later.
    oxSocket::Close();
    m_wakeup.reset();
}

bool oxAsynchSocket::Create(int family, int type, int protocol) {
    if (GetHandle() != -1)
        Close();
    const Change change(*this);
    m_pendingFlags = 0;
    return oxSocket::Create(family, type, protocol) && SetNonBlocking(true);
}

bool oxAsynchSocket::Close() {
    SetAsyncSelect(0);
    return oxSocket::Close();
}

bool oxAsynchSocket::Connect(const sockaddr* address, socklen_t length) {
    const Change change(*this);
    return Pending(oxSocket::Connect(address, length), CONNECT_PENDING);
}

bool oxAsynchSocket::Listen(int backlog) {
    const Change change(*this);
    return Pending(oxSocket::Listen(backlog), LISTEN_PENDING);
}

bool oxAsynchSocket::Pending(bool done, std::uint32_t flag) {
    if (done || (ErrorCode() != EINPROGRESS && ErrorCode() != EAGAIN))
        return done;
    m_pendingFlags |= flag;
    m_errorCode = 0;
    return true;
}

bool oxAsynchSocket::SetAsyncSelect(std::uint32_t mask) {
    if (m_selectThreadId == MThread::CurrentId()) {  // a handler: cannot wait for its own thread
        m_eventMask = mask;
        if (mask == 0)
            m_selectThread.Cancel();
        return false;
    }
    const std::scoped_lock lock(m_startMutex);
    m_eventMask = mask;
    if (mask == 0)
        m_selectThread.Cancel();
    m_wakeup->Wake();
    if (m_selectThread.IsCancelled())
        m_selectThread.Wait();
    return mask != 0 && m_selectThread.Create(&oxAsynchSocket::AsynchSelectThread, this);
}

void* oxAsynchSocket::AsynchSelectThread(void* socket) {
    auto& self = *static_cast<oxAsynchSocket*>(socket);
    self.m_selectThreadId = MThread::CurrentId();
    self.Select();
    self.m_selectThreadId = 0;
    return nullptr;
}

std::optional<oxAsynchSocket::TimePoint> oxAsynchSocket::Deadline() const {
    const std::uint32_t a = m_timeLimitA;
    const std::uint32_t b = m_timeLimitB;
    if (a == 0 && b == 0)
        return std::nullopt;
    return steady_clock::now() + std::chrono::seconds(a == 0 || b == 0 ? std::max(a, b) : std::min(a, b));
}

void oxAsynchSocket::Select() {
    const std::optional<TimePoint> deadline = Deadline();
    while (!m_selectThread.IsCancelled()) {
        milliseconds limit = SELECT_TIME;
        if (deadline) {
            const auto left = std::chrono::ceil<milliseconds>(*deadline - steady_clock::now());
            if (left.count() <= 0)
                return;
            limit = std::min(limit, left);
        }
        const std::uint32_t changes = m_changes;
        std::uint32_t ready = 0;
        const int count = AwaitEvents(limit, ready);
        if (count < 0) {
            GetLastError();
            return;
        }
        if (count == 0)
            continue;
        const int error = m_errorCode;
        if (m_changes != changes)
            continue;
        if (error != 0)
            return;
        if (!m_selectThread.IsCancelled() && GetHandle() != -1)
            CallHandlers(ready, count);
    }
}

// Waits for what the mask asks. The number of kinds of readiness that came, 0 for none, -1 with errno.
int oxAsynchSocket::AwaitEvents(WaitLimit limit, std::uint32_t& ready) {
    const std::uint32_t mask = m_eventMask;
    const int handle = GetHandle();
    const bool reads = (mask & READ_EVENTS) != 0;
    const bool writes = (mask & WRITE_EVENTS) != 0;
    const bool exceptions = (mask & OUT_OF_BAND_EVENT) != 0;
    const int events = (reads ? POLLIN : 0) | (writes ? POLLOUT : 0) | (exceptions ? POLLPRI : 0);
    const bool changing = m_changes % 2 != 0;
    pollfd entries[] = {{m_wakeup->Descriptor(), POLLIN, 0},
                        {events == 0 || changing ? -1 : handle, static_cast<short>(events), 0}};
    const auto await = [&limit](std::span<pollfd> all) { return PollAll(all, limit); };
    if (await(entries) < 0)
        return -1;
    const short results = entries[1].revents;
    if ((results & POLLNVAL) != 0 && GetHandle() == handle) {
        errno = EBADF;
        return -1;
    }
    ready = (reads && (results & READ_RESULTS) != 0 ? READABLE : 0) |
            (writes && (results & WRITE_RESULTS) != 0 ? WRITABLE : 0) |
            (exceptions && (results & EXCEPTION_RESULTS) != 0 ? EXCEPTIONAL : 0);
    // poll also reports an end or an error that nobody asked for, without ever waiting.
    if (ready == 0 && results != 0)
        await(std::span(entries, 1));
    if (entries[0].revents != 0)
        m_wakeup->Clear();
    return std::popcount(ready);
}

// An event that was taken out of the mask meanwhile, or whose socket was closed, is not reported any more.
bool oxAsynchSocket::IsAsked(std::uint32_t ready, std::uint32_t events) const {
    return ready != 0 && (m_eventMask & events) != 0 && GetHandle() != -1;
}

bool oxAsynchSocket::TakePending(std::uint32_t flag) {
    return (m_pendingFlags.fetch_and(~flag) & flag) != 0;
}

void oxAsynchSocket::CallHandlers(std::uint32_t ready, int count) {
    if (IsAsked(ready & WRITABLE, WRITE_EVENTS)) {
        if (TakePending(CONNECT_PENDING))
            OnConnect(*this, count);
        else
            OnWrite(*this, count);
    }
    if (IsAsked(ready & READABLE, READ_EVENTS)) {
        char first = 0;
        if (TakePending(LISTEN_PENDING))
            OnAccept(*this, count);
        else if (Peek(&first, sizeof first) != 0)
            OnRead(*this, count);
        else
            OnClose(*this, count);
    }
    if (IsAsked(ready & EXCEPTIONAL, OUT_OF_BAND_EVENT)) {
        if (TakePending(CONNECT_PENDING))
            OnConnect(*this, count);
        else
            OnOutOfBand(*this, count);
    }
}

void oxAsynchSocket::OnReserved(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnRead(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnWrite(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnOutOfBand(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnAccept(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnConnect(oxAsynchSocket&, int) {}
void oxAsynchSocket::OnClose(oxAsynchSocket&, int) {}
