#include "unix/servercontrol.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <thread>
#include <vector>

#include "net/socket.h"
#include "testing/waiting.h"
#include "unix/remoteconfig.h"
#include "unix/testtools.h"
#include "unix/theserver.h"

namespace {
// Listens on a port that the system chose.
class TakenPort {
public:
    TakenPort() : m_socket(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        bind(m_socket, reinterpret_cast<sockaddr*>(&address), sizeof address);
        listen(m_socket, 1);
        socklen_t length = sizeof address;
        getsockname(m_socket, reinterpret_cast<sockaddr*>(&address), &length);
        m_port = ntohs(address.sin_port);
    }
    ~TakenPort() { Release(); }
    TakenPort(const TakenPort&) = delete;
    TakenPort& operator=(const TakenPort&) = delete;
    void Release() {
        if (m_socket >= 0)
            close(m_socket);
        m_socket = -1;
    }
    int Port() const { return m_port; }

private:
    int m_socket;
    int m_port = 0;
};

void WriteSettings(int port) {
    WriteText("ox_remote.ini",
              "[RemoteConfiguration]\nWebAddress=127.0.0.1\nWebLogging=0\nWebErrorLog=./x.err\nWebPort=" +
                  std::to_string(port) + "\n");
}
}  // namespace

// The first in this file: no other test may have built the server.
TEST(TheServer, IsOneHoweverManyThreadsAskFirst) {
    constexpr int THREADS = 16;
    static std::atomic<int> s_answered;
    s_answered = 0;
    // The first socket of the server looks this machine up: that holds its building up while the others ask.
    const auto lookUp = oxSocket::m_lpfngethostbyname;
    oxSocket::m_lpfngethostbyname = [](const char*) -> hostent* {
        Eventually([] { return s_answered == THREADS - 1; }, std::chrono::milliseconds(200));
        return nullptr;
    };
    std::vector<const oxxHttpServer*> servers(THREADS, nullptr);
    std::vector<std::thread> threads;
    for (auto& server : servers)
        threads.emplace_back([&server] {
            server = &theServer();
            ++s_answered;
        });
    for (std::thread& thread : threads)
        thread.join();
    oxSocket::m_lpfngethostbyname = lookUp;
    EXPECT_NE(servers.front(), nullptr);
    EXPECT_EQ(std::count(servers.begin(), servers.end(), servers.front()), THREADS);
}

TEST(OxTheServerControl, StartStatusAndStop) {
    const ScratchDirectory scratch;
    LinesAudit audit;
    oxTheServerControl control(audit);
    int port = 0;
    EXPECT_EQ(control.Status(port), -1) << "stopped before the first start";
    EXPECT_EQ(&theServer(), &theServer());

    // No settings file.
    EXPECT_EQ(control.Start({}), -1);
    EXPECT_EQ(audit.lines.size(), 1U);
    EXPECT_EQ(audit.lines.at(0).rfind("Error: can't read ./ox_remote.ini: ", 0), 0U) << audit.lines.at(0);

    // No port, then a taken one.
    WriteSettings(0);
    EXPECT_EQ(control.Start({}), -2);
    TakenPort taken;
    WriteSettings(taken.Port());
    EXPECT_EQ(control.Start({}), -2);
    EXPECT_EQ(control.Status(port), -1);

    taken.Release();
    EXPECT_EQ(control.Start({}), 0);
    EXPECT_EQ(control.Status(port), 0);
    EXPECT_EQ(port, taken.Port());
    EXPECT_EQ(control.Start({}), 0) << "a running server counts as started";
    control.Stop();
    EXPECT_EQ(control.Status(port), -1);
}

TEST(OxTheServerControl, AListenerThatEndedByItselfIsAnErrorUntilAGoodStart) {
    const ScratchDirectory scratch;
    LinesAudit audit;
    oxTheServerControl control(audit);
    oxRemoteConfig remote(control);
    int port = 0;
    TakenPort own;
    own.Release();
    WriteSettings(own.Port());
    const auto listens = oxSocket::m_lpfnlisten;
    oxSocket::m_lpfnlisten = [](int, int) {
        errno = EADDRINUSE;
        return -1;
    };
    EXPECT_EQ(remote.Start({}), 0) << "only its thread notices";
    EXPECT_TRUE(Eventually([&] { return control.Status(port) == -2; }));
    oxSocket::m_lpfnlisten = listens;
    EXPECT_EQ(remote.GetPort(), -1);

    const TakenPort taken;
    WriteSettings(taken.Port());
    EXPECT_EQ(remote.Start({}), -1);
    EXPECT_EQ(control.Status(port), -2);
    EXPECT_EQ(remote.GetPort(), -1);
    remote.Stop();
    EXPECT_EQ(control.Status(port), -2) << "only what runs is stopped";

    WriteSettings(own.Port());
    EXPECT_EQ(remote.Start({}), 0);
    EXPECT_EQ(control.Status(port), 0);
    EXPECT_EQ(remote.GetPort(), own.Port());
    remote.Stop();
    EXPECT_EQ(control.Status(port), -1);
    EXPECT_TRUE(audit.lines.empty());
}
