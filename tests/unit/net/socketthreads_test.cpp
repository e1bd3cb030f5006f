// A socket that another thread closes while its owner uses it.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "net/support_table.h"
#include "platform/file.h"
#include "testing/waiting.h"

namespace {
// A gate in front of the kernel: a call stays inside until the test lets it go on.
class Gate {
public:
    void Enter() {
        std::unique_lock lock(m_mutex);
        ++m_inside;
        m_changed.notify_all();
        m_changed.wait(lock, [this] { return m_isOpen; });
        --m_inside;
    }
    void AwaitInside(int count) {
        std::unique_lock lock(m_mutex);
        m_changed.wait(lock, [this, count] { return m_inside == count; });
    }
    void Open() {
        const std::scoped_lock lock(m_mutex);
        m_isOpen = true;
        m_changed.notify_all();
    }
    void Reset() {
        const std::scoped_lock lock(m_mutex);
        m_isOpen = false;
    }

private:
    std::mutex m_mutex;
    std::condition_variable m_changed;
    int m_inside = 0;
    bool m_isOpen = false;
};

Gate s_gate;
std::mutex s_closedMutex;
std::vector<int> s_closed;
std::atomic<int> s_shutdowns{0};

ssize_t GatedRecv(int, void*, size_t, int) {
    s_gate.Enter();
    errno = ECONNRESET;
    return -1;
}

int GatedConnect(int handle, const sockaddr* address, socklen_t length) {
    s_gate.Enter();
    return ::connect(handle, address, length);
}

int RecordingClose(int handle) {
    const std::scoped_lock lock(s_closedMutex);
    s_closed.push_back(handle);
    return ::close(handle);
}

int RecordingShutdown(int handle, int how) {
    ++s_shutdowns;
    EXPECT_EQ(SHUT_RDWR, how);
    return ::shutdown(handle, how);
}

std::vector<int> Closed() {
    const std::scoped_lock lock(s_closedMutex);
    return s_closed;
}

class OxSocketThreads : public TableTest {
protected:
    OxSocketThreads() {
        s_gate.Reset();
        s_closed.clear();
        s_shutdowns = 0;
    }
};

// Fills both ends' buffers until a send would block.
void Fill(oxSocket& socket) {
    static const char block[4096] = {};
    while (socket.Send(block, sizeof block, MSG_DONTWAIT) > 0)
        ;
}
}  // namespace

TEST_F(OxSocketThreads, CloseByAnotherThreadWakesABlockedOwner) {
    enum Kind { CONNECTED, FULL, LISTENING, DATAGRAM };
    static char byte = 0;
    static const struct {
        const char* name;
        Kind kind;
        std::function<void(oxSocket&)> operation;
    } CASES[] = {
        {"Recv", CONNECTED, [](oxSocket& s) { s.Recv(&byte, 1, 0); }},
        {"Peek", CONNECTED, [](oxSocket& s) { s.Peek(&byte, 1); }},
        {"WaitReadable", CONNECTED, [](oxSocket& s) { EXPECT_EQ(Readiness::Ready, s.WaitReadable()); }},
        {"Send", FULL,
         [](oxSocket& s) {
             static const char block[4096] = {};
             while (s.Send(block, sizeof block, 0) > 0)
                 ;
         }},
        {"WaitWritable", FULL, [](oxSocket& s) { EXPECT_EQ(Readiness::Ready, s.WaitWritable()); }},
        {"Accept", LISTENING, [](oxSocket& s) { EXPECT_EQ(-1, s.Accept(nullptr, nullptr)); }},
        {"wait for a connection", LISTENING, [](oxSocket& s) { EXPECT_EQ(Readiness::Ready, s.WaitReadable()); }},
        {"RecvFrom", DATAGRAM, [](oxSocket& s) { s.RecvFrom(&byte, 1, 0, nullptr, nullptr); }},
    };
    for (const auto& c : CASES) {
        SCOPED_TRACE(c.name);
        oxSocket socket, peer;
        if (c.kind == LISTENING)
            ListenOnLoopback(socket);
        else if (c.kind == DATAGRAM)
            ASSERT_TRUE(socket.Create(AF_INET, SOCK_DGRAM, 0, "127.0.0.1", 0));
        else
            MakePair(socket, peer);
        if (c.kind == FULL)
            Fill(socket);
        const int handle = socket.GetHandle();
        std::atomic<bool> started{false};
        std::atomic<bool> ended{false};
        std::thread owner([&] {
            started = true;
            c.operation(socket);
            EXPECT_EQ(-1, socket.GetHandle());
            ended = true;
        });
        EXPECT_TRUE(Eventually([&] { return started.load(); }));
        EXPECT_TRUE(socket.Close());
        EXPECT_EQ(-1, socket.GetHandle());
        EXPECT_TRUE(Eventually([&] { return ended.load(); }));
        owner.join();
        EXPECT_EQ(-1, ::fcntl(handle, F_GETFD));
    }
}

TEST_F(OxSocketThreads, LastUserCloses) {
    oxSocket socket, peer;
    MakePair(socket, peer);
    oxSocket::m_lpfnrecv = GatedRecv;
    oxSocket::m_lpfnclose = RecordingClose;
    oxSocket::m_lpfnshutdown = RecordingShutdown;
    const int handle = socket.GetHandle();
    std::thread one([&] {
        char byte = 0;
        EXPECT_EQ(-1, socket.Recv(&byte, 1, 0));
    });
    std::thread two([&] {
        char byte = 0;
        EXPECT_EQ(-1, socket.Recv(&byte, 1, 0));
    });
    s_gate.AwaitInside(2);
    EXPECT_TRUE(socket.Close());
    EXPECT_EQ(-1, socket.GetHandle());
    EXPECT_EQ(1, s_shutdowns);
    EXPECT_TRUE(Closed().empty());
    EXPECT_NE(-1, ::fcntl(handle, F_GETFD));
    {
        // The number is not given away while the others may use it.
        const UniqueFd file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
        EXPECT_NE(handle, file.Get());
    }
    EXPECT_TRUE(socket.Close());
    EXPECT_EQ(1, s_shutdowns);
    s_gate.Open();
    one.join();
    two.join();
    EXPECT_EQ(std::vector<int>{handle}, Closed());
    // The error is the operation's, not the close's.
    EXPECT_EQ(ECONNRESET, socket.ErrorCode());
}

TEST_F(OxSocketThreads, CloseWithNobodyInsideDoesNotShutDown) {
    oxSocket socket, peer;
    MakePair(socket, peer);
    oxSocket::m_lpfnclose = RecordingClose;
    oxSocket::m_lpfnshutdown = RecordingShutdown;
    const int handle = socket.GetHandle();
    std::thread([&] { EXPECT_TRUE(socket.Close()); }).join();
    EXPECT_EQ(std::vector<int>{handle}, Closed());
    EXPECT_EQ(0, s_shutdowns);
}

TEST_F(OxSocketThreads, NewSocketInTheSameObjectIsNotTouchedByTheOldOnesUsers) {
    oxSocket socket, peer;
    MakePair(socket, peer);
    oxSocket::m_lpfnrecv = GatedRecv;
    oxSocket::m_lpfnclose = RecordingClose;
    const int old = socket.GetHandle();
    std::thread user([&] {
        char byte = 0;
        EXPECT_EQ(-1, socket.Recv(&byte, 1, 0));
    });
    s_gate.AwaitInside(1);
    EXPECT_TRUE(socket.Close());
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    const int fresh = socket.GetHandle();
    EXPECT_NE(old, fresh);
    s_gate.Open();
    user.join();
    EXPECT_EQ(std::vector<int>{old}, Closed());
    EXPECT_EQ(fresh, socket.GetHandle());
    EXPECT_NE(-1, ::fcntl(fresh, F_GETFD));
}

// A listener that answers no more: its queue is full, so that a further connect waits for the system's whole time.
class FullListener {
public:
    FullListener() {
        ListenOnLoopback(m_listener, 0);
        m_address = m_listener.GetLocalAddress();
        for (oxSocket& client : m_clients) {
            EXPECT_TRUE(client.Create(AF_INET, SOCK_STREAM, 0));
            client.SetNonBlocking(true);
            client.Connect(m_address.Raw(), oxSockAddr::LENGTH);
        }
    }
    const oxSockAddr& Address() const { return m_address; }

private:
    oxSocket m_listener;
    oxSocket m_clients[4];
    oxSockAddr m_address;
};

TEST_F(OxSocketThreads, CloseByAnotherThreadEndsAConnectThatGetsNoAnswer) {
    const FullListener full;
    for (const bool begun : {true, false}) {
        SCOPED_TRACE(begun);
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        s_gate.Reset();
        oxSocket::m_lpfnconnect = GatedConnect;
        std::thread owner([&] {
            EXPECT_FALSE(socket.Connect(full.Address().Raw(), oxSockAddr::LENGTH));
            EXPECT_EQ(ECONNABORTED, socket.ErrorCode());
        });
        s_gate.AwaitInside(1);
        if (begun)
            s_gate.Open();  // the close comes before, during or after the system call
        EXPECT_TRUE(socket.Close());
        s_gate.Open();
        owner.join();
    }
}

TEST_F(OxSocketThreads, ConnectOfASocketClosedMeanwhileFails) {
    oxSocket listener, socket;
    const oxSockAddr address = ListenOnLoopback(listener);
    ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
    oxSocket::m_lpfnconnect = GatedConnect;
    std::thread owner([&] {
        EXPECT_FALSE(socket.Connect(address.Raw(), oxSockAddr::LENGTH));
        EXPECT_EQ(ECONNABORTED, socket.ErrorCode());
    });
    s_gate.AwaitInside(1);
    EXPECT_TRUE(socket.Close());
    s_gate.Open();
    owner.join();
    EXPECT_EQ(-1, socket.GetHandle());
}

TEST_F(OxSocketThreads, ManyClosersCloseOnce) {
    oxSocket::m_lpfnclose = RecordingClose;
    for (int round = 0; round < 50; ++round) {
        s_closed.clear();
        oxSocket socket;
        ASSERT_TRUE(socket.Create(AF_INET, SOCK_STREAM, 0));
        const int handle = socket.GetHandle();
        std::vector<std::thread> closers;
        for (int i = 0; i < 4; ++i)
            closers.emplace_back([&] { EXPECT_TRUE(socket.Close()); });
        for (std::thread& closer : closers)
            closer.join();
        EXPECT_EQ(std::vector<int>{handle}, Closed());
    }
}

TEST_F(OxSocketThreads, UseCountIsExact) {
    const int before = oxSocket::UseCount();
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i)
        threads.emplace_back([] {
            const oxSocket kept;
            for (int round = 0; round < 200; ++round)
                const oxSocket socket;
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(before, oxSocket::UseCount());
}

namespace {
// Opens files and socket pairs all the time and sees whether anybody else writes to or closes their numbers.
class Opener {
public:
    Opener() : m_thread([this] { Run(); }) {}
    ~Opener() { Stop(); }
    Opener(const Opener&) = delete;
    Opener& operator=(const Opener&) = delete;
    int Stop() {
        m_stop = true;
        if (m_thread.joinable())
            m_thread.join();
        return m_wrong;
    }

private:
    void Run() {
        while (!m_stop) {
            int ends[2];
            if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0)
                continue;
            const UniqueFd near(ends[0]), far(ends[1]), file(::open("/dev/null", O_RDONLY | O_CLOEXEC));
            struct stat first {};
            struct stat again {};
            if (::fstat(file.Get(), &first) != 0)
                ++m_wrong;
            for (int i = 0; i < 5; ++i)
                std::this_thread::yield();
            char byte = 0;
            for (const int end : ends)
                if (::recv(end, &byte, 1, MSG_DONTWAIT) != -1 || errno != EAGAIN)
                    ++m_wrong;
            if (::fstat(file.Get(), &again) != 0 || first.st_rdev != again.st_rdev || first.st_ino != again.st_ino)
                ++m_wrong;
        }
    }

    std::atomic<bool> m_stop{false};
    std::atomic<int> m_wrong{0};
    std::thread m_thread;
};

// One connection: a sender that repeats its marker until it is closed under it, and a client that reads it.
struct Connection {
    oxSocket client;
    oxSocket session;
    std::atomic<std::size_t> received{0};
    std::atomic<int> foreign{0};
    std::thread sender;
    std::thread reader;

    void Start(int number) {
        sender = std::thread([this, number] {
            const std::string marker = Marker(number);
            while (session.GetHandle() != -1)
                session.Send(marker.data(), static_cast<int>(marker.size()), 0);
        });
        reader = std::thread([this, number] {
            const std::string marker = Marker(number);
            std::size_t at = 0;
            char block[1000];
            for (int count = client.Recv(block, sizeof block, 0); count > 0;
                 count = client.Recv(block, sizeof block, 0)) {
                for (int i = 0; i < count; ++i, ++at)
                    if (block[i] != marker[at % marker.size()])
                        ++foreign;
                received = at;
            }
        });
    }
    static std::string Marker(int number) { return "<" + std::to_string(10000 + number) + ">"; }
};
}  // namespace

TEST_F(OxSocketThreads, ClosedSocketsNeverWriteToStrangers) {
    constexpr int CLIENTS = 200;
    constexpr int AT_ONCE = 20;
    oxSocket listener;
    const oxSockAddr address = ListenOnLoopback(listener);
    Opener one, two;
    int foreign = 0;
    for (int first = 0; first < CLIENTS; first += AT_ONCE) {
        std::vector<std::unique_ptr<Connection>> connections;
        for (int i = 0; i < AT_ONCE; ++i) {
            auto& connection = *connections.emplace_back(std::make_unique<Connection>());
            ASSERT_TRUE(connection.client.Create(AF_INET, SOCK_STREAM, 0));
            ASSERT_TRUE(connection.client.Connect(address.Raw(), oxSockAddr::LENGTH));
            ASSERT_TRUE(listener.Accept(connection.session, nullptr, nullptr));
        }
        for (int i = 0; i < AT_ONCE; ++i)
            connections[static_cast<std::size_t>(i)]->Start(first + i);
        for (const auto& connection : connections) {
            EXPECT_TRUE(Eventually([&] { return connection->received > 0; }));
            EXPECT_TRUE(connection->session.Close());
        }
        for (const auto& connection : connections) {
            connection->sender.join();
            connection->reader.join();
            foreign += connection->foreign;
        }
    }
    EXPECT_EQ(0, foreign);
    EXPECT_EQ(0, one.Stop());
    EXPECT_EQ(0, two.Stop());
}
