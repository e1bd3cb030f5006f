#include "proc.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>

#include <atomic>
#include <cstring>
#include <memory>
#include <thread>
#include <vector>

#include "bridge/proctools.h"
#include "bridge/support_failures.h"
#include "platform/poll.h"

namespace {
using namespace std::chrono_literals;
using std::chrono::steady_clock;

constexpr long PIDFD_OPEN = 434;

std::string Numbered(const std::string& before, int number, const std::string& after) {
    return before + std::to_string(number) + after;
}
}  // namespace

TEST(OxProc, BeforeTheFirstStart) {
    oxProc proc;
    EXPECT_STREQ("No Error.", proc.GetErrorText());
    EXPECT_EQ(0, proc.Pid());
    EXPECT_EQ(-1, proc.EndDescriptor());
    EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT));
    EXPECT_EQ(0, proc.Wait(0));
    proc.Terminate(true);
    EXPECT_EQ(0, proc.LastWaitResult());
    proc.Kill();
    EXPECT_EQ(0, proc.LastWaitResult());
    EXPECT_STREQ("No Error.", proc.GetErrorText());
}

TEST(OxProc, ArgumentsAreTheWordsBetweenBlanks) {
    std::string many = "%s|";
    for (int number = 1; number <= 25; ++number)
        many += Numbered(" ", number, "");
    const struct {
        std::string arguments;
        std::string output;
    } rows[] = {
        {"%s| a", "a|"},
        {"%s| a b c", "a|b|c|"},
        {"  %s|   a    b  ", "a|b|"},
        {"%s| a\tb 'c \"d\" *", "a\tb|'c|\"d\"|*|"},
        {many, "1|2|3|4|5|6|7|8|9|10|11|12|13|14|15|16|17|18|"},  // 19 arguments with the format
    };
    for (const auto& row : rows) {
        oxProc proc;
        const ProgramEnd end = RunProgram(proc, "/usr/bin/printf", row.arguments.c_str());
        EXPECT_EQ(row.output, end.output);
        EXPECT_EQ(0, end.result);
    }
}

TEST(OxProc, EntryZeroIsTheProgramAndNullsKeepTheLastOnes) {
    oxProc proc;
    EXPECT_EQ(std::string("/bin/cat\0/proc/self/cmdline\0", 28),
              RunProgram(proc, "/bin/cat", "/proc/self/cmdline").output);
    EXPECT_EQ(std::string("/bin/cat\0/proc/self/cmdline\0", 28), RunProgram(proc, nullptr, nullptr).output);
    EXPECT_EQ("/proc/self/cmdline\n", RunProgram(proc, "/bin/echo", nullptr).output);
    EXPECT_EQ("other\n", RunProgram(proc, nullptr, "other").output);
    EXPECT_EQ("\n", RunProgram(proc, nullptr, "").output);
    EXPECT_EQ("\n", RunProgram(proc, nullptr, nullptr).output);
}

TEST(OxProcDeathTest, ArgumentsThatCannotBeCopiedEndTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            const FailsOnce failure(FailingCall::DuplicateText, ENOMEM);
            oxProc().Spawn("/bin/true", "a b");
        },
        testing::KilledBySignal(SIGABRT), "\\./ox_remote_dll/src/proc:205: .*: Assertion `lpTempStr' failed\\.");
}

TEST(OxProc, TheEndIsToldInWords) {
    // In the order of the tests: a core that signal bits tell of is a signal, and 0xFF is both cored and stopped.
    const struct {
        int status;
        int result;
        const char* text;
    } rows[] = {
        {0x0000, 0, "Child 77 exited w/code 0."},
        {0x0300, 3, "Child 77 exited w/code 3."},
        {0xFF00, 255, "Child 77 exited w/code 255."},
        {0x0002, 2, "Child 77 terminated abnormally w/code 2."},
        {0x0009, 9, "Child 77 terminated abnormally w/code 9."},
        {0x008B, 11, "Child 77 terminated abnormally w/code 11."},
        {0x0080, 0, "Child 77 exited w/code 0."},
        {0x00FF, 128, "Child 77 cored w/code 128."},
        {0xFFFF, 128, "Child 77 cored w/code 128."},
        {0x137F, 19, "Child 77 stopped w/code 19."},
    };
    for (const auto& row : rows) {
        char text[oxProc::MAX_ERROR_TEXT + 1];
        EXPECT_EQ(row.result, oxProc::DescribeEnd(77, row.status, text, sizeof text)) << row.status;
        EXPECT_STREQ(row.text, text);
    }
}

TEST(OxProc, WaitReportsRealEnds) {
    const struct {
        const char* arguments;
        int result;
        const char* text;
    } rows[] = {
        {"-c exit", 0, " exited w/code 0."},
        {"-c exit\t3", 3, " exited w/code 3."},
        {"-c kill\t-9\t$$", 9, " terminated abnormally w/code 9."},
        {"-c kill\t-2\t$$", 2, " terminated abnormally w/code 2."},
        {"-c kill\t-15\t$$", 15, " terminated abnormally w/code 15."},
    };
    for (const auto& row : rows) {
        oxProc proc;
        const int pid = proc.Spawn("/bin/sh", row.arguments);
        ASSERT_NE(0, pid);
        EXPECT_EQ(pid, proc.Pid());
        EXPECT_EQ(row.result, proc.Wait(oxProc::NO_LIMIT)) << row.arguments;
        EXPECT_EQ(Numbered("Child ", pid, row.text), proc.GetErrorText());
        EXPECT_EQ(pid, proc.LastWaitResult());
        EXPECT_EQ(0, proc.Pid());
        EXPECT_EQ(-1, proc.EndDescriptor());
        EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT)) << "nothing left to wait for";
        EXPECT_EQ(ECHILD, waitpid(pid, nullptr, WNOHANG) < 0 ? errno : 0);
    }
}

TEST(OxProc, AWaitedSpawnReturnsZero) {
    oxProc proc;
    EXPECT_EQ(0, proc.Spawn("/bin/sh", "-c exit\t4", nullptr, true));
    EXPECT_EQ(0, proc.Pid());
    EXPECT_NE(nullptr, std::strstr(proc.GetErrorText(), " exited w/code 4."));
}

TEST(OxProc, AWaitedSpawnInterruptsTheChildWhenTheWaitFails) {
    struct OtherWait : oxProc {
        int Wait(std::uint32_t milliseconds) override {
            limit = milliseconds;
            return result;
        }
        void Terminate(bool wait) override {
            ++terminated;
            waited = wait;
        }
        int result = 0;
        std::uint32_t limit = 0;
        int terminated = 0;
        bool waited = true;
    };
    for (const auto& [result, terminated] : {std::pair(-1, 1), std::pair(-2, 1), std::pair(-3, 0), std::pair(0, 0)}) {
        OtherWait proc;
        proc.result = result;
        const int pid = proc.Spawn("/bin/true", "", nullptr, true);
        EXPECT_GT(pid, 0);
        EXPECT_EQ(oxProc::NO_LIMIT, proc.limit);
        EXPECT_EQ(terminated, proc.terminated) << result;
        EXPECT_EQ(terminated == 0, proc.waited);
        proc.oxProc::Wait(oxProc::NO_LIMIT);
    }
}

TEST(OxProc, LimitsCountWholeSeconds) {
    const struct {
        bool watched;  // by a descriptor, else by short naps
        std::uint32_t limit;
        std::chrono::milliseconds least;
    } rows[] = {{true, 0, 0ms},       {true, 1, 1000ms}, {true, 1999, 1000ms},
                {true, 2000, 2000ms}, {false, 0, 0ms},   {false, 500, 1000ms}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.limit);
        oxProc proc;
        {
            const FailsOnce failure(PIDFD_OPEN, ENOSYS, row.watched ? 1 : 0);
            ASSERT_NE(0, proc.Spawn("/bin/sleep", "1000"));
        }
        if (!row.watched) {
            EXPECT_EQ(-1, proc.EndDescriptor());
        }
        const auto start = steady_clock::now();
        EXPECT_EQ(oxProc::STILL_RUNNING, proc.Wait(row.limit));
        const auto passed = steady_clock::now() - start;
        EXPECT_GE(passed, row.least);
        EXPECT_LT(passed, row.least + 990ms);
        EXPECT_EQ(0, proc.LastWaitResult());
        EXPECT_STREQ("No Error.", proc.GetErrorText()) << "a look that finds it running says nothing";
        proc.Kill();
        EXPECT_EQ(9, proc.Wait(oxProc::NO_LIMIT));
    }
}

TEST(OxProc, TheWaitIsOverAsSoonAsTheChildEnds) {
    constexpr int TRIES = 10;
    for (const bool watched : {true, false}) {
        auto fastest = steady_clock::duration(1h);
        for (int index = 0; index < TRIES; ++index) {
            oxProc proc;
            const FailsOnce failure(PIDFD_OPEN, ENOSYS, watched ? 1 : 0);
            ASSERT_NE(0, proc.Spawn("/bin/sleep", "0.05"));
            const auto start = steady_clock::now();
            EXPECT_EQ(0, proc.Wait(10000));
            fastest = std::min(fastest, steady_clock::now() - start);
        }
        EXPECT_LT(fastest, 500ms);
    }
}

TEST(OxProc, TheEndDescriptorBecomesReadableAndIsCloseOnExec) {
    oxProc proc;
    ASSERT_NE(0, proc.Spawn("/bin/cat", "/dev/null"));
    const int descriptor = proc.EndDescriptor();
    if (descriptor < 0)
        GTEST_SKIP() << "no descriptors of processes here";
    EXPECT_EQ(FD_CLOEXEC, fcntl(descriptor, F_GETFD));
    EXPECT_EQ(Readiness::Ready, WaitReadable(descriptor, 60s));
    EXPECT_EQ(0, proc.Wait(0));
}

TEST(OxProc, TerminateInterruptsAndKillKills) {
    oxProc proc;
    int pid = proc.Spawn("/bin/sleep", "1000");
    ASSERT_NE(0, pid);
    proc.Terminate(true);
    EXPECT_EQ(Numbered("Child ", pid, " terminated abnormally w/code 2."), proc.GetErrorText());
    EXPECT_EQ(0, proc.Pid());

    pid = proc.Spawn("/bin/sleep", "1000");
    ASSERT_NE(0, pid);
    proc.Terminate(false);
    EXPECT_EQ(0, proc.LastWaitResult());
    EXPECT_EQ(pid, proc.Pid());
    EXPECT_EQ(2, proc.Wait(oxProc::NO_LIMIT));

    pid = proc.Spawn("/bin/sleep", "1000");
    ASSERT_NE(0, pid);
    proc.Kill();
    EXPECT_EQ(0, proc.LastWaitResult());
    EXPECT_EQ(pid, proc.Pid()) << "the next wait reaps it";
    EXPECT_EQ(9, proc.Wait(oxProc::NO_LIMIT));
    EXPECT_EQ(Numbered("Child ", pid, " terminated abnormally w/code 9."), proc.GetErrorText());
}

TEST(OxProc, AChildThatWasReapedElsewhere) {
    oxProc proc;
    const int pid = proc.Spawn("/bin/sh", "-c exit\t3");
    ASSERT_NE(0, pid);
    ASSERT_EQ(pid, waitpid(pid, nullptr, 0));
    proc.Terminate(false);
    EXPECT_EQ(ESRCH, proc.LastWaitResult());
    proc.Kill();
    EXPECT_EQ(ESRCH, proc.LastWaitResult());
    EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT));
    EXPECT_EQ(Numbered("Child ", pid, " terminated before wait called."), proc.GetErrorText());
    EXPECT_EQ(0, proc.Pid());
}

TEST(OxProc, AFailingWaitIsTheResult) {
    oxProc proc;
    const int pid = proc.Spawn("/bin/true", "");
    ASSERT_NE(0, pid);
    const FailsOnce failure(FailingCall::WaitPid, EINVAL);
    EXPECT_EQ(EINVAL, proc.Wait(oxProc::NO_LIMIT));
    EXPECT_STREQ("Wait failed w/code 22.", proc.GetErrorText());
    EXPECT_EQ(-1, proc.LastWaitResult());
    EXPECT_EQ(0, proc.Pid());
    waitpid(pid, nullptr, 0);
}

TEST(OxProc, AnInterruptedWaitIsRepeated) {
    oxProc proc;
    ASSERT_NE(0, proc.Spawn("/bin/sleep", "1000"));
    const FailsOnce failure(FailingCall::WaitPid, EINTR);
    EXPECT_EQ(oxProc::STILL_RUNNING, proc.Wait(0));
    EXPECT_TRUE(FailsOnce::HasFailed());
    proc.Kill();
    EXPECT_EQ(9, proc.Wait(oxProc::NO_LIMIT));
}

TEST(OxProc, OnlyTheParentReaps) {
    oxProc proc;
    const int pid = proc.Spawn("/bin/sh", "-c exit\t3");
    ASSERT_NE(0, pid);
    siginfo_t info{};
    ASSERT_EQ(0, waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOWAIT)) << "it has ended and is not reaped";
    EXPECT_EQ(0, InForkedCopy([&] {
                  const bool right = proc.Wait(0) == oxProc::STILL_RUNNING && proc.Wait(1) == oxProc::STILL_RUNNING &&
                                     proc.Pid() == pid && std::string(proc.GetErrorText()) == "No Error.";
                  return right ? 0 : 1;
              }));
    EXPECT_EQ(3, proc.Wait(oxProc::NO_LIMIT));
    EXPECT_EQ(Numbered("Child ", pid, " exited w/code 3."), proc.GetErrorText());
}

TEST(OxProc, TheDestructorLeavesTheChildAlone) {
    int pid = 0;
    {
        oxProc proc;
        pid = proc.Spawn("/bin/sleep", "1000");
        ASSERT_NE(0, pid);
    }
    EXPECT_EQ(0, waitpid(pid, nullptr, WNOHANG)) << "it runs";
    kill(pid, SIGKILL);
    EXPECT_EQ(pid, waitpid(pid, nullptr, 0));
}

TEST(OxProc, TheParentClosesTheChildsEnds) {
    TestPipe in;
    TestPipe both;
    oxProc proc;
    proc.m_childStdin = in.readEnd.Release();
    // One end for two streams: both get it, and it is closed once.
    proc.m_childStdout = proc.m_childStderr = both.writeEnd.Release();
    const int ends[] = {proc.m_childStdin, proc.m_childStdout};
    ASSERT_NE(0, proc.Spawn("/bin/sh", "-c cat;echo\terr>&2"));
    EXPECT_EQ(0, proc.m_childStdin);
    EXPECT_EQ(0, proc.m_childStdout);
    EXPECT_EQ(0, proc.m_childStderr);
    for (const int end : ends)
        EXPECT_EQ(EBADF, fcntl(end, F_GETFD) < 0 ? errno : 0);
    ASSERT_TRUE(WriteAll(in.writeEnd.Get(), "in ", 3));
    in.writeEnd.Reset();
    EXPECT_EQ("in err\n", both.ReadAll());
    EXPECT_EQ(0, proc.Wait(oxProc::NO_LIMIT));
}

TEST(OxProc, AFailedForkIsToldAndLeavesTheEndsToTheCaller) {
    EXPECT_EQ(0, InForkedCopy([] {
                  // No process may be started: not by an ordinary user.
                  constexpr uid_t USER = 54321;
                  if (IsRoot() && syscall(SET_USERS_CALL, USER, USER, USER) != 0)
                      return 1;
                  const rlimit none{0, 0};
                  setrlimit(RLIMIT_NPROC, &none);
                  TestPipe pipe;
                  const CapturedError error;
                  oxProc proc;
                  proc.m_childStdin = pipe.readEnd.Get();
                  const int spawned = proc.Spawn("/bin/true", "", nullptr, true);
                  const std::string text = "Fork() error 11: Resource temporarily unavailable.\n";
                  if (spawned != 0 || proc.GetErrorText() != text || error.Text() != text)
                      return 2;
                  if (proc.m_childStdin != pipe.readEnd.Get() || fcntl(proc.m_childStdin, F_GETFD) < 0)
                      return 3;
                  return proc.Pid() == 0 && proc.Wait(oxProc::NO_LIMIT) == 0 ? 0 : 4;
              }));
}

TEST(OxProc, ThreadsDoNotMixTheirArgumentsNorHangTheirChildren) {
    constexpr int THREADS = 4;
    constexpr int ROUNDS = 60;
    std::atomic<bool> stop{false};
    // Others that hold the locks of the allocator and of streams most of the time.
    std::vector<std::thread> busy;
    for (int index = 0; index < 2; ++index) {
        busy.emplace_back([&] {
            std::FILE* const null = std::fopen("/dev/null", "we");
            std::unique_ptr<char[]> other;
            unsigned count = 0;
            while (!stop) {
                std::fprintf(null, "%s %d\n", "text", 7);
                std::fprintf(stderr, "%s", "");
                // Freed memory that a sanitizer keeps would make every fork slow.
                if (++count % 64 == 0)
                    std::make_unique<char[]>(100).swap(other);
            }
            std::fclose(null);
        });
    }
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int index = 0; index < THREADS; ++index) {
        threads.emplace_back([&, index] {
            for (int round = 0; round < ROUNDS; ++round) {
                const std::string words = Numbered("thread ", index, Numbered(" round ", round, " a b c"));
                oxProc proc;
                const ProgramEnd end = RunProgram(proc, "/bin/echo", words.c_str());
                wrong += end.output != words + "\n" || end.result != 0;
                TestPipe pipe;
                proc.m_childStderr = pipe.writeEnd.Release();
                wrong += proc.Spawn("/no/such/program") == 0;
                wrong += pipe.ReadAll() != "Couldn't launch \"/no/such/program\": No such file or directory (2)\n";
                wrong += proc.Wait(oxProc::NO_LIMIT) != ENOENT;
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    stop = true;
    for (std::thread& thread : busy)
        thread.join();
    EXPECT_EQ(0, wrong.load());
}
