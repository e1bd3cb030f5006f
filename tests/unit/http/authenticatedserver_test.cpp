#include "http/authenticatedserver.h"

#include <pthread.h>
#include <unistd.h>

#if defined(__SANITIZE_ADDRESS__)
#define OX_ADDRESS_SANITIZER 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define OX_ADDRESS_SANITIZER 1
#endif
#endif
#ifdef OX_ADDRESS_SANITIZER
#include <sanitizer/asan_interface.h>
#endif

#include <new>
#include <stdexcept>
#include <thread>
#include <vector>

#include "http/authenticatedfixture.h"

namespace {

using oxAuthenticatedHttpServerTest = AuthenticatedFixture;
using Checks = std::pair<int, int>;

// AddressSanitizer does not see the unwinding of a cancelled thread, and would take the guards that the frames leave on
// the stack for those of later ones.
void PrepareForUnwinding() {
#ifdef OX_ADDRESS_SANITIZER
    __asan_handle_no_return();
#endif
}

}  // namespace

TEST_F(oxAuthenticatedHttpServerTest, AcceptsNobodyByItself) {
    oxAuthenticatedHttpServer plain(clock);
    oxUser user(clock);
    user.SetUser("alice");
    EXPECT_FALSE(plain.AuthenticateUser(user, Check::Full));
    std::uint32_t permissions = 77;
    EXPECT_FALSE(plain.AuthenticateRequest(Credentials("alice", ""), permissions));
    EXPECT_EQ(permissions, 77u);
}

TEST_F(oxAuthenticatedHttpServerTest, RequestWithoutANameIsRefusedWithoutACheck) {
    server->onCheck = [](oxUser&, Check) { return true; };
    EXPECT_FALSE(server->Ask("", ""));
    EXPECT_FALSE(server->Ask("", "password"));
    EXPECT_EQ(server->Checks(), Checks(0, 0));
    EXPECT_EQ(server->UserCount(), 0u);
}

TEST_F(oxAuthenticatedHttpServerTest, AcceptedLoginIsRememberedWithItsPermissions) {
    for (int i = 0; i < 3; ++i) {
        server->permissions = 0;
        EXPECT_TRUE(server->Ask("alice", "ecila"));
        EXPECT_EQ(server->permissions, 5u);
        EXPECT_EQ(server->Checks(), Checks(1, 0)) << "checked once";
    }
    EXPECT_TRUE(server->Ask("bob", "bob"));
    EXPECT_EQ(server->permissions, 3u);
    EXPECT_EQ(server->Checks(), Checks(2, 0));
    EXPECT_EQ(server->UserCount(), 2u);
}

TEST_F(oxAuthenticatedHttpServerTest, OnlyExactlyTheSameNameAndPasswordAreRemembered) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    static const struct {
        const char* user;
        const char* password;
    } CASES[] = {{"alice", "ecil"},  {"alice", "ecilaa"}, {"alice", "ecilA"},  {"alice", "Ecila"}, {"alice", ""},
                 {"Alice", "ecila"}, {"alic", "ecila"},   {"alicea", "ecila"}, {"alice ", "ecila"}};
    int checks = 1;
    for (const auto& c : CASES) {
        std::uint32_t permissions = 77;
        EXPECT_FALSE(server->FindUser(c.user, c.password, permissions)) << c.user << ':' << c.password;
        EXPECT_EQ(permissions, 77u);
        EXPECT_FALSE(server->Ask(c.user, c.password)) << c.user << ':' << c.password;
        EXPECT_EQ(server->Checks(), Checks(++checks, 0)) << "checked in full";
    }
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(checks, 0)) << "wrong attempts of others log nobody out";
    EXPECT_EQ(server->UserCount(), 1u);
}

TEST_F(oxAuthenticatedHttpServerTest, FindUserGivesThePermissions) {
    std::uint32_t permissions = 0;
    EXPECT_FALSE(server->FindUser("alice", "ecila", permissions));
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_TRUE(server->FindUser("alice", "ecila", permissions));
    EXPECT_EQ(permissions, 5u);
    ++server->generation;
    EXPECT_FALSE(server->FindUser("alice", "ecila", permissions)) << "the user data has changed";
    EXPECT_EQ(server->Checks(), Checks(1, 0));
}

TEST_F(oxAuthenticatedHttpServerTest, RefusedLoginIsNotRemembered) {
    for (int i = 1; i <= 3; ++i) {
        EXPECT_FALSE(server->Ask("alice", "wrong"));
        EXPECT_EQ(server->Checks(), Checks(i, 0));
    }
    EXPECT_EQ(server->permissions, 0u);
    EXPECT_EQ(server->UserCount(), 0u);
}

TEST_F(oxAuthenticatedHttpServerTest, ChangedUserDataIsAskedForOnce) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ++server->generation;
    server->onCheck = [](oxUser& user, Check check) {
        EXPECT_EQ(check, Check::Remembered);
        EXPECT_EQ(user.GetUser(), "alice");
        EXPECT_EQ(user.GetPassword(), "ecila");
        EXPECT_EQ(user.GetPermissions(), 0u) << "a fresh one";
        user.SetPermissions(9);
        return true;
    };
    for (int i = 0; i < 3; ++i) {
        EXPECT_TRUE(server->Ask("alice", "ecila"));
        EXPECT_EQ(server->permissions, 9u);
        EXPECT_EQ(server->Checks(), Checks(1, 1));
    }
    EXPECT_EQ(server->UserCount(), 1u);
}

TEST_F(oxAuthenticatedHttpServerTest, LoginThatTheChangedDataRefusesIsLost) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ++server->generation;
    server->onCheck = [](oxUser&, Check) { return false; };
    EXPECT_FALSE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(1, 1));
    EXPECT_EQ(server->UserCount(), 0u);
    EXPECT_FALSE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(2, 1)) << "in full from now on";
}

TEST_F(oxAuthenticatedHttpServerTest, AnotherPasswordIsCheckedInFullAlsoAfterAChange) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ++server->generation;
    EXPECT_FALSE(server->Ask("alice", "wrong"));
    EXPECT_EQ(server->Checks(), Checks(2, 0));
    EXPECT_EQ(server->UserCount(), 1u);
}

TEST_F(oxAuthenticatedHttpServerTest, ChangeDuringTheCheckIsAskedForAgain) {
    server->onCheck = [this](oxUser& user, Check) {
        user.SetPermissions(1);
        ++server->generation;
        return true;
    };
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    server->onCheck = nullptr;
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(1, 1));
    EXPECT_EQ(server->permissions, 5u);
}

TEST_F(oxAuthenticatedHttpServerTest, OneLoginIsRememberedForEachName) {
    server->onCheck = [](oxUser& user, Check) {
        user.SetPermissions(1);
        return true;
    };
    for (int i = 0; i < 1000; ++i)
        ASSERT_TRUE(server->Ask("anonymous", "password" + std::to_string(i)));
    EXPECT_EQ(server->UserCount(), 1u);
    EXPECT_EQ(server->Checks(), Checks(1000, 0));
    EXPECT_TRUE(server->Ask("anonymous", "password999"));
    EXPECT_EQ(server->Checks(), Checks(1000, 0)) << "the last one";
}

TEST_F(oxAuthenticatedHttpServerTest, NoLockIsHeldDuringACheck) {
    server->onCheck = [this](oxUser& user, Check) {
        std::uint32_t permissions = 0;
        EXPECT_FALSE(server->FindUser(user.GetUser(), user.GetPassword(), permissions));
        EXPECT_EQ(server->SweepUsers(), server->UserCount());
        return true;
    };
    EXPECT_TRUE(server->Ask("alice", "x"));
}

// A check that began before a change and ended after one of newer data must not put the old login back.
TEST_F(oxAuthenticatedHttpServerTest, SlowCheckOfOldDataReplacesNoNewerLogin) {
    Gate gate;
    server->onCheck = [&](oxUser& user, Check) {
        if (user.GetPassword() == "old")
            gate.Pass();
        user.SetPermissions(1);
        return true;
    };
    std::thread slow([&] {
        std::uint32_t permissions = 0;
        EXPECT_TRUE(server->AuthenticateRequest(Credentials("alice", "old"), permissions));
    });
    gate.WaitUntilReached();
    ++server->generation;
    EXPECT_TRUE(server->Ask("alice", "new"));
    gate.Open();
    slow.join();
    std::uint32_t permissions = 0;
    EXPECT_FALSE(server->FindUser("alice", "old", permissions));
    EXPECT_TRUE(server->FindUser("alice", "new", permissions));
}

// A remembered login that is asked about again must not take one with it that was accepted meanwhile, with another
// password or, after one more change, with the same.
TEST_F(oxAuthenticatedHttpServerTest, SlowRefusalForgetsNoNewerLogin) {
    for (const std::string password : {"new", "ecila"}) {
        server->onCheck = nullptr;
        ASSERT_TRUE(server->Ask("alice", "ecila"));
        ++server->generation;
        Gate gate;
        std::atomic<bool> first{true};
        server->onCheck = [&](oxUser&, Check) {
            if (!first.exchange(false))
                return true;
            gate.Pass();
            return false;
        };
        std::thread slow([&] {
            std::uint32_t permissions = 0;
            EXPECT_FALSE(server->AuthenticateRequest(Credentials("alice", "ecila"), permissions));
        });
        gate.WaitUntilReached();
        ++server->generation;
        EXPECT_TRUE(server->Ask("alice", password));
        gate.Open();
        slow.join();
        std::uint32_t permissions = 0;
        EXPECT_TRUE(server->FindUser("alice", password, permissions)) << password;
    }
}

TEST_F(oxAuthenticatedHttpServerTest, WhateverTheCheckRaisesIsALoggedRefusal) {
    const std::function<void()> raises[] = {
        [] { throw std::runtime_error("x"); },
        [] { throw std::bad_alloc(); },
        [] { throw 42; },
    };
    int line = 0;
    for (const auto& raise : raises) {
        server->onCheck = [&raise](oxUser&, Check) {
            raise();
            return true;
        };
        EXPECT_FALSE(server->Ask("alice", "ecila"));
        EXPECT_EQ(Count(": An unknown exception occurred during authentication."), ++line);
        EXPECT_EQ(server->UserCount(), 0u);
    }
    server->onCheck = nullptr;
    EXPECT_TRUE(server->Ask("alice", "ecila"));
}

TEST_F(oxAuthenticatedHttpServerTest, CancelledThreadIsNotHeldUp) {
    std::atomic<bool> reached{false};
    server->onCheck = [&](oxUser&, Check) {
        PrepareForUnwinding();
        reached = true;
        for (;;)
            pause();
        return true;
    };
    pthread_t thread;
    ASSERT_EQ(pthread_create(
                  &thread, nullptr,
                  [](void* argument) -> void* {
                      static_cast<TestAuthenticatedServer*>(argument)->Ask("alice", "ecila");
                      return nullptr;
                  },
                  server.get()),
              0);
    ASSERT_TRUE(Eventually([&] { return reached.load(); }));
    pthread_cancel(thread);
    void* result = nullptr;
    ASSERT_EQ(pthread_join(thread, &result), 0);
    EXPECT_EQ(result, PTHREAD_CANCELED);
    EXPECT_EQ(Count("An unknown exception"), 0);
}

TEST_F(oxAuthenticatedHttpServerTest, RemoveUserForgetsThatNameOnly) {
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ASSERT_TRUE(server->Ask("bob", "bob"));
    oxUser alice(clock);
    alice.SetUser("alice");
    server->RemoveUser(alice);
    server->RemoveUser(alice);
    EXPECT_EQ(server->UserCount(), 1u);
    std::uint32_t permissions = 0;
    EXPECT_TRUE(server->FindUser("bob", "bob", permissions));
    EXPECT_FALSE(server->FindUser("alice", "ecila", permissions));
}

TEST_F(oxAuthenticatedHttpServerTest, SweepForgetsWhoWasIdleForLongerThanTheTimeout) {
    oxUser::m_nTimeout = 30;
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    ASSERT_TRUE(server->Ask("bob", "bob"));
    clock.Advance(30);
    EXPECT_EQ(server->SweepUsers(), 2u) << "exactly the time-out is not too long";
    ASSERT_TRUE(server->Ask("bob", "bob"));
    clock.Advance(1);
    EXPECT_EQ(server->SweepUsers(), 1u);
    clock.Advance(29);
    std::uint32_t permissions = 0;
    EXPECT_TRUE(server->FindUser("bob", "bob", permissions)) << "counts as use";
    clock.Advance(30);
    EXPECT_EQ(server->SweepUsers(), 1u);
    clock.Advance(1);
    EXPECT_EQ(server->SweepUsers(), 0u);
    EXPECT_TRUE(server->Ask("bob", "bob"));
    EXPECT_EQ(server->Checks(), Checks(3, 0)) << "checked again";
}

TEST_F(oxAuthenticatedHttpServerTest, LoginIdleForLongerThanTheTimeoutIsCheckedAgainBeforeTheSweepToo) {
    oxUser::m_nTimeout = 30;
    ASSERT_TRUE(server->Ask("alice", "ecila"));
    clock.Advance(30);
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(1, 0)) << "exactly the time-out is not too long";
    clock.Advance(31);
    std::uint32_t permissions = 0;
    EXPECT_FALSE(server->FindUser("alice", "ecila", permissions));
    ++server->generation;
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(2, 0)) << "in full";
    EXPECT_EQ(server->UserCount(), 1u);
    clock.Advance(30);
    EXPECT_TRUE(server->Ask("alice", "ecila"));
    EXPECT_EQ(server->Checks(), Checks(2, 0)) << "remembered anew";
}

// Logins, changes, sweeps and removals all at once: nobody is refused, and what is remembered is never wrong.
TEST_F(oxAuthenticatedHttpServerTest, ManyThreadsAtOnce) {
    constexpr int THREADS = 8;
    constexpr int ROUNDS = 2000;
    constexpr int NAMES = 5;
    settings.sessionTimeout = 2;
    server->Configure(settings);
    ASSERT_TRUE(server->StartAuthenticated(false));
    server->onCheck = [](oxUser& user, Check) {
        user.SetPermissions(static_cast<std::uint32_t>(user.GetUser().back()));
        return user.GetPassword() == "right";
    };
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < ROUNDS; ++i) {
                const std::string name = "user" + std::to_string((t + i) % NAMES);
                std::uint32_t permissions = 0;
                wrong += !server->AuthenticateRequest(Credentials(name, "right"), permissions);
                wrong += permissions != static_cast<std::uint32_t>(name.back());
                wrong += server->AuthenticateRequest(Credentials(name, "wrong"), permissions);
                if (i % 7 == t) {
                    ++server->generation;
                } else if (i % 11 == t) {
                    clock.Advance(1);
                    server->SweepUsers();
                } else if (i % 13 == t) {
                    oxUser user(clock);
                    user.SetUser(name.c_str());
                    server->RemoveUser(user);
                } else if (i % 17 == t) {
                    wrong += server->FindUser(name, "wrong", permissions);
                    wrong += server->UserCount() > NAMES;
                }
            }
        });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
    EXPECT_GT(server->rememberedChecks.load(), 0);
    clock.Advance(10);
    EXPECT_EQ(server->SweepUsers(), 0u);
    EXPECT_TRUE(WaitUntilIdle());
}
