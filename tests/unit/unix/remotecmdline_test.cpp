#include "unix/remotecmdline.h"

#include <gtest/gtest.h>

#include "unix/testtools.h"

TEST(OxRemoteCmdLine, SwitchesBecomeCommands) {
    const struct {
        const char* option;
        int command;
    } rows[] = {{"start", 1},    {"stop", 2},  {"status", 3},    {"debug", 5},   {"STARTNOW", 1}, {"statusx", 3},
                {"Stop now", 2}, {"DeBuG", 5}, {"startstop", 1}, {"update", -1}, {"s", -1},       {"star", -1},
                {"sto", -1},     {"stat", -1}, {"", -1},         {"xstart", -1}, {"help", -1}};
    for (const auto& row : rows) {
        const std::string option = row.option;
        EXPECT_EQ(oxRemoteCmdLine::Command(&option), row.command) << option;
    }
    EXPECT_EQ(oxRemoteCmdLine::Command(nullptr), -2);
}

TEST(OxRemoteCmdLine, UsageIsExact) {
    const char* argv[] = {"bin/ox_remote", nullptr};
    oxRemoteCmdLine line;
    ASSERT_TRUE(line.Parse(1, argv));
    TextStream out;
    line.Usage(out.File());
    EXPECT_EQ(out.Text(),
              "\nUsage:\n\n"
              "\tox_remote [-option]\n\n"
              "Where [-option] is one of:\n\n"
              "\t-start\t\tStarts the remote interface server.\n"
              "\t-stop\t\tStops the remote interface server.\n"
              "\t-status\t\tReports the current server status.\n\n");
}
