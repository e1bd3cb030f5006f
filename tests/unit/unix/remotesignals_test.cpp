#include "unix/remotesignals.h"

#include <gtest/gtest.h>

#include "unix/fakecontrol.h"
#include "unix/testtools.h"

namespace {
using Texts = std::vector<std::string>;

class OxRemoteSignals : public testing::Test {
protected:
    LinesAudit audit;
    FakeControl server;
    oxControlRecord control{audit, server, "10.1.1.1"};
    oxRemoteSignals signals{control};
    const std::string process = "Process " + std::to_string(getpid());
};
}  // namespace

TEST_F(OxRemoteSignals, EachNumberHasItsReaction) {
    const struct {
        int number;
        bool ends;
        Texts calls;
        Texts lines;
    } rows[] = {
        {2, true, {"stop"}, {"10|Signal received: 2 - Interrupt", process + " cancelled - cleaning up..."}},
        {6, true, {"stop"}, {"10|Signal received: 6 - Aborted", process + " cancelled - cleaning up..."}},
        {15,
         true,
         {"stop"},
         {"10|Signal received: 15 - Terminated", process + " termination requested. Cleaning up..."}},
        {16,
         false,
         {"stop", "start"},
         {"10|Signal received: 16 - Stack fault", process + ": oxSIGRESET received - resetting the server:"}},
        {17, true, {}, {"10|Signal received: 17 - Child exited"}},
        {31,
         false,
         {},
         {"10|Signal received: 31 - Bad system call", process + ": oxSIGSTATUS received - current server status:",
          "Remote interface server is active on port 8081."}},
        {1, false, {}, {"10|Signal received: 1 - Hangup"}},
        {13, false, {}, {"10|Signal received: 13 - Broken pipe"}},
        {30, false, {}, {"10|Signal received: 30 - Power failure"}},
        {34, false, {}, {"10|Signal received: 34 - Real-time signal 0"}},
        {64, false, {}, {"10|Signal received: 64 - Real-time signal 30"}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.number);
        audit.lines.clear();
        server.calls.clear();
        EXPECT_EQ(signals.OnSignal(row.number), row.ends);
        EXPECT_EQ(server.calls, row.calls);
        EXPECT_EQ(audit.lines, row.lines);
    }
}

TEST_F(OxRemoteSignals, TheReportFollowsTheState) {
    const struct {
        int status;
        Texts lines;
    } rows[] = {{0, {"Remote interface server is active on port 8081."}},
                {-1, {"Remote interface server is stopped."}},
                {-2, {"Remote interface server reports an error."}},
                {-3, {}},
                {1, {}}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.status);
        audit.lines.clear();
        server.status = row.status;
        EXPECT_FALSE(signals.OnSignal(31));
        ASSERT_GE(audit.lines.size(), 2U);
        EXPECT_EQ(Texts(audit.lines.begin() + 2, audit.lines.end()), row.lines);
    }
}

TEST_F(OxRemoteSignals, AResetKeepsTheRelativeDirectories) {
    server.startResult = oxServerControl::START_FAILED;
    EXPECT_FALSE(signals.OnSignal(16)) << "the loop goes on after a failed restart";
    EXPECT_EQ(server.started.ersAddress, "10.1.1.1");
    EXPECT_EQ(server.started.settingsFile, "./ox_remote.ini");
    EXPECT_EQ(server.started.section, "RemoteConfiguration");
    EXPECT_EQ(server.started.baseDirectory, ".");
    EXPECT_EQ(server.started.documentRoot, "./wwwroot");
    EXPECT_EQ(server.started.defaultPort, 80);
}
