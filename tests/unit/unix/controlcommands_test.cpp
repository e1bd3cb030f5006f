#include "unix/controlcommands.h"

#include <gtest/gtest.h>
#include <signal.h>

#include "unix/pidfile.h"
#include "unix/startupconfig.h"
#include "unix/testtools.h"

namespace {
using namespace std::chrono_literals;

class OxControlCommands : public testing::Test {
protected:
    // A stand-in for the server: it waits for the signal and ends with its number, unless it is to stay.
    pid_t StartServer(int number, bool stays = false) {
        int ready[2];
        EXPECT_EQ(pipe(ready), 0);
        const pid_t child = StartChild([=] {
            sigset_t all;
            sigfillset(&all);
            sigprocmask(SIG_SETMASK, &all, nullptr);
            if (write(ready[1], "x", 1) != 1)
                return 1;
            int taken = 0;
            do {
                sigwait(&all, &taken);
            } while (stays || taken != number);
            return taken;
        });
        char byte;
        EXPECT_EQ(read(ready[0], &byte, 1), 1);
        close(ready[0]);
        close(ready[1]);
        WriteText("x.pid", std::to_string(child) + "\n");
        return child;
    }
    pid_t DeadProcess() {
        const pid_t child = StartChild([] { return 0; });
        Reap(child);
        return child;
    }

    ScratchDirectory scratch;
    LinesAudit audit;
    oxPidFile pidFile{"x.pid", audit};
    oxStartupConfig config;
    TextStream out;
    oxControlCommands control{pidFile, config, out.File()};
};
}  // namespace

TEST(SpinnerStep, GoesRoundAndPadsTheMessage) {
    const std::string faces = "|/-\\";
    const std::size_t first = faces.find(SpinnerStep(nullptr)[1]);
    ASSERT_NE(first, std::string::npos);
    for (std::size_t i = 1; i <= 8; ++i) {
        const std::string face(1, faces[(first + i) % 4]);
        if (i % 2 == 0)
            EXPECT_EQ(SpinnerStep(nullptr), "\r" + face + " ");
        else
            EXPECT_EQ(SpinnerStep("Server stopping... "),
                      "\r" + face + " Server stopping... " + std::string(58, ' ') + "\r");
    }
    EXPECT_EQ(SpinnerStep(std::string(100, 'x').c_str()).substr(3), std::string(78, 'x') + "\r");
    EXPECT_EQ(SpinnerStep("").substr(3), std::string(77, ' ') + "\r");
}

TEST_F(OxControlCommands, WithoutAPidFileTheServerIsNotRunning) {
    EXPECT_FALSE(control.Stop());
    EXPECT_FALSE(control.Status());
    EXPECT_EQ(out.Text(), "Error: The server is not running (2).\n\nError: The server is not running (2).\n\n");
}

TEST_F(OxControlCommands, ADeadProcessIsNotRunning) {
    WriteText("x.pid", std::to_string(DeadProcess()) + "\n");
    EXPECT_FALSE(control.Stop());
    EXPECT_FALSE(control.Status());
    EXPECT_EQ(out.Text(), "Error: The server is not running (3).\n\nError: The server is not running (3).\n\n");
}

TEST_F(OxControlCommands, GarbageInThePidFileSignalsNobody) {
    for (const char* text : {"abc\n", "", "-1\n", "0"}) {
        WriteText("x.pid", text);
        EXPECT_FALSE(control.Stop());
        EXPECT_FALSE(control.Status());
    }
    std::string wanted;
    for (int i = 0; i < 4; ++i)
        wanted +=
            "Error: Failed to signal the server (3).\n\n"
            "Error: Failed to get the server status (3).\n\n";
    EXPECT_EQ(out.Text(), wanted);
}

TEST_F(OxControlCommands, StatusSendsItsSignalAndPointsToTheLog) {
    const pid_t child = StartServer(31);
    EXPECT_TRUE(control.Status());
    EXPECT_EQ(Reap(child), 31);
    EXPECT_EQ(out.Text(),
              "Status request sent to the server.\n"
              "Refer to ./oxm_oxx/datfiles/statuslogs/oxinterface.audit for results.\n\n");
}

TEST_F(OxControlCommands, StopReturnsWhenTheServerEndsEvenAsAZombie) {
    const pid_t child = StartServer(15);
    const auto before = std::chrono::steady_clock::now();
    EXPECT_TRUE(control.Stop({60s, 60s}));
    EXPECT_LT(std::chrono::steady_clock::now() - before, 30s);
    EXPECT_EQ(Reap(child), 15);
    const std::string text = out.Text();
    const std::string ending = "The server has been stopped.\n";
    ASSERT_GE(text.size(), ending.size());
    EXPECT_EQ(text.substr(text.size() - ending.size()), ending);
}

TEST_F(OxControlCommands, AServerThatTakesLongerIsStillASuccess) {
    const pid_t child = StartServer(15, true);
    EXPECT_TRUE(control.Stop({50ms, 20ms}));
    kill(child, SIGKILL);
    Reap(child);
    const std::string text = out.Text();
    const std::string ending = " \rThe server stop is still in progress.\n";
    ASSERT_GE(text.size(), 2 * 81 + ending.size() - 2) << "one spinner step for each step of the wait";
    EXPECT_EQ(text.substr(text.size() - ending.size()), ending);
}
