#include "platform/poll.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <fcntl.h>
#include <array>
#include <atomic>
#include <cerrno>
#include <thread>

using std::chrono::milliseconds;
using std::chrono::steady_clock;

namespace {

constexpr milliseconds NO_WAIT(0);
constexpr milliseconds SHORT(40);
constexpr milliseconds LONG(60000);

struct SocketPair {
    SocketPair() {
        std::array<int, 2> ends{-1, -1};
        EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()));
        first.Reset(ends[0]);
        second.Reset(ends[1]);
    }
    UniqueFd first;
    UniqueFd second;
};

// Interrupts the thread until it is told to end; counts the signals that arrived.
std::atomic<int> g_signals{0};

}  // namespace

TEST(Poll, WaitReadableTimesOutAndThenSeesTheByte) {
    SocketPair pair;
    EXPECT_EQ(Readiness::TimedOut, WaitReadable(pair.first.Get(), NO_WAIT));
    EXPECT_EQ(Readiness::TimedOut, WaitReadable(pair.first.Get(), milliseconds(-1)));
    const auto start = steady_clock::now();
    EXPECT_EQ(Readiness::TimedOut, WaitReadable(pair.first.Get(), SHORT));
    EXPECT_GE(steady_clock::now() - start, SHORT);
    ASSERT_TRUE(WriteAll(pair.second.Get(), "x", 1));
    EXPECT_EQ(Readiness::Ready, WaitReadable(pair.first.Get(), NO_WAIT));
    EXPECT_EQ(Readiness::Ready, WaitReadable(pair.first.Get()));
}

TEST(Poll, HangUpIsReady) {
    SocketPair pair;
    pair.second.Reset();
    EXPECT_EQ(Readiness::Ready, WaitReadable(pair.first.Get()));
    EXPECT_EQ(Readiness::Ready, WaitWritable(pair.first.Get()));
}

TEST(Poll, WaitWritableTimesOutWhileTheBufferIsFull) {
    SocketPair pair;
    EXPECT_EQ(Readiness::Ready, WaitWritable(pair.first.Get(), NO_WAIT));
    const std::array<char, 4096> block{};
    while (write(pair.first.Get(), block.data(), block.size()) > 0) {
    }
    ASSERT_EQ(EAGAIN, errno);
    EXPECT_EQ(Readiness::TimedOut, WaitWritable(pair.first.Get(), NO_WAIT));
}

TEST(Poll, DescriptorThatIsNoneFailsAtOnce) {
    errno = 0;
    EXPECT_EQ(Readiness::Failed, WaitReadable(-1));
    EXPECT_EQ(EBADF, errno);
    UniqueFd closed = OpenFile("/dev/null", O_RDONLY);
    const int number = closed.Get();
    closed.Reset();
    errno = 0;
    EXPECT_EQ(Readiness::Failed, WaitWritable(number));
    EXPECT_EQ(EBADF, errno);
}

TEST(Poll, WorksWithDescriptorsAbove1024) {
    constexpr int HIGH_DESCRIPTOR = 1500;
    rlimit before{};
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &before));
    if (before.rlim_max <= HIGH_DESCRIPTOR)
        GTEST_SKIP() << "the hard limit of open files is too low";
    rlimit raised = before;
    raised.rlim_cur = before.rlim_max;
    ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &raised));
    {
        SocketPair pair;
        const UniqueFd high(fcntl(pair.first.Get(), F_DUPFD_CLOEXEC, HIGH_DESCRIPTOR));
        ASSERT_GE(high.Get(), HIGH_DESCRIPTOR);
        EXPECT_EQ(Readiness::TimedOut, WaitReadable(high.Get(), NO_WAIT));
        ASSERT_TRUE(WriteAll(pair.second.Get(), "x", 1));
        EXPECT_EQ(Readiness::Ready, WaitReadable(high.Get(), LONG));
    }
    setrlimit(RLIMIT_NOFILE, &before);
}

TEST(Poll, PollAllCountsTheReadyOnes) {
    SocketPair one;
    SocketPair two;
    ASSERT_TRUE(WriteAll(two.second.Get(), "x", 1));
    std::array<pollfd, 2> entries{pollfd{one.first.Get(), POLLIN, 0}, pollfd{two.first.Get(), POLLIN, 0}};
    EXPECT_EQ(1, PollAll(entries));
    EXPECT_EQ(0, entries[0].revents);
    EXPECT_EQ(POLLIN, entries[1].revents);
    ASSERT_TRUE(WriteAll(one.second.Get(), "x", 1));
    EXPECT_EQ(2, PollAll(entries, LONG));
}

TEST(Poll, PollAllWithoutDescriptorsWaitsTheTime) {
    const auto start = steady_clock::now();
    EXPECT_EQ(0, PollAll({}, SHORT));
    EXPECT_GE(steady_clock::now() - start, SHORT);
}

TEST(Poll, InterruptedWaitIsResumedWithWhatIsLeft) {
    struct sigaction action {};
    struct sigaction before {};
    action.sa_handler = [](int) { ++g_signals; };  // without SA_RESTART
    ASSERT_EQ(0, sigaction(SIGUSR1, &action, &before));
    SocketPair pair;
    g_signals = 0;
    std::atomic<bool> timedDone{false};
    std::atomic<bool> endlessStarted{false};
    steady_clock::duration timedWait{};
    Readiness timed = Readiness::Failed;
    Readiness endless = Readiness::Failed;
    std::thread waiter([&] {
        const auto start = steady_clock::now();
        timed = WaitReadable(pair.first.Get(), SHORT * 5);
        timedWait = steady_clock::now() - start;
        timedDone = true;
        endlessStarted = true;
        endless = WaitReadable(pair.first.Get());
    });
    while (!timedDone) {
        pthread_kill(waiter.native_handle(), SIGUSR1);
        std::this_thread::yield();
    }
    while (!endlessStarted)
        std::this_thread::yield();
    for (const int enough = g_signals + 10; g_signals < enough;) {
        pthread_kill(waiter.native_handle(), SIGUSR1);
        std::this_thread::yield();
    }
    EXPECT_TRUE(WriteAll(pair.second.Get(), "x", 1));
    waiter.join();
    sigaction(SIGUSR1, &before, nullptr);
    EXPECT_EQ(Readiness::TimedOut, timed);
    EXPECT_GE(timedWait, SHORT * 5);
    EXPECT_LT(timedWait, LONG);
    EXPECT_EQ(Readiness::Ready, endless);
    EXPECT_GT(g_signals.load(), 0);
}

TEST(oxWakeup, StaysReadableUntilCleared) {
    oxWakeup wakeup;
    ASSERT_GE(wakeup.Descriptor(), 0);
    EXPECT_EQ(FD_CLOEXEC, fcntl(wakeup.Descriptor(), F_GETFD) & FD_CLOEXEC);
    EXPECT_EQ(Readiness::TimedOut, WaitReadable(wakeup.Descriptor(), NO_WAIT));
    wakeup.Clear();  // nothing to clear: does not block
    wakeup.Wake();
    wakeup.Wake();
    EXPECT_EQ(Readiness::Ready, WaitReadable(wakeup.Descriptor(), NO_WAIT));
    EXPECT_EQ(Readiness::Ready, WaitReadable(wakeup.Descriptor(), NO_WAIT));
    wakeup.Clear();
    EXPECT_EQ(Readiness::TimedOut, WaitReadable(wakeup.Descriptor(), NO_WAIT));
}

TEST(oxWakeup, EndsAnotherThreadsWait) {
    oxWakeup wakeup;
    Readiness readiness = Readiness::Failed;
    std::thread waiter([&] { readiness = WaitReadable(wakeup.Descriptor()); });
    wakeup.Wake();
    waiter.join();
    EXPECT_EQ(Readiness::Ready, readiness);
}

TEST(oxWakeup, KeepsErrno) {
    oxWakeup wakeup;
    errno = ENOTTY;
    wakeup.Clear();
    EXPECT_EQ(ENOTTY, errno);
    wakeup.Wake();
    EXPECT_EQ(ENOTTY, errno);
}

TEST(oxWakeup, WithoutADescriptorIsHarmless) {
    rlimit before{};
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &before));
    rlimit none = before;
    none.rlim_cur = 0;
    ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &none));
    oxWakeup wakeup;
    setrlimit(RLIMIT_NOFILE, &before);
    EXPECT_EQ(-1, wakeup.Descriptor());
    wakeup.Wake();
    wakeup.Clear();
    std::array<pollfd, 1> entries{pollfd{wakeup.Descriptor(), POLLIN, 0}};
    EXPECT_EQ(0, PollAll(entries, NO_WAIT));
}
