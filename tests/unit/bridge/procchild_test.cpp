#include "proc/child.h"

#include <gtest/gtest.h>
#include <linux/capability.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>

#include <algorithm>
#include <climits>
#include <cstdint>
#include <optional>
#include <thread>
#include <vector>

#include "bridge/proctools.h"
#include "bridge/support_failures.h"
#include "testing/scratch.h"

namespace {
constexpr uid_t USER = 1;
constexpr std::uint32_t LONG = 20000;  // milliseconds
constexpr uid_t UNCHANGED = static_cast<uid_t>(-1);

#define SKIP_UNLESS_ROOT() \
    if (!IsRoot())         \
    GTEST_SKIP() << "needs root"

// Runs the body on a thread of its own with the ids given, its children inherit them; the rest of the process keeps
// its own. The thread has supplementary groups, as root has.
void AsUser(uid_t real, uid_t effective, uid_t saved, const std::function<void()>& body) {
    std::thread([&] {
        const gid_t groups[] = {0, 4, 24};
        ASSERT_EQ(0, syscall(SET_GROUP_LIST_CALL, std::size(groups), groups));
        ASSERT_EQ(0, syscall(SET_GROUPS_CALL, UNCHANGED, effective, UNCHANGED));
        ASSERT_EQ(0, syscall(SET_USERS_CALL, real, effective, saved));
        body();
    }).join();
}

std::string OwnStatus(oxProc& proc, unsigned priority = oxProc::PRIORITY_UNCHANGED) {
    return RunProgram(proc, "/bin/cat", "/proc/self/status", priority).output;
}

int NiceOf(const std::string& stat) {
    constexpr int FIELDS_BEFORE = 16;  // of those after the name
    std::istringstream words(stat.substr(stat.rfind(')') + 1));
    std::string word;
    for (int field = 0; field < FIELDS_BEFORE; ++field)
        words >> word;
    int nice = INT_MIN;
    words >> nice;
    return nice;
}

bool MayRaisePriority() {
    return InForkedCopy([] { return setpriority(PRIO_PROCESS, 0, getpriority(PRIO_PROCESS, 0) - 1) == 0 ? 0 : 1; }) ==
           0;
}

bool MayRaiseHardLimit() {
    return InForkedCopy([] {
               rlimit limit{50, 100};
               setrlimit(RLIMIT_NOFILE, &limit);
               limit.rlim_max = 101;
               return setrlimit(RLIMIT_NOFILE, &limit) == 0 ? 0 : 1;
           }) == 0;
}

// Program, what its standard error says, and its exit code.
struct Failure {
    std::string program;
    std::string message;
    int code;
};

// The descriptors of the child that a forked copy of the test starts, after it prepared its own from 3 on.
bool ChildHas(const std::function<void()>& prepare, const std::set<int>& expected) {
    return InForkedCopy([&] {
               syscall(436, 3U, ~0U, 0U);  // close_range
               prepare();
               oxProc proc;
               const int pid = proc.Spawn("/bin/sleep", "1000");
               if (pid == 0)
                   return 1;
               const bool right =
                   Eventually([&] { return RunsProgram(pid, "sleep") && DescriptorsOf(pid) == expected; },
                              std::chrono::seconds(5));
               proc.Kill();
               return right && proc.Wait(oxProc::NO_LIMIT) == SIGKILL ? 0 : 2;
           }) == 0;
}

void OpenAt(int descriptor, int flags = 0) {
    const int opened = open("/dev/zero", O_RDONLY);
    if (opened == descriptor) {
        fcntl(opened, F_SETFD, flags == O_CLOEXEC ? FD_CLOEXEC : 0);
        return;
    }
    dup3(opened, descriptor, flags);
    close(opened);
}
}  // namespace

TEST(OxProcChild, ProgramsThatCannotBeStartedAreTold) {
    const Scratch scratch;
    const std::string plain = scratch.Write("plain", "#!/bin/sh\nexit 0\n");
    const std::string junk = scratch.Write("junk", std::string("\x7F\x01\x02\x03", 4));
    const std::string noInterpreter = scratch.Write("script", "#!/no/such/interpreter\n");
    chmod(plain.c_str(), 0644);
    chmod(junk.c_str(), 0755);
    chmod(noInterpreter.c_str(), 0755);
    const std::string tooLong = "/" + std::string(PATH_MAX, 'x');
    const Failure rows[] = {
        {"/no/such/program", "Couldn't launch \"/no/such/program\": No such file or directory (2)\n", 2},
        {"", "Couldn't launch \"\": No such file or directory (2)\n", 2},
        {noInterpreter, "Couldn't launch \"" + noInterpreter + "\": No such file or directory (2)\n", 2},
        {plain, "execl error #13: Permission denied\n", 13},
        {scratch.Path(), "execl error #13: Permission denied\n", 13},
        {junk, "execl error #8: Exec format error\n", 8},
        {plain + "/below", "execl error #20: Not a directory\n", 20},
        {tooLong, "execl error #36: File name too long\n", 36},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.program);
        for (const bool redirected : {false, true}) {
            TestPipe pipe;
            const CapturedError error;
            oxProc proc;
            if (redirected)
                proc.m_childStderr = pipe.writeEnd.Release();
            const int pid = proc.Spawn(row.program.c_str(), "a b");
            EXPECT_NE(0, pid) << "the start itself succeeds";
            EXPECT_EQ(row.code, proc.Wait(oxProc::NO_LIMIT));
            EXPECT_EQ("Child " + std::to_string(pid) + " exited w/code " + std::to_string(row.code) + ".",
                      proc.GetErrorText());
            EXPECT_EQ(redirected ? "" : row.message, error.Text());
            if (redirected) {
                EXPECT_EQ(row.message, pipe.ReadAll());
            }
        }
    }
}

TEST(OxProcChild, StreamsThatCannotBeConnectedAreTold) {
    constexpr int NOT_OPEN = 9999;
    const struct {
        int oxProc::*stream;
        const char* message;
    } rows[] = {{&oxProc::m_childStdin, "dup2 (stdin) error 9: Bad file descriptor.\n"},
                {&oxProc::m_childStdout, "dup2 (stdout) error 9: Bad file descriptor.\n"},
                {&oxProc::m_childStderr, "dup2 (stderr) error 9: Bad file descriptor.\n"}};
    for (const auto& row : rows) {
        const CapturedError error;
        oxProc proc;
        proc.*row.stream = NOT_OPEN;
        EXPECT_NE(0, proc.Spawn("/bin/true", ""));
        EXPECT_EQ(0, proc.*row.stream);
        EXPECT_EQ(EBADF, proc.Wait(oxProc::NO_LIMIT)) << "the copy of the server ends";
        EXPECT_EQ(row.message, error.Text());
    }
}

TEST(OxProcChild, StartsInTheDirectory) {
    const Scratch scratch;
    const std::string path = std::filesystem::canonical(scratch.Path()).string();
    oxProc proc;
    EXPECT_EQ(path + "\n", RunProgram(proc, "/bin/pwd", "-P", oxProc::PRIORITY_UNCHANGED, path.c_str()).output);
    EXPECT_EQ(std::filesystem::current_path().string() + "\n", RunProgram(proc, nullptr, nullptr).output);
}

TEST(OxProcChild, ADirectoryThatCannotBeEnteredIsToldWithoutALineFeed) {
    const Scratch scratch;
    const std::string file = scratch.Write("file", "");
    const std::string longest = "/" + std::string(5000, 'x');
    const struct {
        std::string directory;
        std::string message;
        int code;
    } rows[] = {
        {"/no/such", "Unable to change to directory \"/no/such\" : No such file or directory (2)", 2},
        {file, "Unable to change to directory \"" + file + "\" : Not a directory (20)", 20},
        // Cut where the message is full.
        {longest, "Unable to change to directory \"" + longest.substr(0, PATH_MAX + 256 - 31), 36},
    };
    for (const auto& row : rows) {
        const CapturedError error;
        oxProc proc;
        const int pid = proc.Spawn("/bin/true", "", row.directory.c_str());
        EXPECT_NE(0, pid);
        EXPECT_EQ(row.code, proc.Wait(oxProc::NO_LIMIT));
        EXPECT_EQ(row.message, error.Text());
    }
}

TEST(OxProcChild, PrioritiesAreNiceValues) {
    const std::optional<int> table[] = {{}, 19, 16, 12, 8, 4, {}, -5, -10, -15, -20, {}, {}};
    const int own = getpriority(PRIO_PROCESS, 0);
    const bool mayRaise = MayRaisePriority();
    const auto check = [&] {
        for (unsigned priority = 0; priority < std::size(table); ++priority) {
            oxProc proc;
            const ProgramEnd end = RunProgram(proc, "/bin/cat", "/proc/self/stat", priority);
            EXPECT_EQ(0, end.result);
            const int wanted = table[priority].value_or(own);
            // What is not allowed is left undone without a word.
            EXPECT_EQ(mayRaise ? wanted : std::max(wanted, own), NiceOf(end.output)) << priority;
        }
        oxProc proc;
        EXPECT_EQ(own, NiceOf(RunProgram(proc, "/bin/cat", "/proc/self/stat", UINT_MAX).output));
    };
    check();
    // The server under an ordinary effective user switches to root for it.
    if (IsRoot())
        AsUser(0, USER, 0, check);
}

TEST(OxProcChild, TheRaisedUserIsGivenBackAfterThePriority) {
    SKIP_UNLESS_ROOT();
    const Scratch scratch;
    const CapturedError error;
    AsUser(0, USER, 0, [] {
        oxProc proc;
        proc.m_runAsRealUser = 2;  // only exactly 1 counts
        EXPECT_EQ("1 1 1 1", StatusLine(OwnStatus(proc, 7), "Uid"));
        // The second change of ids is the one back.
        const FailsOnce failure(SET_USERS_CALL, EPERM, 1);
        EXPECT_NE(0, proc.Spawn("/bin/true", "", nullptr, false, 7));
        EXPECT_EQ(EPERM, proc.Wait(oxProc::NO_LIMIT)) << "nothing is started as root by accident";
    });
    EXPECT_EQ("Unable to give up the root identity: Operation not permitted (1)\n", error.Text());
}

TEST(OxProcChild, RootIsGivenUpForGoodUnlessTheRealUserIsWanted) {
    SKIP_UNLESS_ROOT();
    const struct {
        uid_t real, effective, saved;
        int runAsRealUser;
        const char* uids;
        const char* gids;
        const char* groups;
    } rows[] = {
        {0, USER, 0, 0, "1 1 1 1", "1 1 1 1", ""},       {0, USER, USER, 0, "1 1 1 1", "1 1 1 1", ""},
        {0, USER, 0, 2, "1 1 1 1", "1 1 1 1", ""},       {0, USER, 0, 1, "0 0 0 0", "0 1 1 1", "0 4 24"},
        {0, 0, 0, 0, "0 0 0 0", "0 0 0 0", "0 4 24"},    {0, 0, 0, 1, "0 0 0 0", "0 0 0 0", "0 4 24"},
        {USER, 0, 0, 0, "1 0 0 0", "0 0 0 0", "0 4 24"}, {USER, 0, 0, 1, "1 1 1 1", "0 0 0 0", "0 4 24"},
        {USER, 2, 2, 0, "2 2 2 2", "2 2 2 2", "0 4 24"}, {USER, 2, 2, 1, "1 1 1 1", "0 2 2 2", "0 4 24"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(std::to_string(row.real) + " " + std::to_string(row.effective) + " flag " +
                     std::to_string(row.runAsRealUser));
        AsUser(row.real, row.effective, row.saved, [&] {
            oxProc proc;
            proc.m_runAsRealUser = row.runAsRealUser;
            const std::string status = OwnStatus(proc);
            EXPECT_EQ(row.uids, StatusLine(status, "Uid"));
            EXPECT_EQ(row.gids, StatusLine(status, "Gid"));
            EXPECT_EQ(row.groups, StatusLine(status, "Groups"));
        });
    }
    EXPECT_EQ(0u, geteuid());
}

TEST(OxProcChild, TheDirectoryIsEnteredBeforeTheRealUserIsTaken) {
    SKIP_UNLESS_ROOT();
    const Scratch scratch;
    const std::string path = std::filesystem::canonical(scratch.Path()).string();
    ASSERT_EQ(0, chmod(path.c_str(), 0700));
    const CapturedError error;
    AsUser(USER, 0, 0, [&] {
        oxProc proc;
        proc.m_runAsRealUser = 1;
        constexpr unsigned UNCHANGED_PRIORITY = oxProc::PRIORITY_UNCHANGED;
        const std::string status =
            RunProgram(proc, "/bin/cat", "/proc/self/status", UNCHANGED_PRIORITY, path.c_str()).output;
        EXPECT_EQ("1 1 1 1", StatusLine(status, "Uid"));
        EXPECT_EQ(path + "\n", RunProgram(proc, "/bin/pwd", "-P", UNCHANGED_PRIORITY, path.c_str()).output);
    });
    EXPECT_EQ("", error.Text());
}

TEST(OxProcChild, AmbientCapabilitiesStayWithTheServer) {
    SKIP_UNLESS_ROOT();
    std::thread([] {
        __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
        __user_cap_data_struct sets[_LINUX_CAPABILITY_U32S_3] = {};
        ASSERT_EQ(0, syscall(SYS_capget, &header, sets));
        sets[0].inheritable |= 1U << CAP_NET_BIND_SERVICE;
        if (syscall(SYS_capset, &header, sets) != 0 ||
            prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_RAISE, CAP_NET_BIND_SERVICE, 0, 0) != 0)
            GTEST_SKIP() << "may not hand capabilities on";
        oxProc proc;
        EXPECT_EQ("0000000000000000", StatusLine(OwnStatus(proc), "CapAmb"));
    }).join();
}

TEST(OxProcChild, AnOrdinaryUserStaysWhatHeIs) {
    for (const int flag : {0, 1}) {
        oxProc proc;
        proc.m_runAsRealUser = flag;
        const std::string own = TextOf("/proc/self/status");
        const std::string status = OwnStatus(proc);
        for (const char* line : {"Uid", "Gid", "Groups"})
            EXPECT_EQ(StatusLine(own, line), StatusLine(status, line));
    }
}

TEST(OxProcChild, WhereRootCannotBeGivenUpNothingIsStarted) {
    SKIP_UNLESS_ROOT();
    const struct {
        long call;
        int passing;
    } steps[] = {{SET_USERS_CALL, 0}, {SET_GROUP_LIST_CALL, 0}, {SET_GROUPS_CALL, 0}, {SET_USERS_CALL, 1}};
    for (const auto& step : steps) {
        const CapturedError error;
        AsUser(0, USER, 0, [&] {
            oxProc proc;
            const FailsOnce failure(step.call, EPERM, step.passing);
            const ProgramEnd end = RunProgram(proc, "/bin/echo", "started");
            EXPECT_EQ("", end.output);
            EXPECT_EQ(EPERM, end.result);
        });
        EXPECT_EQ("Unable to give up the root identity: Operation not permitted (1)\n", error.Text());
    }
}

TEST(OxProcChild, ARealUserThatCannotBeTakenIsToldAndTheProgramStarts) {
    const CapturedError error;
    oxProc proc;
    proc.m_runAsRealUser = 1;
    const FailsOnce failure(SET_USERS_CALL, EPERM);
    const ProgramEnd end = RunProgram(proc, "/bin/echo", "started");
    EXPECT_EQ("started\n", end.output);
    EXPECT_EQ(0, end.result);
    EXPECT_EQ("./ox_remote_dll/src/proc 553 - setuid(" + std::to_string(getuid()) + "): Operation not permitted",
              error.Text());
}

TEST(OxProcChild, StartsWithDefaultSignalsAndMask022) {
    const Scratch scratch;
    const std::string output = scratch.File("status");
    EXPECT_EQ(0, InForkedCopy([&] {
                  for (int number = 1; number <= 64; ++number)
                      signal(
                          number, number % 2 == 0 ? SIG_IGN : [](int) {});
                  // As the server does: the C library refuses this one.
                  unsigned long action[5] = {reinterpret_cast<unsigned long>(SIG_IGN)};
                  if (syscall(SYS_rt_sigaction, 32, action, nullptr, 8) != 0)
                      return 1;
                  signal(SIGCHLD, SIG_DFL);
                  sigset_t all;
                  sigfillset(&all);
                  pthread_sigmask(SIG_SETMASK, &all, nullptr);
                  umask(0);
                  oxProc proc;
                  const std::string status = OwnStatus(proc);
                  sigset_t now;
                  pthread_sigmask(SIG_SETMASK, nullptr, &now);
                  if (sigismember(&now, SIGTERM) != 1)
                      return 2;
                  std::ofstream(output) << status;
                  return 0;
              }));
    const std::string status = TextOf(output);
    const std::string none(16, '0');
    for (const char* line : {"SigPnd", "ShdPnd", "SigBlk", "SigIgn", "SigCgt"})
        EXPECT_EQ(none, StatusLine(status, line)) << line;
    EXPECT_EQ("0022", StatusLine(status, "Umask"));
}

TEST(OxProcChild, TheCallersSignalMaskIsAsBefore) {
    sigset_t blocked;
    sigset_t before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGUSR2);
    ASSERT_EQ(0, pthread_sigmask(SIG_SETMASK, &blocked, &before));
    oxProc proc;
    EXPECT_EQ(0, proc.Spawn("/bin/true", "", nullptr, true));
    sigset_t now;
    pthread_sigmask(SIG_SETMASK, &before, &now);
    EXPECT_EQ(1, sigismember(&now, SIGUSR2));
    EXPECT_EQ(0, sigismember(&now, SIGTERM));
}

TEST(OxProcChild, GetsTheFileLimitThatWasHandedOver) {
    const Scratch scratch;
    const struct {
        bool handedOver;
        rlimit original, raised;
        rlimit allowed, refused;  // the child's, where the server may raise the hard limit again and where not
    } rows[] = {
        {false, {100, 200}, {150, 200}, {150, 200}, {150, 200}},
        {true, {100, 200}, {200, 200}, {100, 200}, {100, 200}},
        {true, {100, 200}, {150, 150}, {100, 200}, {100, 150}},
        {true, {180, 200}, {150, 150}, {180, 200}, {150, 150}},
    };
    const bool mayRaise = MayRaiseHardLimit();
    const auto text = [](const rlimit& limit) {
        return std::to_string(limit.rlim_cur) + " " + std::to_string(limit.rlim_max) + " files";
    };
    for (const auto& row : rows) {
        for (const bool root : {false, true}) {
            if (root && !IsRoot())
                continue;
            const std::string output = scratch.Write("limits", "");
            EXPECT_EQ(0, InForkedCopy([&] {
                          if (setrlimit(RLIMIT_NOFILE, &row.raised) != 0)
                              return 1;
                          if (row.handedOver)
                              oxProc::SetChildFileLimit(row.original);
                          std::ofstream file(output);
                          // A server of root's under another effective user can be root for it.
                          if (IsRoot() && syscall(SET_USERS_CALL, root ? 0 : USER, USER, root ? 0 : USER) != 0)
                              return 2;
                          oxProc proc;
                          file << RunProgram(proc, "/bin/cat", "/proc/self/limits").output << std::flush;
                          return file.good() ? 0 : 3;
                      }));
            const std::string limits = TextOf(output);
            std::istringstream lines(limits);
            std::string files;
            for (std::string line; std::getline(lines, line);) {
                if (line.rfind("Max open files", 0) == 0)
                    files = StatusLine("files:" + line.substr(14), "files");
            }
            EXPECT_EQ(text(root && mayRaise ? row.allowed : row.refused), files);
        }
    }
}

TEST(OxProcChild, ALowFileLimitDoesNotKeepDescriptorsFromBeingClosed) {
    EXPECT_TRUE(ChildHas(
        [] {
            for (int descriptor = 3; descriptor < 20; ++descriptor)
                OpenAt(descriptor);
            oxProc::SetChildFileLimit({10, 10});
        },
        {0, 1, 2}));
}

TEST(OxProcChild, InheritedDescriptorsBelowTheLowestFreeOneAreClosed) {
    EXPECT_TRUE(ChildHas([] {}, {0, 1, 2}));
    EXPECT_TRUE(ChildHas(
        [] {
            for (const int descriptor : {3, 4, 5, 6})
                OpenAt(descriptor);
        },
        {0, 1, 2}));
    // Above a gap they stay open, unless they are close-on-exec.
    EXPECT_TRUE(ChildHas(
        [] {
            for (const int descriptor : {3, 4, 6, 20})
                OpenAt(descriptor);
            OpenAt(21, O_CLOEXEC);
        },
        {0, 1, 2, 6, 20}));
    // The lowest free one may be a standard stream: it becomes the null device, and nothing is closed.
    EXPECT_TRUE(ChildHas(
        [] {
            for (const int descriptor : {3, 4})
                OpenAt(descriptor);
            close(0);
        },
        {0, 1, 2, 3, 4}));
}

TEST(OxProcChild, EndsAtStandardNumbersAreConnectedToo) {
    const Scratch scratch;
    const std::string input = scratch.Write("input", "text\n");
    const std::string output = scratch.File("output");
    const auto run = [&](int in, int out, int err) {
        std::ofstream(output).close();
        EXPECT_EQ(0, InForkedCopy([&] {
                      const UniqueFd from = OpenFile(input, O_RDONLY);
                      const UniqueFd to = OpenFile(output, O_WRONLY | O_APPEND);
                      // Close-on-exec, as all that the caller opens.
                      for (const auto& [end, file] : {std::pair(in, from.Get()), {out, to.Get()}, {err, to.Get()}}) {
                          if (end != 0 && dup3(file, end, O_CLOEXEC) < 0)
                              return 1;
                      }
                      oxProc proc;
                      proc.m_childStdin = in;
                      proc.m_childStdout = out;
                      proc.m_childStderr = err;
                      return proc.Spawn("/bin/sh", "-c cat;echo\terr>&2") != 0 && proc.Wait(oxProc::NO_LIMIT) == 0 ? 0
                                                                                                                   : 2;
                  }));
        return TextOf(output);
    };
    EXPECT_EQ("text\nerr\n", run(40, 41, 42));
    EXPECT_EQ("text\nerr\n", run(40, 1, 2)) << "in place already";
    EXPECT_EQ("text\nerr\n", run(1, 41, 42));
    EXPECT_EQ("text\nerr\n", run(2, 41, 42));
    EXPECT_EQ("text\nerr\n", run(40, 2, 42));
    EXPECT_EQ("text\nerr\n", run(40, 41, 41)) << "one end for two streams";
    EXPECT_EQ("text\nerr\n", run(40, 2, 2));
}

TEST(OxProcChild, DiesWithTheThreadThatStartedIt) {
    oxProc proc;
    std::thread([&] {
        ASSERT_NE(0, proc.Spawn("/bin/sleep", "1000"));
        EXPECT_TRUE(Eventually([&] { return RunsProgram(proc.Pid(), "sleep"); }));
    }).join();
    EXPECT_EQ(SIGKILL, proc.Wait(LONG));
    proc.Terminate(true);
}

TEST(OxProcChild, DiesWithTheServerAlsoAfterTheChangesOfIds) {
    // What the copy leaves behind becomes this process's to reap.
    ASSERT_EQ(0, prctl(PR_SET_CHILD_SUBREAPER, 1));
    for (const int flag : {0, 1}) {
        TestPipe pipe;
        EXPECT_EQ(1000 + SIGKILL, InForkedCopy([&] {
                      if (IsRoot() && syscall(SET_USERS_CALL, 0, USER, 0) != 0)
                          return 1;
                      oxProc proc;
                      proc.m_runAsRealUser = flag;
                      const int pid = proc.Spawn("/bin/sleep", "1000");
                      // Before the program runs the parent's end may be noticed by itself.
                      if (!Eventually([&] { return RunsProgram(pid, "sleep"); }))
                          return 2;
                      if (!WriteAll(pipe.writeEnd.Get(), reinterpret_cast<const char*>(&pid), sizeof pid))
                          return 3;
                      kill(getpid(), SIGKILL);
                      return 4;
                  }));
        int pid = 0;
        ASSERT_EQ(static_cast<ssize_t>(sizeof pid), read(pipe.readEnd.Get(), &pid, sizeof pid));
        int status = 0;
        const bool ended = Eventually([&] { return waitpid(pid, &status, WNOHANG) == pid; });
        EXPECT_TRUE(ended);
        if (!ended) {
            kill(pid, SIGKILL);
            waitpid(pid, &status, 0);
            continue;
        }
        EXPECT_TRUE(WIFSIGNALED(status));
        EXPECT_EQ(SIGKILL, WTERMSIG(status));
    }
    prctl(PR_SET_CHILD_SUBREAPER, 0);
}

TEST(OxProcChild, AParentThatIsGoneAlreadyEndsTheChild) {
    TestPipe pipe;
    EXPECT_EQ(EXIT_FAILURE, InForkedCopy([&]() -> int {
                  DuplicateOnto(pipe.writeEnd.Get(), STDOUT_FILENO);
                  oxChildPlan plan;
                  char program[] = "/bin/echo";
                  plan.program = program;
                  plan.arguments[0] = program;
                  plan.parent = getppid() + 1;
                  RunChild(plan);
              }));
    pipe.writeEnd.Reset();
    EXPECT_EQ("", pipe.ReadAll());
}
