#include "users/osuserbase.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "users/support_accounts.h"

namespace {

using Lines = std::vector<std::string>;

constexpr const char* SETTINGS = "ox_remote.ini";
constexpr const char* NOWHERE = "libnowhere.so.9";

std::string Methods(const std::string& methods) {
    return "[authentication]\nmethods=" + methods + "\n";
}

std::string Refusal(const std::string& account) {
    return "User Authentication failed: " + account + "\n";
}

bool PamWasAsked(const TestAccounts& accounts) {
    return !accounts.PamCalls().empty();
}

}  // namespace

TEST(OSUserBase, TriesTheMethodsOfTheSettings) {
    SKIP_WITHOUT_ACCOUNTS();
    struct Case {
        const char* settings;  // null: no file
        bool pam;
        const char* passwd;
        const char* shadow;
    };
    const Case cases[] = {
        {nullptr, true, "1", "1"},
        {"", true, "1", "1"},
        {"[other]\nmethods=none\n", true, "1", "1"},
        {"[authentication]\nother=none\n", true, "1", "1"},
        {"[authentication]\nmethods=none\n", false, "0", "0"},
        {"[authentication]\nmethods=\n", false, "0", "0"},
        {"[authentication]\nmethods=pam\n", true, "0", "0"},
        {"[authentication]\nmethods=nopam\n", true, "0", "0"},
        {"[authentication]\nmethods=passwd\n", false, "1", "0"},
        {"[authentication]\nmethods=shadow\n", false, "0", "1"},
        {"[authentication]\nmethods=shadow passwd\n", false, "1", "1"},
        {"[authentication]\nmethods=PaM,SHADOW\n", true, "0", "1"},
        {"[Authentication]\nMethods = noshadow-nopasswd\n", false, "1", "1"},
        {"[authentication]\nmethods=pass wd\n", false, "0", "0"},
    };
    for (const Case& one : cases) {
        TestAccounts accounts;
        accounts.Add("inpasswd", HashOf("secret"));
        accounts.Add("inshadow", "x", HashOf("secret"));
        accounts.Plan("pam_authenticate=7\n");
        if (one.settings != nullptr)
            accounts.Directory().Write(SETTINGS, one.settings);
        const HelperRun run =
            accounts.Run({"library", FakePam(), NOWHERE, "base", "inpasswd", "secret", "base", "inshadow", "secret"});
        const char* const settings = one.settings != nullptr ? one.settings : "none";
        EXPECT_EQ((Lines{one.passwd, one.shadow}), run.lines) << settings;
        EXPECT_EQ(one.pam, PamWasAsked(accounts)) << settings;
        Lines errors;
        if (one.passwd == std::string("0"))
            errors.push_back(Refusal("inpasswd"));
        if (one.shadow == std::string("0"))
            errors.push_back(Refusal("inshadow"));
        EXPECT_EQ(errors, run.errors) << settings;
    }
}

TEST(OSUserBase, PamIsTriedFirst) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", HashOf("secret"), HashOf("secret"));
    accounts.Directory().Write(SETTINGS, Methods("shadow passwd pam"));
    const HelperRun run = accounts.Run({"library", FakePam(), NOWHERE, "base", "alice", "secret"});
    EXPECT_EQ((Lines{"1"}), run.lines);
    EXPECT_EQ(Lines{}, run.errors);
    EXPECT_TRUE(PamWasAsked(accounts));
}

TEST(OSUserBase, ReportsErrorsInTheOrderOfTheMethods) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.AddPasswdLine("alice:x:4001:4001:" + std::string(600, 'g') + ":/:/bin/sh");
    accounts.AddShadowLine("alice:" + std::string(9000, 'h') + ":19000:0:99999:7:::");
    accounts.Directory().Write(SETTINGS, Methods("shadow passwd pam"));
    accounts.Plan("pam_authenticate=7\n");
    const HelperRun run = accounts.Run({"library", FakePam(), NOWHERE, "base", "alice", "secret"});
    EXPECT_EQ((Lines{"0"}), run.lines);
    EXPECT_EQ((Lines{"UNIX passwd authentication failed: Numerical result out of range (rc=34)\n",
                     "Shadow password authentication failed: Numerical result out of range (rc=34)\n",
                     "User Authentication failed: alice\n"}),
              run.errors)
        << "a write each";
    EXPECT_TRUE(PamWasAsked(accounts));
}

TEST(OSUserBase, AMethodWithoutAnErrorFailsSilently) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    const HelperRun run =
        accounts.Run({"library", "/nowhere/libpam.so", NOWHERE, "base", "alice", "secret", "base", "alice", "wrong"});
    EXPECT_EQ((Lines{"1", "0"}), run.lines) << "without PAM the others are tried";
    EXPECT_EQ((Lines{Refusal("alice")}), run.errors);
}

TEST(OSUserBase, ChecksTheAccountBehindTheDomain) {
    SKIP_WITHOUT_ACCOUNTS();
    struct Case {
        std::string name;
        const char* result;
        Lines errors;
    };
    const std::vector<Case> cases = {
        {"alice", "1", {}},
        {"DOMAIN\\alice", "1", {}},
        {"DOMAIN/alice", "1", {}},
        {"\\alice", "1", {}},
        {std::string(300, 'd') + "\\alice", "1", {}},
        {"alice\\bob", "0", {Refusal("bob")}},
        {"DOMAIN\\other\\alice", "0", {Refusal("other\\alice")}},
        {"DOMAIN/other\\alice", "0", {Refusal("other\\alice")}},
        {"DOMAIN\\other/alice", "0", {Refusal("other/alice")}},
        {"DOMAIN\\", "0", {Refusal("")}},
        {"/", "0", {Refusal("")}},
        {"line\nUser Authentication failed: root", "0", {Refusal("line\\x0aUser Authentication failed: root")}},
        {std::string(64, 'n'), "0", {Refusal(std::string(64, 'n'))}},
        {"", "0", {}},
    };
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    accounts.Directory().Write(SETTINGS, Methods("shadow passwd"));
    std::vector<std::string> steps;
    Lines results;
    Lines errors;
    for (const Case& one : cases) {
        steps.insert(steps.end(), {"base", one.name, "secret"});
        results.emplace_back(one.result);
        errors.insert(errors.end(), one.errors.begin(), one.errors.end());
    }
    const HelperRun run = accounts.Run(steps);
    EXPECT_EQ(results, run.lines);
    EXPECT_EQ(errors, run.errors);
}

TEST(OSUserBase, ReadsTheSettingsForEveryCheck) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    accounts.Directory().Write("none", Methods("none"));
    accounts.Directory().Write("shadow", Methods("shadow"));
    std::filesystem::create_directory(accounts.Directory().File("unreadable"));
    accounts.Directory().Write("broken", Methods("shadow") + std::string(1, '\0'));
    const std::vector<std::string> check{"base", "alice", "secret"};
    std::vector<std::string> steps{"library", "/nowhere/libpam.so", NOWHERE};
    const auto then = [&](const std::vector<std::string>& more) {
        steps.insert(steps.end(), more.begin(), more.end());
        steps.insert(steps.end(), check.begin(), check.end());
    };
    Lines expected;
    then({"rename", "unreadable", SETTINGS});  // never read: the default
    expected.emplace_back("1");
    then({"rename", SETTINGS, "unreadable", "rename", "none", SETTINGS});
    expected.emplace_back("0");
    then({"rename", SETTINGS, "none", "rename", "unreadable", SETTINGS});  // the last value
    expected.emplace_back("0");
    then({"rename", SETTINGS, "unreadable", "rename", "broken", SETTINGS});  // a NUL byte: the last value
    expected.emplace_back("0");
    then({"rename", SETTINGS, "broken"});  // missing: the default
    expected.emplace_back("1");
    then({"rename", "unreadable", SETTINGS});  // still the last value that was read
    expected.emplace_back("0");
    then({"rename", SETTINGS, "unreadable", "rename", "shadow", SETTINGS});
    expected.emplace_back("1");
    EXPECT_EQ(expected, accounts.Run(steps).lines);
}

TEST(OSUserBase, SettingsWithoutPermissionLeaveTheMethods) {
    SKIP_UNLESS_ROOT();
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    accounts.Directory().Write(SETTINGS, Methods("none"));
    std::filesystem::permissions(accounts.Directory().Write("private", Methods("shadow")),
                                 std::filesystem::perms::owner_read);
    const HelperRun run =
        accounts.Run({"lower", "base", "alice", "secret", "rename", "private", SETTINGS, "base", "alice", "secret"});
    EXPECT_EQ((Lines{"0", "0"}), run.lines);
}

TEST(OSUserBase, NamesAndPasswordsWithNulAreNotCheckedCut) {
    OSUserBase base;
    testing::internal::CaptureStderr();
    EXPECT_FALSE(base.Authenticate(std::string("root\0x", 6), "x", nullptr));
    EXPECT_FALSE(base.Authenticate(std::string("\0", 1), "x", nullptr));
    EXPECT_FALSE(base.Authenticate("no-such-account-here", std::string("secret\0x", 8), nullptr));
    EXPECT_EQ(Refusal("root\\x00x") + Refusal("\\x00") + Refusal("no-such-account-here"),
              testing::internal::GetCapturedStderr());
}

TEST(OSUserBase, AnEmptyNameFailsWithoutAWord) {
    OSUserBase base;
    testing::internal::CaptureStderr();
    EXPECT_FALSE(base.Authenticate("", "", nullptr));
    EXPECT_EQ("", testing::internal::GetCapturedStderr());
}

TEST(OSUserBase, AdministersNothing) {
    OSUserBase base;
    char text[32] = "as it was";
    testing::internal::CaptureStderr();
    EXPECT_FALSE(base.AddUser("root", "x", 1, "1", "x"));
    EXPECT_FALSE(base.DeleteUser("root"));
    EXPECT_FALSE(base.SetPermissions("root", 1));
    EXPECT_FALSE(base.SetPassword("root", "x"));
    EXPECT_FALSE(base.SetText1("root", "x"));
    EXPECT_FALSE(base.SetText2("root", "x"));
    EXPECT_FALSE(base.GetPermissionsText("root", text, sizeof text));
    EXPECT_STREQ("as it was", text);
    EXPECT_EQ("", testing::internal::GetCapturedStderr());
}
