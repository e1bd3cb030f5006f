#include "platform/rootguard.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <functional>
#include <thread>
#include <vector>

#include "platform/identitycalls.h"

namespace {

constexpr uid_t ORDINARY_USER = 1;

// Runs the body on a thread of its own whose effective user is the ordinary one; the rest of the process is not
// touched, and threads that the body starts inherit the user.
void AsOrdinaryUser(const std::function<void()>& body) {
    std::thread([&] {
        ASSERT_EQ(0, syscall(SET_USERS_CALL, UNCHANGED_USER, ORDINARY_USER, UNCHANGED_USER));
        ASSERT_EQ(ORDINARY_USER, geteuid());
        body();
    }).join();
}

bool IsRoot() {
    return getuid() == 0 && geteuid() == 0;
}

}  // namespace

#define SKIP_UNLESS_ROOT() \
    if (!IsRoot())         \
    GTEST_SKIP() << "needs root"

TEST(RootGuard, RaisesTheThreadAndRestoresIt) {
    SKIP_UNLESS_ROOT();
    AsOrdinaryUser([] {
        {
            const RootGuard guard;
            EXPECT_TRUE(guard.Raised());
            EXPECT_EQ(0, guard.Error());
            EXPECT_EQ(0u, geteuid());
        }
        EXPECT_EQ(ORDINARY_USER, geteuid());
    });
    EXPECT_EQ(0u, geteuid());
}

TEST(RootGuard, Nests) {
    SKIP_UNLESS_ROOT();
    AsOrdinaryUser([] {
        {
            const RootGuard outer;
            {
                const RootGuard inner;
                EXPECT_TRUE(inner.Raised());
                EXPECT_EQ(0u, geteuid());
            }
            EXPECT_EQ(0u, geteuid()) << "the inner one restores what it found";
        }
        EXPECT_EQ(ORDINARY_USER, geteuid());
    });
}

TEST(RootGuard, KeepLeavesTheRaisedId) {
    SKIP_UNLESS_ROOT();
    AsOrdinaryUser([] {
        {
            RootGuard guard;
            guard.Keep();
        }
        EXPECT_EQ(0u, geteuid());
    });
}

TEST(RootGuard, KeepsErrno) {
    SKIP_UNLESS_ROOT();
    AsOrdinaryUser([] {
        errno = ENOTTY;
        {
            const RootGuard guard;
            EXPECT_EQ(ENOTTY, errno);
        }
        EXPECT_EQ(ENOTTY, errno);
    });
}

TEST(RootGuard, NoOtherThreadEverSeesTheRaisedId) {
    SKIP_UNLESS_ROOT();
    constexpr int RAISERS = 16;
    constexpr int ROUNDS = 1000;
    AsOrdinaryUser([] {
        std::atomic<bool> stop{false};
        std::atomic<long> looks{0};
        std::atomic<long> wrong{0};
        std::thread watcher([&] {
            while (!stop) {
                ++looks;
                if (geteuid() != ORDINARY_USER)
                    ++wrong;
            }
        });
        std::vector<std::thread> raisers;
        for (int i = 0; i < RAISERS; ++i) {
            raisers.emplace_back([&] {
                for (int round = 0; round < ROUNDS; ++round) {
                    {
                        const RootGuard outer;
                        const RootGuard inner;
                        if (geteuid() != 0)
                            ++wrong;
                    }
                    if (geteuid() != ORDINARY_USER)
                        ++wrong;
                }
            });
        }
        for (std::thread& raiser : raisers)
            raiser.join();
        while (looks == 0)
            std::this_thread::yield();
        stop = true;
        watcher.join();
        EXPECT_EQ(0, wrong.load());
        EXPECT_EQ(ORDINARY_USER, geteuid());
    });
}

TEST(RootGuard, WhereRootIsOutOfReachNothingChanges) {
    // A thread that has given up root for good, or the ordinary user who runs the tests.
    std::thread([] {
        if (IsRoot()) {
            ASSERT_EQ(0, syscall(SET_USERS_CALL, ORDINARY_USER, ORDINARY_USER, ORDINARY_USER));
        }
        const uid_t user = geteuid();
        ASSERT_NE(0u, user);
        {
            const RootGuard guard;
            EXPECT_FALSE(guard.Raised());
            EXPECT_EQ(EPERM, guard.Error());
            EXPECT_EQ(user, geteuid());
        }
        EXPECT_EQ(user, geteuid());
    }).join();
}

TEST(RootGuardDeathTest, AFailedRestoreEndsTheProcess) {
    SKIP_UNLESS_ROOT();
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(AsOrdinaryUser([] {
                     const RootGuard guard;
                     // No real or saved id to go back to, and no right to choose one: an ordinary user after all.
                     syscall(SET_USERS_CALL, 2, 2, 2);
                 }),
                 "A thread could not give up the root identity\\.");
}
