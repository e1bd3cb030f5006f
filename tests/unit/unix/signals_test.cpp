#include "unix/signals.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <vector>

#include "testing/slots.h"
#include "unix/remotesignals.h"
#include "unix/testtools.h"

namespace {
constexpr int END = SIGUSR2;

// Ends on one signal and remembers what came.
class TestSignals : public oxSignals {
public:
    using oxSignals::oxSignals;
    bool OnSignal(int number) override {
        taken.push_back(number);
        return number == endsOn;
    }
    int endsOn = END;
    std::vector<int> taken;
};

bool IsBlocked(int number) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    return sigismember(&mask, number) == 1;
}
}  // namespace

TEST(OxSignals, BlocksEverySignalWhileItLives) {
    {
        const TestSignals signals;
        EXPECT_EQ(oxSignals::Current(), &signals);
        for (const int number : {1, 2, 6, 13, 15, 16, 17, 31, 34, 64})
            EXPECT_TRUE(IsBlocked(number)) << number;
    }
    EXPECT_EQ(oxSignals::Current(), nullptr);
    EXPECT_FALSE(IsBlocked(SIGTERM));
}

TEST(OxSignals, RestoresTheMaskItWasGiven) {
    EXPECT_EQ(RunInChild([] {
                  sigset_t before;
                  sigemptyset(&before);
                  sigaddset(&before, SIGUSR1);
                  { const TestSignals signals(before); }
                  return IsBlocked(SIGUSR1) && !IsBlocked(SIGTERM) ? 0 : 1;
              }),
              0);
}

TEST(OxSignals, PendingSignalsDoNotStrikeAfterTheEnd) {
    EXPECT_EQ(RunInChild([] {
                  {
                      const TestSignals signals;
                      for (const int number : {SIGTERM, SIGINT, 31, 64})
                          kill(getpid(), number);
                  }
                  return 0;
              }),
              0);
}

TEST(OxSignals, BlockingHandsTheEarlierMaskBack) {
    EXPECT_EQ(RunInChild([] {
                  sigset_t before;
                  sigemptyset(&before);
                  sigaddset(&before, SIGHUP);
                  pthread_sigmask(SIG_SETMASK, &before, nullptr);
                  const sigset_t previous = BlockAllSignals();
                  return IsBlocked(SIGTERM) && sigismember(&previous, SIGHUP) == 1 &&
                                 sigismember(&previous, SIGTERM) == 0
                             ? 0
                             : 1;
              }),
              0);
}

TEST(OxSignals, TheLoopTakesSignalsUntilOneEndsIt) {
    TestSignals signals;
    kill(getpid(), SIGUSR1);
    EXPECT_EQ(sigqueue(getpid(), SIGRTMIN + 3, sigval{}), 0);
    kill(getpid(), END);
    EXPECT_TRUE(signals.Run());
    // Pending signals come in the order of their numbers, and the loop ends at END.
    EXPECT_EQ(signals.taken, (std::vector<int>{SIGUSR1, END}));
}

TEST(OxSignals, OnlyTheSystemsNoticeOfAChildIsDropped) {
    const struct {
        int number;
        int code;
        bool dropped;
    } rows[] = {{SIGCHLD, CLD_EXITED, true},   {SIGCHLD, CLD_KILLED, true},    {SIGCHLD, CLD_DUMPED, true},
                {SIGCHLD, CLD_STOPPED, true},  {SIGCHLD, CLD_CONTINUED, true}, {SIGCHLD, SI_USER, false},
                {SIGCHLD, SI_QUEUE, false},    {SIGCHLD, SI_TKILL, false},     {SIGTERM, SI_USER, false},
                {SIGSEGV, SEGV_MAPERR, false}, {SIGTERM, SI_KERNEL, false}};
    for (const auto& row : rows) {
        siginfo_t info{};
        info.si_signo = row.number;
        info.si_code = row.code;
        EXPECT_EQ(oxSignals::IsOwnNotice(info), row.dropped) << row.number << " " << row.code;
    }
}

TEST(OxSignals, WriteFailuresOfTheProcessItselfAreNoCommands) {
    for (const int number : {SIGPIPE, SIGXFSZ, SIGTERM}) {
        siginfo_t info{};
        info.si_signo = number;
        info.si_code = SI_USER;
        info.si_pid = getpid();
        EXPECT_EQ(oxSignals::IsOwnNotice(info), number != SIGTERM) << number;
        info.si_pid = getpid() + 1;
        EXPECT_FALSE(oxSignals::IsOwnNotice(info)) << number;
    }
}

TEST(OxSignals, TheEndOfAChildPassesAndASentSeventeenDoesNot) {
    TestSignals signals;
    signals.endsOn = SIGVTALRM;    // above 17, so that it is taken after it
    RunInChild([] { return 0; });  // its notice is pending now
    kill(getpid(), SIGVTALRM);
    signals.Run();
    EXPECT_EQ(signals.taken, std::vector<int>{SIGVTALRM});

    signals.taken.clear();
    signals.endsOn = SIGCHLD;
    kill(getpid(), SIGCHLD);
    signals.Run();
    EXPECT_EQ(signals.taken, std::vector<int>{SIGCHLD});
}

TEST(OxSignals, AnOwnThreadSignalsThatItRuns) {
    TestSignals signals;
    signals.SetHandshake(oxSignals::HANDSHAKE_SIGNAL);
    signals.SetOwnThread(true);
    ASSERT_TRUE(signals.Run());
    signals.Semaphore().Wait();
    EXPECT_FALSE(signals.Run()) << "its thread still runs";
    kill(getpid(), END);
    EXPECT_TRUE(signals.Wait());
    EXPECT_EQ(signals.taken, std::vector<int>{END});
}

TEST(OxSignals, AnOwnThreadWaitsToBeLetIn) {
    TestSignals signals;
    signals.SetHandshake(oxSignals::HANDSHAKE_WAIT);
    signals.SetOwnThread(true);
    kill(getpid(), END);
    ASSERT_TRUE(signals.Run());
    EXPECT_FALSE(signals.Wait(std::chrono::milliseconds(50))) << "nobody let it in";
    signals.Semaphore().Signal();
    EXPECT_TRUE(signals.Wait());
    EXPECT_EQ(signals.taken, std::vector<int>{END});
}

TEST(OxSignals, InstallsAnAsynchronousHandler) {
    EXPECT_EQ(RunInChild([] {
                  TestSignals signals;
                  const oxSignals::Handler handler = [](int, siginfo_t*, void*) {};
                  if (signals.InstallHandler(SIGKILL, handler) != oxSignals::INSTALL_FAILED)
                      return 1;
                  if (signals.InstallHandler(SIGUSR1, handler) != nullptr)
                      return 2;
                  if (signals.InstallHandler(SIGUSR1, handler) != handler)
                      return 3;
                  struct sigaction action {};
                  sigaction(SIGUSR1, nullptr, &action);
                  // Newer kernels do not report the third flag, SA_INTERRUPT, which has no effect.
                  if ((action.sa_flags & 0x10000004) != 0x10000004)
                      return 4;
                  for (int number = 1; number < 32; ++number) {
                      const bool wanted = number == 2 || number == 3 || number == 15;
                      if ((sigismember(&action.sa_mask, number) == 1) != wanted)
                          return 5;
                  }
                  return 0;
              }),
              0);
}

// Programs that were built against an older library call by these places.
TEST(OxSignals, VirtualOperationsFollowThoseOfTheThread) {
    EXPECT_EQ(SlotOf(&oxSignals::SignalHandshake), 2U);
    EXPECT_EQ(SlotOf(&oxSignals::WaitHandshake), 3U);
    EXPECT_EQ(SlotOf(&oxSignals::WaitLoop), 4U);
    EXPECT_EQ(SlotOf(&oxSignals::OnSignal), 5U);
    EXPECT_EQ(SlotOf(&oxRemoteSignals::OnSignal), 5U);
    EXPECT_EQ(SlotOf(&oxSignals::InstallHandler), 6U);
}
