// Runs that are stopped, take too long, or wait for each other.
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "bridge/scriptrun.h"
#include "testing/waiting.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

// Generous for slow builds, and far from the next stated time.
constexpr milliseconds SLACK{4000};

class ScriptRunLimits : public ScriptRun {
protected:
    bool Exists(const std::string& name) const { return access(m_home.File(name).c_str(), F_OK) == 0; }

    struct Stopped {
        Outcome outcome;
        milliseconds took;  // from the stop to the end of the run
    };
    // Stops the run when the engine has made the file "ready".
    Stopped PlayAndStop(const std::string& moves, std::string_view data = {}) const {
        unlink(m_home.File("ready").c_str());
        std::atomic<bool> stop{false};
        steady_clock::time_point stoppedAt;
        std::jthread stopper([&] {
            EXPECT_TRUE(Eventually([&] { return Exists("ready"); }));
            stoppedAt = steady_clock::now();
            stop = true;
        });
        const Outcome outcome = Play(moves, data, {&stop, {}});
        const auto end = steady_clock::now();
        stopper.join();
        return {outcome, std::chrono::duration_cast<milliseconds>(end - stoppedAt)};
    }
    std::string Ready() const { return "touch " + m_home.File("ready") + "\n"; }
};

TEST_F(ScriptRunLimits, StopInterruptsTheEngine) {
    const std::string moves[] = {
        Ready() + "forever\n",
        Ready() + "answer\n",
        Ready() + "repeat 1000000000\nsend 24 a b\nexpect 0 24|a|b\nend\n",
        Ready() + "flood 1000000000 4096\n",
        // Its talk is over, the engine is not.
        "exitmsg\n" + Ready() + "forever\n",
        "close 1\n" + Ready() + "forever\n",
    };
    for (const std::string& text : moves) {
        const Stopped stopped = PlayAndStop(text);
        EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result) << text;
        EXPECT_LT(stopped.took, SLACK) << text;
    }
    EXPECT_FALSE(HasChildren());
}

TEST_F(ScriptRunLimits, StopWhileDataIsWaiting) {
    const std::string body(1000000, 'x');
    Stopped stopped{};
    StandardError([&] { stopped = PlayAndStop(Ready() + "forever\n", body); });
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result);
    EXPECT_LT(stopped.took, SLACK);
}

TEST_F(ScriptRunLimits, StopCountsWhateverTheEnginesCode) {
    // It ends with 0 by itself, after the interrupt.
    const Stopped stopped = PlayAndStop("catch 2\n" + Ready() + "wait-signal\nexit 0\n");
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result);
}

TEST_F(ScriptRunLimits, StoppedEngineIsServedUntilItEnds) {
    const Stopped stopped = PlayAndStop(
        "catch 2\n" + Ready() + "wait-signal\nsend 24 last words\nexpect 0 24|last|words\nwrite-answer\nexitmsg\n");
    EXPECT_EQ("0 24|last|words\n", stopped.outcome.output);
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result);
}

TEST_F(ScriptRunLimits, EngineThatIgnoresTheInterruptIsKilled) {
    const std::string moves[] = {
        "ignore 2\n" + Ready() + "forever\n",
        // Not even the end of its talk gives it more time.
        "ignore 2\nclose 1\n" + Ready() + "forever\n",
        "catch 2\n" + Ready() + "wait-signal\nexitmsg\nforever\n",
    };
    for (const std::string& text : moves) {
        const Stopped stopped = PlayAndStop(text);
        EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result) << text;
        EXPECT_GT(stopped.took, oxRemoteScript::END_GRACE - milliseconds(500)) << text;
        EXPECT_LT(stopped.took, oxRemoteScript::END_GRACE + SLACK) << text;
    }
    EXPECT_FALSE(HasChildren());
}

TEST_F(ScriptRunLimits, TimeLimitEndsTheRun) {
    const auto start = steady_clock::now();
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, Play("forever\n", {}, {nullptr, seconds(1)}).result);
    EXPECT_GE(steady_clock::now() - start, seconds(1));
    EXPECT_LT(steady_clock::now() - start, seconds(1) + SLACK);
    EXPECT_EQ(0, Play("exitmsg\n", {}, {nullptr, seconds(60)}).result);
    EXPECT_EQ(3, Play("exit 3\n", {}, {nullptr, seconds::max()}).result);
}

TEST_F(ScriptRunLimits, EngineThatStaysAfterItsTalkIsKilled) {
    const milliseconds wait(oxRemoteScript::END_WAIT);
    const auto start = steady_clock::now();
    EXPECT_EQ(SIGKILL, Play("exitmsg\nforever\n", std::string(1000000, 'x')).result);
    EXPECT_GE(steady_clock::now() - start, wait);
    EXPECT_LT(steady_clock::now() - start, wait + SLACK);
}

TEST_F(ScriptRunLimits, LockOfOneRunIsRefusedToAnother) {
    const std::string read = "TOKEN RETREIVED SUCCESSFULLY";
    std::jthread holder([&] {
        EXPECT_EQ(0, Play("send 61 1 -\nexpect 0 OK\ntouch " + m_home.File("locked") + "\nwait-file " +
                              m_home.File("tried") + "\nsend 61 0 -\nexpect 0 OK\ntouch " + m_home.File("freed") +
                              "\nwait-file " + m_home.File("done") + "\nexitmsg\n",
                          {}, {}, EchoCallback, "holder")
                         .result);
    });
    EXPECT_EQ(0, Play("wait-file " + m_home.File("locked") +
                      "\nsend 60 2 -\nexpect -1 ERROR\nsend 61 2 -\nexpect -1 ERROR\nsend 61 0 -\nexpect 0 OK\n"
                      "send 61 2 -\nexpect -1 ERROR\ntouch " +
                      m_home.File("tried") + "\nsend 60 1 -\nexpect 0 " + read + "\nsend 60 2 -\nexpect 0 " + read +
                      "\nwait-file " + m_home.File("freed") + "\nexitmsg\n")
                     .result);
    // That one left two reads behind.
    EXPECT_EQ(SIGKILL, Play("send 61 2 -\nexpect 0 OK\nsend 61 1 -\nexpect -1 ERROR\nkill 9\n").result);
    EXPECT_EQ(0, Play("send 60 2 -\nexpect 0 " + read + "\ntouch " + m_home.File("done") + "\n").result);
}

TEST_F(ScriptRunLimits, WaitForTheLockIsGivenUp) {
    const std::string free = m_home.File("free");
    std::jthread holder([&] {
        EXPECT_EQ(
            0, Play("send 61 1 -\nexpect 0 OK\ntouch " + m_home.File("locked") + "\nwait-file " + free + "\nexitmsg\n",
                    {}, {}, EchoCallback, "holder")
                   .result);
    });
    ASSERT_TRUE(Eventually([&] { return Exists("locked"); }));
    // Stopped.
    const Stopped stopped = PlayAndStop(Ready() + "send 60 1 -\nanswer\nforever\n");
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED, stopped.outcome.result);
    EXPECT_LT(stopped.took, SLACK);
    // Past the time limit.
    EXPECT_EQ(oxRemoteScript::RESULT_ENDED,
              Play("ignore 2\nsend 61 1 -\nexpect -1 ERROR\nexitmsg\n", {}, {nullptr, seconds(1)}).result);
    // The engine has ended.
    EXPECT_EQ(4, Play("send 61 1 -\nexit 4\n").result);
    m_home.Files().Write("free", "");
}

TEST_F(ScriptRunLimits, RepliesOfManyRunsNeverMix) {
    constexpr int ENGINES = 16;
    const auto reply = [](void*, const char* contextString, int, char* argumentText, int* status) -> const char* {
        thread_local char text[65536];
        std::snprintf(text, sizeof text, "%s=%s", contextString, argumentText);
        *status = 0;
        return text;
    };
    std::vector<std::jthread> threads;
    for (int i = 0; i < ENGINES; ++i)
        threads.emplace_back([this, i, reply] {
            const std::string own = "engine" + std::to_string(i);
            const std::string moves = "repeat 300\nsend 70 " + own + " token%n\nexpect 0 " + own +
                                      "=token%n\nsend 71 " + own + " %a\nexpect 0 " + own +
                                      "=%a\nend\nwrite-answer\nexitmsg\n";
            const Outcome outcome = Play(moves, {}, {}, reply, own);
            EXPECT_EQ(0, outcome.result);
            EXPECT_EQ("0 " + own + "=" + own + "=token299\n", outcome.output);
        });
    threads.clear();
    EXPECT_FALSE(HasChildren());
}

}  // namespace
