#include "users/groupguard.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <latch>
#include <thread>
#include <vector>

#include "platform/identitycalls.h"
#include "users/support_accounts.h"

namespace {

using Groups = std::vector<gid_t>;

Groups Now() {
    Groups groups(static_cast<std::size_t>(getgroups(0, nullptr)));
    getgroups(static_cast<int>(groups.size()), groups.data());
    return groups;
}

// Runs the body on a thread of its own that has the groups 1 and 2; the process keeps its groups.
template <typename Body>
void OnAThread(const Body& body) {
    std::thread([&] {
        const Groups start{1, 2};
        ASSERT_EQ(0, syscall(SET_GROUP_LIST_CALL, start.size(), start.data()));
        body();
    }).join();
}

}  // namespace

TEST(GroupGuard, RestoresWhatItsThreadChanged) {
    SKIP_UNLESS_ROOT();
    const Groups before = Now();
    OnAThread([&] {
        {
            const GroupGuard guard;
            const Groups other{3, 4, 5};
            EXPECT_EQ(0, setgroups(other.size(), other.data()));
            EXPECT_EQ(other, Now());
            EXPECT_EQ(0, setgroups(0, nullptr));
            EXPECT_EQ(Groups{}, Now());
        }
        EXPECT_EQ((Groups{1, 2}), Now());
    });
    EXPECT_EQ(before, Now());
}

TEST(GroupGuard, InitgroupsIsHeldToTheThreadToo) {
    SKIP_UNLESS_ROOT();
    const Groups before = Now();
    OnAThread([&] {
        {
            const GroupGuard guard;
            EXPECT_EQ(0, initgroups("no-such-account-here", 77));
            EXPECT_EQ((Groups{77}), Now());
        }
        EXPECT_EQ((Groups{1, 2}), Now());
    });
    EXPECT_EQ(before, Now());
}

TEST(GroupGuard, OtherThreadsNeverSeeTheGroups) {
    SKIP_UNLESS_ROOT();
    const Groups before = Now();
    OnAThread([&] {
        std::latch changed(1);
        std::latch looked(1);
        Groups seen{99};
        std::thread other([&] {
            changed.wait();
            seen = Now();
            looked.count_down();
        });
        {
            const GroupGuard guard;
            const Groups foreign{3};
            EXPECT_EQ(0, setgroups(foreign.size(), foreign.data()));
            changed.count_down();
            looked.wait();
        }
        other.join();
        EXPECT_EQ((Groups{1, 2}), seen);
    });
    EXPECT_EQ(before, Now());
}

TEST(GroupGuard, Nests) {
    SKIP_UNLESS_ROOT();
    OnAThread([] {
        {
            const GroupGuard outer;
            const Groups middle{6};
            EXPECT_EQ(0, setgroups(middle.size(), middle.data()));
            {
                const GroupGuard inner;
                EXPECT_EQ(0, setgroups(0, nullptr));
            }
            EXPECT_EQ(middle, Now());
            EXPECT_EQ(0, setgroups(0, nullptr)) << "still this thread alone";
        }
        EXPECT_EQ((Groups{1, 2}), Now());
    });
}

TEST(GroupGuard, KeepsErrno) {
    errno = ENOTTY;
    {
        const GroupGuard guard;
        EXPECT_EQ(ENOTTY, errno);
    }
    EXPECT_EQ(ENOTTY, errno);
}

TEST(GroupGuard, WithoutAGuardTheWholeProcessChanges) {
    SKIP_UNLESS_ROOT();
    const Groups before = Now();
    std::thread([] {
        const Groups all{8, 9};
        EXPECT_EQ(0, setgroups(all.size(), all.data()));
    }).join();
    EXPECT_EQ((Groups{8, 9}), Now());
    EXPECT_EQ(0, setgroups(before.size(), before.data()));
    EXPECT_EQ(before, Now());
}

TEST(GroupGuardDeathTest, AFailedRestoreEndsTheProcess) {
    SKIP_UNLESS_ROOT();
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(OnAThread([] {
                     const GroupGuard guard;
                     EXPECT_EQ(0, setgroups(0, nullptr));
                     EXPECT_EQ(0, seteuid(1));
                 }),
                 "A thread could not take back its groups\\.");
}
