#include "users/user.h"

#include <gtest/gtest.h>

#include <climits>
#include <cstring>
#include <memory>
#include <new>
#include <string>

#include "testing/manualclock.h"

namespace {

// Sets the idle time-out of all users for one test.
class TimeoutOf {
public:
    explicit TimeoutOf(std::int32_t seconds) : m_before(oxUser::m_nTimeout.exchange(seconds)) {}
    ~TimeoutOf() { oxUser::m_nTimeout = m_before; }
    TimeoutOf(const TimeoutOf&) = delete;
    TimeoutOf& operator=(const TimeoutOf&) = delete;

private:
    std::int32_t m_before;
};

}  // namespace

TEST(oxUser, TheTimeoutIsAMinuteUnlessSet) {
    EXPECT_EQ(60, oxUser::DEFAULT_TIMEOUT);
    EXPECT_EQ(60, oxUser::m_nTimeout.load());
}

TEST(oxUser, ExpiresWhenIdleForLongerThanTheTimeout) {
    struct Case {
        std::int32_t timeout;
        std::int64_t idle;
        bool expired;
    };
    constexpr Case CASES[] = {
        {60, 0, false},
        {60, 59, false},
        {60, 60, false},
        {60, 61, true},
        {60, 1000, true},
        {600, 600, false},
        {600, 601, true},
        {30, 31, true},
        {0, 0, false},
        {0, 1, true},
        {-1, 0, true},
        {60, -100, false},
        {INT_MAX, 1000000, false},
        {INT_MAX, INT_MAX, false},
        {INT_MAX, INT_MAX + 1LL, true},
        {60, 5000000000LL, true},
        {INT_MIN, 0, true},
    };
    for (const Case& c : CASES) {
        const TimeoutOf timeout(c.timeout);
        ManualClock clock(1500000000);
        oxUser user(clock);
        user.Touch();
        clock.Advance(c.idle);
        EXPECT_EQ(c.expired, user.IsExpired()) << c.timeout << " " << c.idle;
    }
}

TEST(oxUser, ExpiresByTheSameRuleAfterTheYear2038) {
    ManualClock clock(4102444800);  // 2100
    oxUser user(clock);
    clock.Advance(60);
    EXPECT_FALSE(user.IsExpired());
    clock.Advance(1);
    EXPECT_TRUE(user.IsExpired());
}

TEST(oxUser, WhatCountsAsUse) {
    struct Case {
        const char* what;
        void (*use)(oxUser& user);
        bool counts;
    };
    constexpr Case CASES[] = {
        {"touching", [](oxUser& user) { user.Touch(); }, true},
        {"setting the permissions", [](oxUser& user) { user.SetPermissions(1); }, true},
        {"reading the permissions", [](oxUser& user) { user.GetPermissions(); }, true},
        {"setting the attribute", [](oxUser& user) { user.SetAttribute(1); }, false},
        {"reading the attribute", [](oxUser& user) { user.GetAttribute(); }, false},
        {"asking", [](oxUser& user) { user.IsExpired(); }, false},
        {"naming", [](oxUser& user) { user.SetUser("alice"); }, false},
        {"reading the name", [](oxUser& user) { EXPECT_EQ("", user.GetUser()); }, false},
    };
    for (const Case& c : CASES) {
        ManualClock clock;
        oxUser user(clock);
        clock.Advance(60);
        c.use(user);
        clock.Advance(1);
        EXPECT_EQ(!c.counts, user.IsExpired()) << c.what;
        clock.Advance(59);
        EXPECT_EQ(!c.counts, user.IsExpired()) << c.what;
        clock.Advance(1);
        EXPECT_TRUE(user.IsExpired()) << c.what;
    }
}

TEST(oxUser, AnExpiredUserIsRenewedByUse) {
    ManualClock clock;
    oxUser user(clock);
    clock.Advance(100);
    EXPECT_TRUE(user.IsExpired());
    user.Touch();
    EXPECT_FALSE(user.IsExpired());
}

TEST(oxUser, KeepsPermissionsAndAttribute) {
    ManualClock clock;
    oxUser user(clock);
    EXPECT_EQ(0u, user.GetPermissions());
    EXPECT_EQ(0u, user.GetAttribute());
    for (const std::uint32_t value : {0u, 1u, 3u, 0x7FFFFFFFu, 0x80000000u, 0xFFFFFFFFu}) {
        user.SetPermissions(value);
        user.SetAttribute(~value);
        EXPECT_EQ(value, user.GetPermissions());
        EXPECT_EQ(~value, user.GetAttribute());
    }
}

TEST(oxUser, ATimeoutThatChangesCountsForUsersThatAreThere) {
    ManualClock clock;
    oxUser user(clock);
    clock.Advance(100);
    EXPECT_TRUE(user.IsExpired());
    const TimeoutOf timeout(600);
    EXPECT_FALSE(user.IsExpired());
}

TEST(oxUser, ThePasswordIsWipedWhenItEnds) {
    // In place, so that a password that is held inside the object can be looked for afterwards.
    alignas(oxUser) unsigned char memory[sizeof(oxUser)] = {};
    auto* const user = new (memory) oxUser;
    user->SetUser("alice");
    user->SetPassword("hunter2hunter2");  // held without an allocation
    const std::string before(reinterpret_cast<const char*>(memory), sizeof memory);
    ASSERT_NE(std::string::npos, before.find("hunter2"));
    user->~oxUser();
    const std::string after(reinterpret_cast<const char*>(memory), sizeof memory);
    EXPECT_EQ(std::string::npos, after.find("hunter2"));
}
