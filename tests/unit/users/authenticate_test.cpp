#include "users/authenticate.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <new>
#include <string>

#include "users/support_accounts.h"

namespace {

// Accepts the one pair of a name and password, and opens the base's inner parts to the tests.
class PairCheck : public oxAuthenticate {
public:
    PairCheck(const char* user, const char* password) : oxAuthenticate(user, password) {}
    bool Authenticate(const char* user, const char* password) override {
        if (!Begin(user, password))
            return false;
        m_authenticated = std::strcmp(m_user, "alice") == 0 && std::strcmp(m_password, "secret") == 0;
        if (!m_authenticated)
            Fail(7, "no");
        return m_authenticated;
    }
    std::string User() const { return m_user; }
    std::string Password() const { return m_password; }
    using oxAuthenticate::Matches;
};

std::string Text(std::size_t length) {
    return std::string(length, 'a');
}

}  // namespace

TEST(oxAuthenticate, BeginsWithNoOutcome) {
    const PairCheck check("alice", "secret");
    EXPECT_FALSE(check.IsAuthenticated());
    EXPECT_EQ(0, check.Error());
    EXPECT_EQ("ok", check.Message());
    EXPECT_EQ("alice", check.User());
    EXPECT_EQ("secret", check.Password());
}

TEST(oxAuthenticate, NullArgumentsLeaveTheFieldsEmpty) {
    const PairCheck check(nullptr, nullptr);
    EXPECT_EQ("", check.User());
    EXPECT_EQ("", check.Password());
}

TEST(oxAuthenticate, NullStandsForTheStoredText) {
    PairCheck check("alice", nullptr);
    EXPECT_FALSE(check.Authenticate(nullptr, nullptr));
    EXPECT_EQ(7, check.Error());
    EXPECT_EQ("no", check.Message());
    EXPECT_TRUE(check.Authenticate(nullptr, "secret"));
    EXPECT_EQ(0, check.Error()) << "of the last check";
    EXPECT_EQ("ok", check.Message());
    EXPECT_TRUE(check.Authenticate(nullptr, nullptr));
    EXPECT_FALSE(check.Authenticate("bob", nullptr));
    EXPECT_FALSE(check.IsAuthenticated());
    EXPECT_FALSE(check.Authenticate(nullptr, nullptr)) << "the given name was stored";
}

TEST(oxAuthenticate, StoresUpTo63Characters) {
    struct Case {
        std::size_t name;
        std::size_t password;
        bool fits;
    };
    for (const Case& one :
         {Case{0, 0, true}, {63, 63, true}, {64, 1, false}, {1, 64, false}, {65, 65, false}, {100000, 0, false}}) {
        class Fits : public PairCheck {
        public:
            using PairCheck::PairCheck;
            bool Authenticate(const char* user, const char* password) override {
                return m_authenticated = Begin(user, password);
            }
        };
        const std::string name = Text(one.name);
        const std::string password = Text(one.password);
        Fits given(nullptr, nullptr);
        EXPECT_EQ(one.fits, given.Authenticate(name.c_str(), password.c_str())) << one.name << " " << one.password;
        EXPECT_EQ(one.fits, given.Authenticate(nullptr, nullptr)) << "a cut text stays refused";
        Fits constructed(name.c_str(), password.c_str());
        EXPECT_EQ(one.fits, constructed.Authenticate(nullptr, nullptr)) << one.name << " " << one.password;
        EXPECT_EQ(Text(std::min<std::size_t>(one.name, 63)), constructed.User());
        EXPECT_TRUE(constructed.Authenticate("short", "short")) << "texts that fit are checked again";
        EXPECT_EQ("short", constructed.User());
    }
}

TEST(oxAuthenticate, WipesThePassword) {
    alignas(PairCheck) unsigned char room[sizeof(PairCheck)];
    auto* const check = new (room) PairCheck("somebody", "VerySecretWord");
    const std::string before(reinterpret_cast<const char*>(room), sizeof room);
    ASSERT_NE(std::string::npos, before.find("VerySecretWord"));
    check->Authenticate(nullptr, "Short");
    const std::string changed(reinterpret_cast<const char*>(room), sizeof room);
    EXPECT_EQ(std::string::npos, changed.find("SecretWord")) << "nothing of the earlier one stays";
    check->Authenticate(nullptr, "VerySecretWord");
    check->~PairCheck();
    const std::string after(const_cast<const char*>(reinterpret_cast<volatile char*>(room)), sizeof room);
    EXPECT_EQ(std::string::npos, after.find("VerySecretWord"));
}

TEST(oxAuthenticate, MatchesOnlyItsHash) {
    for (const char* prefix : {"$6$", "$y$", "$5$"}) {
        const std::string hash = HashOf("secret", prefix);
        ASSERT_EQ(0u, hash.find(prefix)) << hash;
        EXPECT_TRUE(PairCheck::Matches("secret", hash.c_str())) << hash;
        EXPECT_FALSE(PairCheck::Matches("Secret", hash.c_str())) << hash;
        EXPECT_FALSE(PairCheck::Matches("secret ", hash.c_str())) << hash;
        EXPECT_FALSE(PairCheck::Matches("", hash.c_str())) << hash;
        EXPECT_FALSE(PairCheck::Matches("secret", ("!" + hash).c_str())) << "locked";
        EXPECT_FALSE(PairCheck::Matches("secret", ("*" + hash).c_str())) << "locked";
        EXPECT_FALSE(PairCheck::Matches("secret", hash.substr(0, hash.size() - 1).c_str())) << "cut";
        EXPECT_FALSE(PairCheck::Matches("secret", (hash + "x").c_str())) << "longer";
    }
    const std::string empty = HashOf("");
    EXPECT_TRUE(PairCheck::Matches("", empty.c_str())) << "the hash of the empty password is a hash like others";
}

TEST(oxAuthenticate, WhatIsNoHashNeverMatches) {
    for (const char* field : {"", "!", "!!", "*", "*0", "*1", "*LK*", "x", "X", "NP", "$6$", "$6$salt", "$y$", "$",
                              "$$", "$9$salt$hash", "secret", ":", "\xff\xfe"}) {
        for (const char* password : {"", "secret", "!", "*", "*0", "*1", "x", "$6$salt", "\xff\xfe"})
            EXPECT_FALSE(PairCheck::Matches(password, field)) << "\"" << password << "\" \"" << field << "\"";
    }
}
