#include "unix/servercontrol.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

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
