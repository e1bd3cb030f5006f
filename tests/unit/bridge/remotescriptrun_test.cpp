// Whole runs: real pipes, real engines.
#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <new>
#include <string>
#include <thread>
#include <vector>

#include "bridge/scriptrun.h"
#include "platform/file.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

std::string LargeBody(std::size_t size) {
    std::string body(size, '\0');
    for (std::size_t i = 0; i < size; ++i)
        body[i] = static_cast<char>(i * 31 + i / 251);  // NULs among them
    return body;
}

TEST_F(ScriptRun, ResultsOfTheEnginesEnd) {
    const struct {
        const char* moves;
        int result;
    } cases[] = {
        {"", 0},
        {"exitmsg", 0},
        {"exit 3", 3},
        {"exitmsg\nexit 4", 4},
        {"close 1\nexit 5", 5},
        {"kill 9", 9},
        {"kill 15", 15},
        {"exitmsg\nkill 11", 11},
        {"send 24 a b\nexpect 0 24|a|b\nexitmsg\n", 0},
        {"send 9 a b\nexpect -9 9|a|b\nexitmsg\n", 0},
        {"send 24 - -\nexpect 0 24||\nexit 6\n", 6},
        {"write-output page\nexitmsg\n", 0},
    };
    for (const auto& c : cases)
        EXPECT_EQ(c.result, Play(c.moves).result) << c.moves;
    EXPECT_FALSE(HasChildren());
}

TEST_F(ScriptRun, WithoutArguments) {
    oxRemoteScript script(m_home.Path().c_str());
    EXPECT_EQ(0, script.Run(0, nullptr, nullptr, EchoCallback, {}));
}

TEST_F(ScriptRun, EngineThatCannotBeStarted) {
    const std::string engine = m_home.Engine();
    ASSERT_EQ(0, unlink(engine.c_str()));
    int result = 0;
    EXPECT_EQ("Couldn't launch \"" + engine + "\": No such file or directory (2)\n",
              StandardError([&] { result = Play("").result; }));
    EXPECT_EQ(ENOENT, result);
    m_home.Files().Write("ox_script.bin", "not executable");
    EXPECT_EQ("execl error #13: Permission denied\n", StandardError([&] { result = Play("").result; }));
    EXPECT_EQ(EACCES, result);
}

TEST_F(ScriptRun, EmptyArgumentsKeepTheirPlacesAndBlanksDivide) {
    std::string script = m_home.Script("script.pl", "status\n");
    std::string output = m_home.File("script.out");
    std::string empty;
    std::string two = "two words";
    char* arguments[] = {empty.data(), script.data(), nullptr, output.data(), two.data(), empty.data()};
    EXPECT_EQ(0, oxRemoteScript(m_home.Path().c_str()).Run(6, arguments, nullptr, EchoCallback, {}));
    const std::string report = m_home.Files().Read("script.out");
    const std::string expected[] = {m_home.Engine(), "NULL", script, "NULL", output, "two", "words", "NULL"};
    for (std::size_t i = 0; i < std::size(expected); ++i)
        EXPECT_EQ(" " + expected[i], LineAfter(report, "argument " + std::to_string(i)));
    EXPECT_EQ(std::string::npos, report.find("argument 8"));
}

TEST_F(ScriptRun, EngineSeesItsPipesAndTheErrorStreamOnly) {
    // What the test program itself was started with is not the server's.
    ASSERT_EQ(0, close_range(3, ~0u, CLOSE_RANGE_CLOEXEC));
    const UniqueFd other(fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 100));
    ASSERT_TRUE(other);
    const std::string report = Play("status\n", "x").output;
    EXPECT_TRUE(LineAfter(report, "descriptor 0 ").starts_with("pipe:")) << report;
    EXPECT_TRUE(LineAfter(report, "descriptor 1 ").starts_with("pipe:")) << report;
    EXPECT_NE("", LineAfter(report, "descriptor 2 "));
    std::size_t count = 0;
    for (std::size_t at = 0; (at = report.find("descriptor ", at)) != std::string::npos; ++at)
        ++count;
    EXPECT_EQ(3u, count) << report;
    EXPECT_EQ("\t0000000000000000", LineAfter(report, "status SigBlk:"));
}

TEST_F(ScriptRun, RunsWithoutAStandardInput) {
    const UniqueFd saved(fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 3));
    close(STDIN_FILENO);
    const Outcome outcome = Play("read length\nwrite-body\nsend 24 a b\nexpect 0 24|a|b\nexitmsg\n", "hello");
    EXPECT_EQ(0, outcome.result);
    EXPECT_EQ("hello", outcome.output);
    // The run leaves the standard error in its place.
    struct stat input;
    struct stat error;
    ASSERT_EQ(0, fstat(STDIN_FILENO, &input));
    ASSERT_EQ(0, fstat(STDERR_FILENO, &error));
    EXPECT_EQ(error.st_ino, input.st_ino);
    EXPECT_EQ(error.st_dev, input.st_dev);
    if (saved) {
        EXPECT_TRUE(DuplicateOnto(saved.Get(), STDIN_FILENO));
    }
}

TEST_F(ScriptRun, DataArrivesWhole) {
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{4096}, std::size_t{65536},
                                   std::size_t{65537}, std::size_t{1000000}}) {
        const std::string body = LargeBody(size);
        const Outcome outcome = Play("read length\nwrite-body\nexitmsg\n", body);
        EXPECT_EQ(0, outcome.result) << size;
        EXPECT_TRUE(outcome.output == body) << size;
    }
}

TEST_F(ScriptRun, AnswersComeBehindTheData) {
    const std::string body = LargeBody(300000);
    const Outcome outcome = Play("send 24 early one\nread length\nwrite-body\nexpect 0 24|early|one\nexitmsg\n", body);
    EXPECT_EQ(0, outcome.result);
    EXPECT_TRUE(outcome.output == body);
}

TEST_F(ScriptRun, BothPipesFullAtOnce) {
    // 200 KB of messages before the first byte of the data is read.
    const std::string body = LargeBody(1000000);
    const Outcome outcome =
        Play("flood 50 4096\nread length\nwrite-body\nrepeat 50\nexpect 0 99||\nend\nexitmsg\n", body);
    EXPECT_EQ(0, outcome.result);
    EXPECT_TRUE(outcome.output == body);
}

TEST_F(ScriptRun, AnswersThatNobodyReadsAreKeptUpToALimit) {
    static const std::string large(60000, 'x');
    const auto callback = [](void*, const char*, int, char*, int*) { return large.c_str(); };
    EXPECT_EQ(0, Play("flood 16 4096\nrepeat 16\nanswer\nend\nexitmsg\n", {}, {}, callback).result);
    // Beyond it the engine is held up: it waits for room for its messages.
    const oxScriptLimits limits{nullptr, std::chrono::seconds(1)};
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, Play("flood 400 4096\nexitmsg\n", {}, limits, callback).result);
}

TEST_F(ScriptRun, DataThatTheEngineDoesNotTake) {
    const std::string lost = "Unable to transmit query to the scripting engine 32: Broken pipe\n";
    const std::string body = LargeBody(1000000);
    const struct {
        const char* moves;
        int result;
    } cases[] = {
        {"write-output page", 0},
        {"write-output page\nexitmsg", 0},
        {"write-output page\nclose 0\nexit 3", 3},
        {"write-output page\nclose 0\nclose 1\nexit 4", 4},
        {"write-output page\nkill 9", 9},
        {"write-output page\nread 1000\nexit 0", 0},
    };
    for (const auto& c : cases) {
        Outcome outcome{};
        EXPECT_EQ(lost, StandardError([&] { outcome = Play(c.moves, body); })) << c.moves;
        EXPECT_EQ(c.result, outcome.result) << c.moves;
        EXPECT_EQ("page", outcome.output);
    }
}

TEST_F(ScriptRun, EngineThatLeavesAChildBehind) {
    const struct {
        const char* moves;
        std::string data;
        int result;
        const char* line;
    } cases[] = {
        {"fork-sleep 60\nexit 0", "", 0, ""},
        {"fork-sleep 60\nexit 7", "data", 7, ""},
        {"fork-sleep 60\nsend 24 a b\nexpect 0 24|a|b\nkill 9", "", 9, ""},
        {"fork-sleep 60\nexit 0", LargeBody(200000), 0,
         "Unable to transmit query to the scripting engine 32: Broken pipe\n"},
    };
    for (const auto& c : cases) {
        const auto start = steady_clock::now();
        Outcome outcome{};
        EXPECT_EQ(c.line, StandardError([&] { outcome = Play(c.moves, c.data); })) << c.moves;
        const LeftBehind child(outcome.output);
        EXPECT_TRUE(child.IsAlive());
        EXPECT_EQ(c.result, outcome.result) << c.moves;
        EXPECT_LT(steady_clock::now() - start, std::chrono::seconds(30));
    }
}

TEST_F(ScriptRun, LastMessagesOfAnEngineThatEndedAreServed) {
    static int served;
    served = 0;
    const auto count = [](void*, const char*, int, char*, int*) {
        ++served;
        return "";
    };
    EXPECT_EQ(2, Play("flood 10 4096\nexit 2", {}, {}, count).result);
    EXPECT_EQ(10, served);
}

TEST_F(ScriptRun, GarbageIsNotAnsweredAndTheRunGoesOn) {
    Outcome outcome{};
    const std::string lines = StandardError([&] {
        // The answer that is expected is the first one that comes at all.
        outcome = Play(
            "raw 0102\nwait-read\nraw 4558\nwait-read\nraw 1800000000\nwait-read\n"
            "send 24 still here\nexpect 0 24|still|here\nexitmsg\n");
    });
    EXPECT_EQ(0, outcome.result);
    EXPECT_EQ(
        "A message of the scripting engine (2 bytes) is not answered: it is too short.\n"
        "A message of the scripting engine (2 bytes) is not answered: it is too short.\n"
        "A message of the scripting engine (5 bytes) is not answered: it is too short.\n",
        lines);
}

TEST_F(ScriptRun, WhateverBeginsWithTheExitWordIsNoMessage) {
    static int served;
    served = 0;
    const auto count = [](void*, const char*, int, char*, int*) {
        ++served;
        return "";
    };
    EXPECT_EQ(0, Play("raw 45584954000000000000000000\n", {}, {}, count).result);
    EXPECT_EQ(0, Play("raw 455849542d6e6f77\nexit 0\n", {}, {}, count).result);
    EXPECT_EQ(0, served);
}

TEST_F(ScriptRun, ContextIsHandedToTheCallback) {
    std::string script = m_home.Script("script.pl", "send 24 a b\nexpect 0 24|a|b+context\nexitmsg\n");
    std::string context = "+context";
    char* arguments[] = {nullptr, script.data()};
    EXPECT_EQ(0, oxRemoteScript(m_home.Path().c_str()).Run(2, arguments, context.data(), EchoCallback, {}));
}

TEST_F(ScriptRun, TakesNoPollsSecond) {
    const auto start = steady_clock::now();
    for (int i = 0; i < 20; ++i)
        EXPECT_EQ(0, Play("send 24 a b\nexpect 0 24|a|b\nexitmsg\n").result);
    EXPECT_LT(steady_clock::now() - start, std::chrono::seconds(18));
}

TEST_F(ScriptRun, NoPipe) {
    rlimit limit{};
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &limit));
    oxRemoteScript script(m_home.Path().c_str());
    int result = -100;
    const std::string line = StandardError([&] {
        const rlimit none{3, limit.rlim_max};
        setrlimit(RLIMIT_NOFILE, &none);
        result = script.Run(0, nullptr, nullptr, EchoCallback, {});
        setrlimit(RLIMIT_NOFILE, &limit);
    });
    EXPECT_EQ("pipe() error 24: Too many open files\n", line);
    EXPECT_EQ(0, result);
}

// In a process of its own, which gives up root: root may start any number of processes.
[[noreturn]] void RunWithoutProcesses(const std::string& directory) {
    constexpr uid_t NOBODY = 65534;
    const rlimit none{0, 0};
    if (setrlimit(RLIMIT_NPROC, &none) != 0 || (getuid() == 0 && setresuid(NOBODY, NOBODY, NOBODY) != 0))
        _exit(1);
    const auto before = OpenDescriptors();
    for (int i = 0; i < 100; ++i)
        if (oxRemoteScript(directory.c_str()).Run(0, nullptr, nullptr, EchoCallback, "data") !=
            oxRemoteScript::RESULT_NOT_SPAWNED)
            _exit(2);
    _exit(OpenDescriptors() == before ? 0 : 3);
}

TEST_F(ScriptRun, NoProcessToBeHadFailsAtOnce) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(RunWithoutProcesses(m_home.Path()), testing::ExitedWithCode(0),
                "Fork\\(\\) error 11: Resource temporarily unavailable");
}

TEST_F(ScriptRun, ExceptionOfTheCallbackLeavesNothingBehind) {
    Play("");  // what the first run makes stays
    const auto before = OpenDescriptors();
    const auto fail = [](void*, const char*, int, char*, int*) -> const char* { throw std::bad_alloc(); };
    std::string script = m_home.Script("script.pl", "send 61 1 -\nexpect 0 OK\nsend 24 a b\nforever\n");
    char* arguments[] = {nullptr, script.data()};
    oxRemoteScript run(m_home.Path().c_str());
    EXPECT_THROW(run.Run(2, arguments, nullptr, fail, {}), std::bad_alloc);
    EXPECT_FALSE(HasChildren());
    EXPECT_EQ(before, OpenDescriptors());
    EXPECT_EQ(oxRemoteScript::rwUnlocked, run.GetLockState());
    EXPECT_EQ(0, Play("send 61 2 -\nexpect 0 OK\n").result);
}

TEST_F(ScriptRun, ManyRunsLeaveNothingBehind) {
    Play("");
    const auto before = OpenDescriptors();
    const std::string body = LargeBody(100000);
    for (int i = 0; i < 30; ++i) {
        Play("read length\nsend 60 1 -\nexpect 0 TOKEN RETREIVED SUCCESSFULLY\nexitmsg\n", body);
        Play("kill 9");
        StandardError([&] { Play("close 0\nsend 24 a b\n", body); });
    }
    EXPECT_FALSE(HasChildren());
    EXPECT_EQ(before, OpenDescriptors());
    EXPECT_EQ(0, Play("send 61 2 -\nexpect 0 OK\n").result);
}

}  // namespace
