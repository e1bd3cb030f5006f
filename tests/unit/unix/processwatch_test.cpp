#include "unix/processwatch.h"

#include <gtest/gtest.h>
#include <signal.h>

#include "unix/testtools.h"

namespace {
using namespace std::chrono_literals;
using Means = oxProcessWatch::Means;

class OxProcessWatch : public testing::TestWithParam<Means> {};

int Sleep() {
    for (;;)
        pause();
}
}  // namespace

INSTANTIATE_TEST_SUITE_P(By, OxProcessWatch, testing::Values(Means::Descriptor, Means::Table),
                         [](const auto& made) { return made.param == Means::Table ? "Table" : "Descriptor"; });

TEST_P(OxProcessWatch, AZombieHasEnded) {
    const pid_t child = StartChild(&Sleep);
    const oxProcessWatch watch(child, GetParam());
    EXPECT_FALSE(watch.HasEnded());
    EXPECT_FALSE(watch.WaitEnd(10ms));
    kill(child, SIGKILL);
    EXPECT_TRUE(watch.WaitEnd(20s));
    EXPECT_TRUE(watch.HasEnded());
    EXPECT_EQ(kill(child, 0), 0);  // still in the table
    EXPECT_TRUE(oxProcessWatch(child, GetParam()).HasEnded());
    Reap(child);
    EXPECT_TRUE(watch.HasEnded());
}

TEST_P(OxProcessWatch, AProcessThatDoesNotExistHasEnded) {
    const pid_t child = StartChild([] { return 0; });
    Reap(child);
    const oxProcessWatch watch(child, GetParam());
    EXPECT_TRUE(watch.HasEnded());
    EXPECT_TRUE(watch.WaitEnd(0ms));
}

TEST_P(OxProcessWatch, NumbersOfGroupsNeverEnd) {
    for (const pid_t pid : {0, -1, -77}) {
        const oxProcessWatch watch(pid, GetParam());
        EXPECT_FALSE(watch.HasEnded());
        EXPECT_FALSE(watch.WaitEnd(1ms));
    }
}

TEST_P(OxProcessWatch, TheWaitIsOverWhenTheProcessEnds) {
    const pid_t child = StartChild([] {
        usleep(20000);
        return 0;
    });
    const auto before = std::chrono::steady_clock::now();
    EXPECT_TRUE(oxProcessWatch(child, GetParam()).WaitEnd(60s));
    EXPECT_LT(std::chrono::steady_clock::now() - before, 30s);
    Reap(child);
}
