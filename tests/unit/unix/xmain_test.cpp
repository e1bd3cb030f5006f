#include "unix/xmain.h"

#include <gtest/gtest.h>

#include "unix/testtools.h"

namespace {
using Texts = std::vector<std::string>;

const std::string BANNER = "\nOrvex Reporting UI\n";
const std::string USAGE =
    "\nUsage:\n\n"
    "\tox_remote [-option]\n\n"
    "Where [-option] is one of:\n\n"
    "\t-start\t\tStarts the remote interface server.\n"
    "\t-stop\t\tStops the remote interface server.\n"
    "\t-status\t\tReports the current server status.\n\n";
const std::string NOT_RUNNING = "Error: The server is not running (2).\n\n";

class Xmain : public testing::Test {
protected:
    void SetUp() override {
        std::filesystem::create_directories("oxm_oxx");
        WriteText("oxm_oxx/oxm_oxx.ini", "");
        WriteSettings("");
    }
    // Whoever runs the tests owns the directory, so that is whom the program is to run as.
    void WriteSettings(const std::string& more) {
        WriteText("ox_remote.ini",
                  "[unix]\nuid=" + std::to_string(geteuid()) + "\ngid=" + std::to_string(getegid()) + "\n" + more);
    }
    // The exit status; what the program wrote is in `out`.
    int Run(const Texts& arguments) {
        const int status = RunInChild([&] {
            RedirectTo(1, scratch.File("out"));
            RedirectTo(2, scratch.File("err"));
            Texts texts{"./ox_remote"};
            texts.insert(texts.end(), arguments.begin(), arguments.end());
            std::vector<char*> argv;
            for (auto& text : texts)
                argv.push_back(text.data());
            argv.push_back(nullptr);
            const int result = xmain(static_cast<int>(texts.size()), argv.data());
            std::fflush(stdout);
            return result;
        });
        out = ReadText(scratch.File("out"));
        err = ReadText(scratch.File("err"));
        std::filesystem::remove(scratch.File("out"));
        std::filesystem::remove(scratch.File("err"));
        return status;
    }

    ScratchDirectory scratch;
    std::string out;
    std::string err;
};
}  // namespace

TEST_F(Xmain, OptionsAreCarriedOutInTheirOrder) {
    const std::string invalid = "\nError: Invalid argument\n";
    const struct {
        Texts arguments;
        int status;
        std::string out;
    } rows[] = {
        {{}, 1, BANNER + USAGE},
        {{"start"}, 1, BANNER + USAGE},
        {{"--"}, 1, BANNER + USAGE},
        {{"a=b"}, 1, BANNER + USAGE},
        {{"-update"}, 1, BANNER + invalid + USAGE},
        {{"-s"}, 1, BANNER + invalid + USAGE},
        {{"-stop"}, 1, BANNER + NOT_RUNNING},
        {{"-status"}, 1, BANNER + NOT_RUNNING},
        {{"-stop-now"}, 1, BANNER + NOT_RUNNING},
        {{"--STATUSX"}, 1, BANNER + NOT_RUNNING},
        {{"-status", "-stop"}, 1, BANNER + NOT_RUNNING + NOT_RUNNING},
        {{"-status", "-bogus", "-stop"}, 1, BANNER + NOT_RUNNING + invalid + USAGE},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::PrintToString(row.arguments));
        EXPECT_EQ(Run(row.arguments), row.status);
        EXPECT_EQ(out, row.out);
        EXPECT_EQ(err, "");
    }
}

TEST_F(Xmain, WithoutSettingsNoCommandRuns) {
    std::filesystem::remove("ox_remote.ini");
    for (const char* option : {"-start", "-stop", "-status", "-debug", "-x"}) {
        EXPECT_EQ(Run({option}), 1);
        EXPECT_EQ(out, "Error: unable to read configuration files.");
        EXPECT_EQ(err, "");
    }
}

TEST_F(Xmain, SettingsThatDoNotLoadAreNamed) {
    std::filesystem::remove("ox_remote.ini");
    std::filesystem::create_directory("ox_remote.ini");
    EXPECT_EQ(Run({"-stop"}), 1);
    EXPECT_EQ(out, "Error: unable to read configuration files.");
    EXPECT_EQ(err, "Exception caught in ./ox_remote_exe/src/unix/xmain at ln. 607: ./ox_remote.ini\n");
}

TEST_F(Xmain, AMissingProgramNameGivesTheUsage) {
    EXPECT_EQ(RunInChild([&] {
                  RedirectTo(1, "out");
                  char* argv[] = {nullptr};
                  return xmain(0, argv);
              }),
              1);
    EXPECT_EQ(ReadText("out").substr(0, 14), "\nUsage:\n\n\t [-o");
}

TEST_F(Xmain, TheStartupLogLiesBesideTheProgram) {
    WriteSettings("[Audit]\ndebuglevel=9\n[unix]\nhandles=1\n");  // a limit that is there already says nothing
    Run({"-stop"});
    EXPECT_EQ(out, BANNER + NOT_RUNNING) << "the level's line is not echoed";
    const std::string log = ReadText("ox_remote.startup");
    EXPECT_NE(log.find(": Debug level is now 9.\n"), std::string::npos) << log;
    EXPECT_TRUE(std::filesystem::is_directory("oxm_oxx/datfiles/statuslogs"));
}

TEST_F(Xmain, AStatusLogsDirectoryThatCannotBeMadeEndsTheProgram) {
    WriteText("file", "");
    WriteSettings("[Audit]\nlogdir=./file/logs\n");
    EXPECT_EQ(Run({"-stop"}), 1);
    EXPECT_EQ(out, "Could not create the status logs directory - ./file/logs.");
}

TEST_F(Xmain, ARunningServerIsNotStartedTwice) {
    WriteText("ox_remote.pid", std::to_string(getpid()) + "\n");
    EXPECT_EQ(Run({"-start", "-debug"}), 1);
    EXPECT_EQ(out, BANNER + "The server is already running!\n\n\n[Debug]\n\nThe server is already running!\n\n");
    EXPECT_FALSE(std::filesystem::exists("ox_remote.startup"));
    EXPECT_EQ(ReadText("ox_remote.pid"), std::to_string(getpid()) + "\n");
}

TEST_F(Xmain, GarbageInThePidFileRefusesTheStart) {
    WriteText("ox_remote.pid", "abc\n");
    EXPECT_EQ(Run({"-debug"}), 1);
    EXPECT_EQ(out, BANNER + "\n[Debug]\n\nThe server is already running!\n\n");
}

TEST_F(Xmain, AStatusLogThatCannotBeOpenedIsNamed) {
    WriteText("ox_remote.pid", "abc\n");
    std::filesystem::create_directories("oxm_oxx/datfiles/statuslogs/oxinterface.audit");
    EXPECT_EQ(Run({"-debug"}), 1);
    EXPECT_EQ(out, BANNER +
                       "Error: can't open ./oxm_oxx/datfiles/statuslogs/oxinterface.audit: Is a directory\n"
                       "\n[Debug]\n\nThe server is already running!\n\n");
}
