#include "platform/assertion.h"

#include <gtest/gtest.h>
#include <signal.h>

namespace {
int looks = 0;
bool Look(bool result) {
    ++looks;
    return result;
}
}  // namespace

TEST(Assertion, AConditionThatHoldsIsLookedAtOnceAndPasses) {
    looks = 0;
    OX_ASSERT_AT(Look(true), "text", "file", 1, "function");
    EXPECT_EQ(1, looks);
}

TEST(AssertionDeathTest, PrintsTheLineWithTheWordsGivenAndEndsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(OX_ASSERT_AT(Look(false), "m_bValid == VALID", "./some/source", 4711, "int Some::Function(void *)"),
                testing::KilledBySignal(SIGABRT),
                "^[^:]+: \\./some/source:4711: int Some::Function\\(void \\*\\): "
                "Assertion `m_bValid == VALID' failed\\.\n");
    EXPECT_EXIT(oxAssertionFailed("0", "file", 1, "function"), testing::KilledBySignal(SIGABRT),
                ": file:1: function: Assertion `0' failed\\.\n");
}

TEST(AssertionDeathTest, NoSignalMaskHoldsItBack) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            sigset_t all;
            sigfillset(&all);
            sigprocmask(SIG_SETMASK, &all, nullptr);
            OX_ASSERT_AT(false, "text", "file", 1, "function");
        },
        testing::KilledBySignal(SIGABRT), "Assertion `text' failed\\.");
}
