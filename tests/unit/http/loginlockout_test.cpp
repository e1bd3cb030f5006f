#include "http/loginlockout.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "testing/manualclock.h"

namespace {

class oxLoginLockoutTest : public testing::Test {
protected:
    void Fail(const std::string& user, int times = 1) {
        for (int i = 0; i < times; ++i)
            lockout.Record(user);
    }
    ManualClock clock;
    oxLoginLockout lockout{clock};
};

std::string Numbered(int number) {
    return "user" + std::to_string(number);
}

}  // namespace

TEST_F(oxLoginLockoutTest, FailuresAndPausesDecide) {
    // Each case: the pause before each failure, then a pause, and whether the user is locked out then.
    static const struct {
        std::vector<int> failures;
        int pause;
        bool locked;
    } CASES[] = {
        {{}, 0, false},
        {{0}, 0, false},
        {{0, 0, 0}, 0, false},
        {{0, 0, 0, 0}, 0, true},
        {{0, 0, 0, 0, 0, 0}, 0, true},
        // The fourth within the period after the third.
        {{0, 0, 0, 59}, 0, true},
        {{0, 0, 0, 60}, 0, false},
        {{0, 0, 0, 61}, 0, false},
        {{0, 59, 59, 59}, 0, true},
        {{0, 59, 60, 59}, 0, false},
        // One that comes late is the first of a new count.
        {{0, 0, 0, 60, 0, 0}, 0, false},
        {{0, 0, 0, 60, 0, 0, 0}, 0, true},
        {{0, 70, 70, 70, 70, 70, 70, 70}, 0, false},
        // Until the period after the last failure has passed.
        {{0, 0, 0, 0}, 30, true},
        {{0, 0, 0, 0}, 59, true},
        {{0, 0, 0, 0}, 60, false},
        {{0, 0, 0, 0}, 61, false},
        {{0, 0, 0, 0, 30}, 59, true},
        {{0, 0, 0, 0, 30}, 60, false},
        {{0, 0, 0, 0, 60}, 0, false},
        {{0, 0, 0}, 600, false},
    };
    for (const auto& c : CASES) {
        ManualClock time;
        oxLoginLockout registry(time);
        std::string failures;
        for (const int pause : c.failures) {
            time.Advance(pause);
            registry.Record("alice");
            failures += std::to_string(pause) + " ";
        }
        time.Advance(c.pause);
        EXPECT_EQ(registry.IsLockedOut("alice"), c.locked) << failures << "then " << c.pause;
        EXPECT_FALSE(registry.IsLockedOut("bob"));
    }
}

TEST_F(oxLoginLockoutTest, ThePeriodIsOneMinute) {
    EXPECT_EQ(lockout.Period(), 60);
    EXPECT_EQ(lockout.Period() / 60, 1);
}

TEST_F(oxLoginLockoutTest, LockOutThatIsOverIsForgotten) {
    Fail("alice", 4);
    clock.Advance(60);
    EXPECT_EQ(lockout.Count(), 1u);
    EXPECT_FALSE(lockout.IsLockedOut("alice"));
    EXPECT_EQ(lockout.Count(), 0u);
    Fail("alice", 3);
    EXPECT_FALSE(lockout.IsLockedOut("alice"));
    Fail("alice");
    EXPECT_TRUE(lockout.IsLockedOut("alice"));
}

TEST_F(oxLoginLockoutTest, AskingDoesNotForgetAnUnfinishedCount) {
    Fail("alice", 3);
    clock.Advance(100);
    EXPECT_FALSE(lockout.IsLockedOut("alice"));
    EXPECT_EQ(lockout.Count(), 1u);
}

TEST_F(oxLoginLockoutTest, NamesAreComparedByteForByte) {
    Fail("alice", 4);
    for (const char* other : {"Alice", "alice ", "alic", "alicea", ""})
        EXPECT_FALSE(lockout.IsLockedOut(other)) << other;
    EXPECT_EQ(lockout.Count(), 1u);
}

TEST_F(oxLoginLockoutTest, LongNamesShareTheRecordOfTheEmptyName) {
    const std::string longest(127, 'a');
    Fail(longest, 4);
    EXPECT_TRUE(lockout.IsLockedOut(longest));
    EXPECT_FALSE(lockout.IsLockedOut(std::string(127, 'b')));
    EXPECT_FALSE(lockout.IsLockedOut(""));
    EXPECT_FALSE(lockout.IsLockedOut(std::string(128, 'a')));
    EXPECT_EQ(lockout.Count(), 1u);

    Fail(std::string(128, 'a'));
    Fail(std::string(129, 'b'));
    Fail(std::string(10000, 'c'));
    EXPECT_FALSE(lockout.IsLockedOut(""));
    Fail("");
    EXPECT_EQ(lockout.Count(), 2u);
    for (const std::string& user : {std::string(), std::string(128, 'z'), std::string(5000, 'y')})
        EXPECT_TRUE(lockout.IsLockedOut(user)) << user.size();
}

TEST_F(oxLoginLockoutTest, SweepRemovesWhatIsOlderThanThePeriod) {
    Fail("first", 4);
    clock.Advance(1);
    Fail("second");
    clock.Advance(59);
    lockout.Sweep();
    EXPECT_EQ(lockout.Count(), 2u) << "exactly the period ago is not older";
    clock.Advance(1);
    lockout.Sweep();
    EXPECT_EQ(lockout.Count(), 1u);
    clock.Advance(1);
    lockout.Sweep();
    EXPECT_EQ(lockout.Count(), 0u);
}

TEST_F(oxLoginLockoutTest, ManyRecordsAreSweptByTheNextFailure) {
    const int few = static_cast<int>(oxLoginLockout::SWEEP_ABOVE) - 1;
    for (int i = 0; i < few; ++i)
        Fail(Numbered(i));
    clock.Advance(61);
    Fail("one");
    EXPECT_EQ(lockout.Count(), oxLoginLockout::SWEEP_ABOVE) << "not above";
    Fail("two");
    EXPECT_EQ(lockout.Count(), 2u);
}

TEST_F(oxLoginLockoutTest, ManyRecordsAreSweptOnceAPeriod) {
    const int many = static_cast<int>(oxLoginLockout::SWEEP_ABOVE) + 1;
    for (int i = 0; i < many; ++i)
        Fail(Numbered(i));  // the last of them sweeps, and finds nothing
    clock.Advance(59);
    for (int i = 0; i < many; ++i)
        Fail("x" + Numbered(i));
    EXPECT_EQ(lockout.Count(), 2u * static_cast<unsigned>(many));
    clock.Advance(1);
    Fail("one");  // sweeps again: nothing is older than the period yet
    EXPECT_EQ(lockout.Count(), 2u * static_cast<unsigned>(many) + 1);
    clock.Advance(59);
    Fail("two");  // the older half is, but the period since the last sweep has not passed
    EXPECT_EQ(lockout.Count(), 2u * static_cast<unsigned>(many) + 2);
    clock.Advance(1);
    Fail("three");
    EXPECT_EQ(lockout.Count(), 3u);
}

TEST_F(oxLoginLockoutTest, FloodOfNamesStaysBoundedAndKeepsWhoIsLockedOut) {
    Fail("locked", 4);
    Fail("tried", 3);
    for (int i = 0; i < 100000; ++i) {
        Fail(Numbered(i));
        ASSERT_LE(lockout.Count(), oxLoginLockout::MAX_RECORDS);
    }
    EXPECT_EQ(lockout.Count(), oxLoginLockout::MAX_RECORDS);
    EXPECT_TRUE(lockout.IsLockedOut("locked"));
    Fail("tried");
    EXPECT_TRUE(lockout.IsLockedOut("tried")) << "its three failures were kept";
}

TEST_F(oxLoginLockoutTest, FloodForgetsTheOldestOfThoseWithFewestFailures) {
    const int most = static_cast<int>(oxLoginLockout::MAX_RECORDS);
    for (int i = 0; i < most; ++i)
        Fail(Numbered(i));
    Fail(Numbered(0), 2);  // the oldest has three now
    Fail("new");           // takes the place of the next one
    EXPECT_EQ(lockout.Count(), oxLoginLockout::MAX_RECORDS);
    Fail(Numbered(0));
    EXPECT_TRUE(lockout.IsLockedOut(Numbered(0)));
    Fail(Numbered(2), 3);
    EXPECT_TRUE(lockout.IsLockedOut(Numbered(2)));
    Fail(Numbered(1), 3);
    EXPECT_FALSE(lockout.IsLockedOut(Numbered(1))) << "its first failure was forgotten";
}

TEST_F(oxLoginLockoutTest, FloodForgetsWhatIsOverFirst) {
    Fail("old", 4);
    clock.Advance(30);
    const int most = static_cast<int>(oxLoginLockout::MAX_RECORDS) - 1;
    for (int i = 0; i < most; ++i)
        Fail(Numbered(i));
    clock.Advance(30);
    Fail("new");  // no sweep yet: one was made in this period
    EXPECT_EQ(lockout.Count(), oxLoginLockout::MAX_RECORDS);
    Fail(Numbered(0), 3);
    EXPECT_TRUE(lockout.IsLockedOut(Numbered(0))) << "its first failure counts still";
}

TEST_F(oxLoginLockoutTest, EvenLockedOutNamesAreBounded) {
    for (int i = 0; i < static_cast<int>(oxLoginLockout::MAX_RECORDS) + 10; ++i)
        Fail(Numbered(i), 4);
    EXPECT_EQ(lockout.Count(), oxLoginLockout::MAX_RECORDS);
    EXPECT_FALSE(lockout.IsLockedOut(Numbered(0))) << "the oldest went";
    EXPECT_TRUE(lockout.IsLockedOut(Numbered(10)));
}

TEST_F(oxLoginLockoutTest, ManyThreadsCountEveryFailure) {
    constexpr int THREADS = 8;
    constexpr int NAMES = 500;
    std::atomic<int> early{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < NAMES; ++i) {
                // Every name fails in four threads, but the last one of each ten in three only.
                if ((t + i) % 2 == 0 && (i % 10 != 9 || t > 1))
                    lockout.Record(Numbered(i));
                early += lockout.IsLockedOut("nobody");
                if (i % 100 == 0)
                    lockout.Sweep();
            }
        });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(early, 0);
    for (int i = 0; i < NAMES; ++i)
        EXPECT_EQ(lockout.IsLockedOut(Numbered(i)), i % 10 != 9) << i;
}
