#include "users/authunix.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "users/support_accounts.h"

namespace {

using Lines = std::vector<std::string>;

constexpr const char* PASSED = "1 0 ok";
constexpr const char* REFUSED = "0 0 ok";

}  // namespace

TEST(oxAuthUnix, ChecksTheFieldOfThePasswdFile) {
    SKIP_WITHOUT_ACCOUNTS();
    const std::string sha512 = HashOf("secret");
    const std::string yescrypt = HashOf("secret", "$y$");
    struct Case {
        std::string name;
        std::string field;
        std::string password;
        const char* outcome;
    };
    const std::vector<Case> cases = {
        {"sha512", sha512, "secret", PASSED},
        {"sha512w", sha512, "wrong", REFUSED},
        {"sha512e", sha512, "", REFUSED},
        {"yescrypt", yescrypt, "secret", PASSED},
        {"yescryptw", yescrypt, "wrong", REFUSED},
        {"shadowed", "x", "x", REFUSED},
        {"shadowed2", "X", "X", REFUSED},
        {"shadowed3", "x" + sha512, "secret", REFUSED},
        {"nothing", "", "anything at all", PASSED},
        {"nothing2", "", "", PASSED},
        {"star", "*", "*", REFUSED},
        {"star0", "*0", "*0", REFUSED},
        {"bang", "!", "!", REFUSED},
        {"locked", "!" + sha512, "secret", REFUSED},
        {"cut", "$6$", "secret", REFUSED},
        {std::string(63, 'n'), HashOf(std::string(63, 'p')), std::string(63, 'p'), PASSED},
    };
    TestAccounts accounts;
    std::vector<std::string> steps;
    for (const Case& one : cases) {
        accounts.Add(one.name, one.field);
        steps.insert(steps.end(), {"unix", one.name, one.password});
    }
    const HelperRun run = accounts.Run(steps);
    EXPECT_EQ(0, run.status);
    EXPECT_EQ(Lines{}, run.errors);
    ASSERT_EQ(cases.size(), run.lines.size());
    for (std::size_t i = 0; i < cases.size(); ++i)
        EXPECT_EQ(cases[i].outcome, run.lines[i]) << cases[i].name;
}

TEST(oxAuthUnix, ChecksNothingThatWasCut) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add(std::string(63, 'n'), HashOf(std::string(63, 'p')));
    accounts.Add("open", "");
    const HelperRun run = accounts.Run({"unix", std::string(64, 'n'), std::string(63, 'p'),  //
                                        "unix", std::string(63, 'n'), std::string(64, 'p'),  //
                                        "unix", "open", std::string(64, 'p'),                //
                                        "unix", "open", std::string(63, 'p')});
    EXPECT_EQ((Lines{REFUSED, REFUSED, REFUSED, PASSED}), run.lines);
}

TEST(oxAuthUnix, AnUnknownNameIsRefusedSilently) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    EXPECT_EQ((Lines{REFUSED, REFUSED}), accounts.Run({"unix", "nobody-of-that-name", "x", "unix", "", ""}).lines);
}

TEST(oxAuthUnix, ALineOverTheRoomIsTheStatedError) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.AddPasswdLine("roomy:" + HashOf("secret") + ":4001:4001:" + std::string(300, 'g') + ":/:/bin/sh");
    accounts.AddPasswdLine("long:" + HashOf("secret") + ":4001:4001:" + std::string(600, 'g') + ":/:/bin/sh");
    EXPECT_EQ((Lines{PASSED, "0 34 Numerical result out of range"}),
              accounts.Run({"unix", "roomy", "secret", "unix", "long", "secret"}).lines);
}

TEST(oxAuthUnix, ChecksAgainWithStoredTexts) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", HashOf("secret"));
    EXPECT_EQ((Lines{"empty 0 0 ok", "given 1 0 ok", "stored 1 0 ok", "stored name 0 0 ok", "stored wrong 0 0 ok",
                     "stored name again 1 0 ok", "other name 0 0 ok"}),
              accounts.Run({"again", "unix", "alice", "secret"}).lines);
}

TEST(oxAuthUnix, NeedsNoRights) {
    SKIP_UNLESS_ROOT();
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", HashOf("secret"));
    EXPECT_EQ((Lines{PASSED, "euid=1 groups=1"}),
              accounts.Run({"groups", "1", "drop", "unix", "alice", "secret", "ids"}).lines);
}

// On the accounts of this machine, whatever they are: those without a password in sight and names that nobody has.
TEST(oxAuthUnix, RefusesOnThisMachine) {
    struct Case {
        const char* name;
        const char* password;
    };
    for (const Case& one : {Case{"no-such-account-here", "x"}, {"", ""}, {"", "x"}}) {
        const oxAuthUnix check(one.name, one.password);
        EXPECT_FALSE(check.IsAuthenticated()) << one.name;
        EXPECT_EQ(0, check.Error()) << one.name;
        EXPECT_EQ("ok", check.Message()) << one.name;
    }
    const oxAuthUnix unchecked("root", nullptr);
    EXPECT_FALSE(unchecked.IsAuthenticated());
}
