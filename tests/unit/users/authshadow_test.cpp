#include "users/authshadow.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "users/support_accounts.h"

namespace {

using Lines = std::vector<std::string>;

constexpr const char* PASSED = "1 0 ok";
constexpr const char* REFUSED = "0 0 ok";

}  // namespace

TEST(oxAuthShadow, ChecksTheFieldOfTheShadowFile) {
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
        {"nothing", "", "", REFUSED},
        {"nothing2", "", "anything", REFUSED},
        {"ex", "x", "x", REFUSED},
        {"star", "*", "*", REFUSED},
        {"star0", "*0", "*0", REFUSED},
        {"bang", "!", "!", REFUSED},
        {"locked", "!" + sha512, "secret", REFUSED},
        {"locked2", "!*", "secret", REFUSED},
        {std::string(63, 'n'), HashOf(std::string(63, 'p')), std::string(63, 'p'), PASSED},
    };
    TestAccounts accounts;
    std::vector<std::string> steps;
    for (const Case& one : cases) {
        accounts.Add(one.name, "x", one.field);
        steps.insert(steps.end(), {"shadow", one.name, one.password});
    }
    const HelperRun run = accounts.Run(steps);
    EXPECT_EQ(0, run.status);
    EXPECT_EQ(Lines{}, run.errors);
    ASSERT_EQ(cases.size(), run.lines.size());
    for (std::size_t i = 0; i < cases.size(); ++i)
        EXPECT_EQ(cases[i].outcome, run.lines[i]) << cases[i].name;
}

TEST(oxAuthShadow, ChecksNothingThatWasCut) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add(std::string(63, 'n'), "x", HashOf(std::string(63, 'p')));
    EXPECT_EQ((Lines{REFUSED, REFUSED}), accounts
                                             .Run({"shadow", std::string(64, 'n'), std::string(63, 'p'),  //
                                                   "shadow", std::string(63, 'n'), std::string(64, 'p')})
                                             .lines);
}

TEST(oxAuthShadow, AnUnknownNameIsRefusedSilently) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    EXPECT_EQ((Lines{REFUSED, REFUSED}), accounts.Run({"shadow", "nobody-of-that-name", "x", "shadow", "", ""}).lines);
}

TEST(oxAuthShadow, ALineOverTheRoomIsTheStatedError) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.AddShadowLine("roomy:" + std::string(7000, 'h') + ":19000:0:99999:7:::");
    accounts.AddShadowLine("long:" + std::string(9000, 'h') + ":19000:0:99999:7:::");
    EXPECT_EQ((Lines{REFUSED, "0 34 Numerical result out of range"}),
              accounts.Run({"shadow", "roomy", "secret", "shadow", "long", "secret"}).lines);
}

TEST(oxAuthShadow, ChecksAgainWithStoredTexts) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    EXPECT_EQ((Lines{"empty 0 0 ok", "given 1 0 ok", "stored 1 0 ok", "stored name 0 0 ok", "stored wrong 0 0 ok",
                     "stored name again 1 0 ok", "other name 0 0 ok"}),
              accounts.Run({"again", "shadow", "alice", "secret"}).lines);
}

TEST(oxAuthShadow, RaisesToRootAndRestores) {
    SKIP_UNLESS_ROOT();
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    EXPECT_EQ(
        (Lines{PASSED, REFUSED, "euid=1 groups=1"}),
        accounts.Run({"groups", "1", "lower", "shadow", "alice", "secret", "shadow", "alice", "wrong", "ids"}).lines);
}

TEST(oxAuthShadow, WithoutRootIsTheSystemsError) {
    SKIP_UNLESS_ROOT();
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    EXPECT_EQ((Lines{"0 13 Permission denied", "0 13 Permission denied"}),
              accounts.Run({"drop", "shadow", "alice", "secret", "shadow", "nobody-of-that-name", "secret"}).lines);
}

// On the accounts of this machine, for an ordinary user: some name services hide that another one was not readable.
TEST(oxAuthShadow, WithoutRootIsAnErrorOnThisMachine) {
    TestAccounts accounts;
    std::vector<std::string> steps{"shadow", "no-such-account-here", "secret"};
    if (IsRoot())
        steps.insert(steps.begin(), "drop");
    const HelperRun run = accounts.RunPlainly(steps);
    ASSERT_EQ(1u, run.lines.size());
    EXPECT_TRUE(run.lines[0] == "0 1 Operation not permitted" || run.lines[0] == "0 13 Permission denied")
        << run.lines[0];
}

TEST(oxAuthShadow, ManyChecksAtOnceDoNotMix) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("yescrypt", "x", HashOf("yescrypt", "$y$"));
    accounts.Add("sha512", "x", HashOf("sha512"));
    accounts.Add("open512", HashOf("open512"));
    std::vector<std::string> steps{"parallel", accounts.Directory().Path()};
    if (IsRoot())
        steps.insert(steps.begin(), {"groups", "1", "lower"});
    const HelperRun run = accounts.Run(steps);
    EXPECT_EQ(0, run.status);
    EXPECT_EQ(Lines{}, run.errors);
    ASSERT_EQ(2u, run.lines.size()) << "all threads have the same ids";
    if (IsRoot()) {
        EXPECT_EQ("euid=1 groups=1", run.lines[0]);
    }
    EXPECT_EQ("wrong=0 foreign=0 files", run.lines[1]);
}
