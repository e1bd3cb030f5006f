// Ends of children that are hard to take: without memory, or with a debugger in between.
#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>
#include <thread>

#include "bridge/proctools.h"
#include "bridge/scriptrun.h"
#include "bridge/support_allocation.h"
#include "bridge/support_failures.h"
#include "bridge/tracer.h"

namespace {

using namespace std::chrono_literals;

// While a child could not be reaped: more looks than naps between them allow, far less than a loop without any takes.
constexpr long MOST_LOOKS_A_SECOND = 500;

bool IsZombie(int pid) {
    const std::string stat = TextOf("/proc/" + std::to_string(pid) + "/stat");
    const std::size_t name = stat.rfind(')');
    return name != std::string::npos && stat.compare(name, 3, ") Z") == 0;
}

class ReapingOfEngines : public ScriptRun {
protected:
    // Runs the moves in a forked copy with a callback that fails for want of memory, which lasts until the run is left.
    // With an argument the callback waits for the end of the engine first.
    int RunWithoutMemory(const std::string& moves) const {
        return InForkedCopy([&] {
            const auto fail = [](void*, const char*, int, char* argumentText, int*) -> const char* {
                // Without a child it has ended too, and the run has noticed.
                siginfo_t end;
                while (*argumentText != '\0' && waitid(P_ALL, 0, &end, WEXITED | WNOWAIT) != 0 && errno != ECHILD) {
                }
                FailAllocations(true);
                throw std::bad_alloc();
            };
            std::string script = m_home.Script("script.pl", moves);
            char* arguments[] = {nullptr, script.data()};
            oxRemoteScript run(m_home.Path().c_str());
            bool thrown = false;
            try {
                run.Run(2, arguments, nullptr, fail, {});
            } catch (const std::bad_alloc&) {
                thrown = true;
            }
            FailAllocations(false);
            if (!thrown || HasChildren() || run.GetLockState() != oxRemoteScript::rwUnlocked)
                return 2;
            return Play("send 61 2 -\nexpect 0 OK\nexitmsg\n").result == 0 ? 0 : 3;
        });
    }

    struct Looks {
        int result;
        long count;  // a second, while the engine had ended and could not be reaped
        int error;   // why it could not be traced
    };
    Looks PlayTraced(const std::string& moves) {
        Looks looks{-100, 0, 0};
        m_home.Files().Write("script.out", "");
        std::thread run([&] { looks.result = Play("status\ntouch " + m_home.File("ready") + "\n" + moves).result; });
        EXPECT_TRUE(Eventually([&] { return access(m_home.File("ready").c_str(), F_OK) == 0; }));
        const int pid = std::atoi(LineAfter(m_home.Files().Read("script.out"), "status Pid:").c_str());
        EXPECT_GT(pid, 0);
        {
            const Tracer tracer(pid);
            looks.error = tracer.Error();
            m_home.Files().Write("go", "");
            if (looks.error == 0) {
                EXPECT_TRUE(Eventually([&] { return IsZombie(pid); }));
                const long before = WaitPidCalls();
                std::this_thread::sleep_for(1s);
                looks.count = WaitPidCalls() - before;
                EXPECT_TRUE(IsZombie(pid)) << "it was to be kept all the time";
            }
        }
        run.join();
        return looks;
    }
};

}  // namespace

TEST_F(ReapingOfEngines, MemoryThatStaysShortWhileTheRunIsLeftEndsNothingElse) {
    const struct {
        const char* what;
        const char* moves;
    } rows[] = {
        {"it runs and is killed", "send 24 a -\nforever\n"},
        {"it has ended", "send 24 a ended\nexit 3\n"},
        {"it was killed", "send 24 a ended\nkill 9\n"},
        {"it holds the lock", "send 61 1 -\nexpect 0 OK\nsend 24 a -\nforever\n"},
    };
    for (const auto& row : rows)
        EXPECT_EQ(0, RunWithoutMemory(row.moves)) << row.what;
}

TEST_F(ReapingOfEngines, AnEndedEngineThatIsTracedIsLookedAtNowAndThen) {
    const std::string wait = "wait-file " + m_home.File("go") + "\n";
    const struct {
        const char* what;
        std::string moves;
    } rows[] = {
        {"its pipes are closed", wait + "exit 7\n"},
        {"it said its last word", "exitmsg\n" + wait + "exit 7\n"},
        {"a child of its keeps them open", "fork-sleep 60\n" + wait + "exit 7\n"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.what);
        for (const char* file : {"go", "ready"})
            unlink(m_home.File(file).c_str());
        const Looks looks = PlayTraced(row.moves);
        const LeftBehind child(m_home.Files().Read("script.out"));
        if (looks.error != 0)
            GTEST_SKIP() << "tracing is not permitted here: " << std::strerror(looks.error);
        EXPECT_EQ(7, looks.result) << "reaped as soon as it can be";
        EXPECT_GT(looks.count, 0) << "it is looked at";
        EXPECT_LT(looks.count, MOST_LOOKS_A_SECOND);
    }
    EXPECT_FALSE(HasChildren());
}

TEST(OxProc, AnEndedChildThatIsTracedIsLookedAtNowAndThen) {
    TestPipe in;
    oxProc proc;
    proc.m_childStdin = in.readEnd.Release();
    const int pid = proc.Spawn("/bin/cat", "");
    ASSERT_NE(0, pid);
    ASSERT_TRUE(Eventually([&] { return RunsProgram(pid, "cat"); }));
    {
        const Tracer tracer(pid);
        in.writeEnd.Reset();
        if (tracer.Error() != 0) {
            EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT));
            GTEST_SKIP() << "tracing is not permitted here: " << std::strerror(tracer.Error());
        }
        ASSERT_TRUE(Eventually([&] { return IsZombie(pid); }));
        const long before = WaitPidCalls();
        EXPECT_EQ(oxProc::STILL_RUNNING, proc.Wait(1000));
        EXPECT_LT(WaitPidCalls() - before, MOST_LOOKS_A_SECOND);
    }
    EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT));
}
