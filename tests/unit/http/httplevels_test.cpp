// At which level of the message log each line of the server is written.
#include <cerrno>
#include <filesystem>
#include <thread>

#include "http/serverfixture.h"
#include "testing/injected.h"

namespace {

struct Line {
    const char* text;
    int level;
};

class HttpLevels : public ServerFixture {
protected:
    // A new server whose message log, a new one too, has the level.
    void StartAt(int level) {
        server.reset();
        std::filesystem::remove(dir.File("errors"));
        oxAuditFile::SetDefaultDebugLevel(level);
        server = std::make_unique<TestServer>(clock);
        made = 0;
        connections = 0;
        server->onMakeSession = [this] { ++made; };
        ASSERT_TRUE(Start());
    }
    // After a connection: until its session is listed, without a look at the log.
    bool WaitUntilListed() {
        ++connections;
        return Eventually([this] { return made > connections; });
    }
    template <std::size_t N>
    void Check(int level, const Line (&lines)[N]) const {
        for (const Line& line : lines)
            EXPECT_EQ(Count(line.text) > 0, line.level <= level) << line.text << " at level " << level;
    }

    std::atomic<int> made{0};
    int connections = 0;
};

TEST_F(HttpLevels, LifeOfAServer) {
    const Line lines[] = {
        {"Starting server: connecting to ", 1},
        {"Error reading request from socket - socket timed out.", 1},
        {"Logging server activity to ", 3},
        {"Server stopping...", 3},
        {"Server log closed.", 3},
        {" sessions not cleaned up on exit.", 3},
        {"Daemon thread started. Thread id = 0x", 5},
        {"Adding user session 0x", 5},
        {"Removing user session 0x", 5},
        {" has timed-out -- removing.", 5},
        {"Daemon thread exiting normally.", 5},
        {"session thread 0x", 5},
        {"HttpDaemon thread: waiting on 128 connections.", 7},
        {"HttpDaemon thread: accepting connection:", 7},
        {"HttpDaemon thread: connected to 127.0.0.1.", 7},
        {"Debug level is now ", 9},
    };
    for (int level = 0; level <= 9; ++level) {
        StartAt(level);
        Poke();
        ASSERT_TRUE(WaitUntilListed());
        ASSERT_TRUE(Eventually([&] { return server->IsFinished(0); }));
        const Client idle(settings.port);  // sweeps the first
        ASSERT_TRUE(WaitUntilListed());
        ASSERT_TRUE(Eventually([&] {
            clock.Advance(settings.sessionTimeout + 1);
            Poke();
            char none;
            return WaitUntilListed() && recv(idle.Descriptor(), &none, 1, MSG_DONTWAIT) == 0;
        }));
        const Client left(settings.port);
        ASSERT_TRUE(WaitUntilListed());
        EXPECT_TRUE(server->Close());
        Check(level, lines);
    }
}

TEST_F(HttpLevels, EndOnAnError) {
    const Line lines[] = {
        {"listen failed", 1},
        {"Server log closed.", 3},
        {"Daemon thread exiting on error.", 3},
        {"session thread 0x", 5},
    };
    const Injected failing(
        oxSocket::m_lpfnlisten, +[](int, int) {
            errno = EADDRINUSE;
            return -1;
        });
    for (int level = 1; level <= 6; ++level) {
        StartAt(level);
        ASSERT_TRUE(Eventually([&] { return server->GetState() == oxHttpServer::STATE_ERROR; }));
        server->Stop();  // waits for the last lines
        Check(level, lines);
    }
}

TEST_F(HttpLevels, AccessLogThatCannotBeOpened) {
    struct Case {
        int level;
        bool written;
    };
    const Case cases[] = {{4, false}, {5, true}};
    std::vector<std::jthread> openings;  // at once: each takes three seconds
    testing::internal::CaptureStderr();
    for (const Case& c : cases) {
        openings.emplace_back([this, &c] {
            TestServer other(clock);
            oxHttpSettings mine = settings;
            mine.errorLogName = dir.File("errors" + std::to_string(c.level));
            mine.logFileName = "none/access";
            other.Configure(mine);
            other.MessageLog().SetDebugLevel(c.level);
            other.OpenAccessLog();
        });
    }
    openings.clear();
    testing::internal::GetCapturedStderr();
    for (const Case& c : cases) {
        const std::string text = dir.Read("errors" + std::to_string(c.level));
        EXPECT_EQ(text.find("Log file open failed: ") != std::string::npos, c.written) << c.level;
    }
}

}  // namespace
