#include "users/authpam.h"

#include <gtest/gtest.h>
#include <security/pam_appl.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "users/support_accounts.h"

namespace {

using Lines = std::vector<std::string>;

constexpr const char* PASSED = "1 0 ok";
constexpr const char* NOWHERE = "libnowhere.so.9";

Lines WithFake(TestAccounts& accounts, std::vector<std::string> steps, const std::string& without = "") {
    steps.insert(steps.begin(), {"library", FakePam(without), NOWHERE});
    const HelperRun run = accounts.RunPlainly(steps);
    EXPECT_EQ(0, run.status);
    EXPECT_EQ(Lines{}, run.errors);
    return run.lines;
}

// A record of the fake library without the user that it ran as.
Lines Calls(const TestAccounts& accounts) {
    Lines calls = accounts.PamCalls();
    for (std::string& call : calls)
        call.resize(std::min(call.size(), call.find(" euid=")));
    return calls;
}

std::vector<std::string> CheckAmongThreads(bool lowered) {
    std::vector<std::string> steps{"groups", "1"};
    if (lowered)
        steps.emplace_back("lower");
    steps.insert(steps.end(), {"threads", "2", "pam", "alice", "secret", "ids"});
    return steps;
}

int Converse(const std::vector<int>& styles, pam_response** answers) {
    std::vector<pam_message> messages;
    for (const int style : styles)
        messages.push_back({style, "?"});
    std::vector<const pam_message*> pointers;
    for (const pam_message& message : messages)
        pointers.push_back(&message);
    return oxAuthPAM::Conversation(static_cast<int>(styles.size()), pointers.data(), answers, nullptr);
}

}  // namespace

TEST(oxAuthPAM, AsksInOrderWithTheLoginService) {
    TestAccounts accounts;
    EXPECT_EQ((Lines{PASSED}), WithFake(accounts, {"pam", "alice", "secret"}));
    EXPECT_EQ((Lines{"pam_start login alice", "pam_authenticate 1", "pam_acct_mgmt 1", "pam_setcred 2", "pam_end 0"}),
              Calls(accounts));
}

TEST(oxAuthPAM, AnswersByTheStyleOfTheMessage) {
    struct Case {
        const char* styles;
        const char* conversation;
        const char* outcome;
    };
    const Case cases[] = {
        {"1", "conversation 0: [secret]/0", PASSED},
        {"2", "conversation 0: [alice]/0", PASSED},
        {"3", "conversation 0: null/0", PASSED},
        {"4", "conversation 0: null/0", PASSED},
        {"1,2,3,4,2,1", "conversation 0: [secret]/0 [alice]/0 null/0 null/0 [alice]/0 [secret]/0", PASSED},
        {"5", "conversation 19: none", "0 19 fake error 19"},
        {"0", "conversation 19: none", "0 19 fake error 19"},
        {"-1", "conversation 19: none", "0 19 fake error 19"},
        {"1,2,5", "conversation 19: none", "0 19 fake error 19"},
        {"7,1", "conversation 19: none", "0 19 fake error 19"},
    };
    for (const Case& one : cases) {
        TestAccounts accounts;
        accounts.Plan(std::string("ask=") + one.styles + "\n");
        EXPECT_EQ((Lines{one.outcome}), WithFake(accounts, {"pam", "alice", "secret"})) << one.styles;
        const Lines calls = Calls(accounts);
        ASSERT_LE(3u, calls.size());
        EXPECT_EQ(one.conversation, calls[2]) << one.styles;
        EXPECT_EQ("pam_end 0", calls.back());
    }
}

TEST(oxAuthPAM, TheFirstFailureEndsTheCheck) {
    struct Case {
        const char* plan;
        const char* outcome;
        Lines calls;
    };
    const Case cases[] = {
        {"pam_start=26\nhandle=null\n", "0 26 fake error 26", {"pam_start login alice"}},
        {"pam_start=4\n", "0 4 fake error 4", {"pam_start login alice", "pam_end 0"}},
        {"pam_authenticate=7\n", "0 7 fake error 7", {"pam_start login alice", "pam_authenticate 1", "pam_end 0"}},
        {"pam_acct_mgmt=13\n",
         "0 13 fake error 13",
         {"pam_start login alice", "pam_authenticate 1", "pam_acct_mgmt 1", "pam_end 0"}},
        {"pam_setcred=17\n",
         "0 17 fake error 17",
         {"pam_start login alice", "pam_authenticate 1", "pam_acct_mgmt 1", "pam_setcred 2", "pam_end 0"}},
    };
    for (const Case& one : cases) {
        TestAccounts accounts;
        accounts.Plan(one.plan);
        EXPECT_EQ((Lines{one.outcome}), WithFake(accounts, {"pam", "alice", "secret"})) << one.plan;
        EXPECT_EQ(one.calls, Calls(accounts)) << one.plan;
    }
}

TEST(oxAuthPAM, ChecksNothingThatWasCut) {
    TestAccounts accounts;
    EXPECT_EQ((Lines{"0 0 ok", "0 0 ok", PASSED}),
              WithFake(accounts, {"pam", std::string(64, 'n'), "secret",  //
                                  "pam", "alice", std::string(64, 'p'),   //
                                  "pam", std::string(63, 'n'), std::string(63, 'p')}));
    EXPECT_EQ("pam_start login " + std::string(63, 'n'), Calls(accounts).at(0));
}

TEST(oxAuthPAM, ChecksAgainWithStoredTexts) {
    TestAccounts accounts;
    accounts.Plan("ask=1,2\n");
    WithFake(accounts, {"again", "pam", "alice", "secret"});
    Lines conversations;
    for (const std::string& call : Calls(accounts))
        if (call.starts_with("conversation"))
            conversations.push_back(call);
    EXPECT_EQ((Lines{"conversation 0: [secret]/0 [alice]/0", "conversation 0: [secret]/0 [alice]/0",
                     "conversation 0: [wrong]/0 [alice]/0", "conversation 0: [wrong]/0 [alice]/0",
                     "conversation 0: [secret]/0 [alice]/0", "conversation 0: [secret]/0 [nobody-of-that-name]/0"}),
              conversations);
}

TEST(oxAuthPAM, WithoutAFunctionThereIsNoCheck) {
    for (const char* function : {"pam_start", "pam_authenticate", "pam_acct_mgmt", "pam_setcred", "pam_end"}) {
        TestAccounts accounts;
        EXPECT_EQ((Lines{"0 38 Function not implemented"}), WithFake(accounts, {"pam", "alice", "secret"}, function))
            << function;
        EXPECT_EQ(Lines{}, accounts.PamCalls()) << function;
    }
}

TEST(oxAuthPAM, ErrorTextsAreOptional) {
    TestAccounts accounts;
    accounts.Plan("pam_authenticate=7\n");
    EXPECT_EQ((Lines{"0 7 Undefined PAM error"}), WithFake(accounts, {"pam", "alice", "secret"}, "pam_strerror"));
    accounts.Plan("");
    EXPECT_EQ((Lines{PASSED}), WithFake(accounts, {"pam", "alice", "secret"}, "pam_strerror"));
}

TEST(oxAuthPAM, ALibraryThatDoesNotLoadIsTheSystemsError) {
    TestAccounts accounts;
    EXPECT_EQ((Lines{"0 2 No such file or directory"}),
              accounts.RunPlainly({"library", "/nowhere/libpam.so", NOWHERE, "pam", "alice", "secret"}).lines);
    const std::string text = accounts.Directory().Write("text.so", "This is no library, whatever its name says.\n");
    EXPECT_EQ((Lines{"0 2 No such file or directory"}),
              accounts.RunPlainly({"library", text, FakePam(), "pam", "alice", "secret"}).lines)
        << "one that is there counts, and the loader gives no reason for this";
    EXPECT_EQ(Lines{}, accounts.PamCalls());
}

TEST(oxAuthPAM, TheSonameServesWhereThereIsNoFile) {
    TestAccounts accounts;
    EXPECT_EQ((Lines{PASSED}),
              accounts.RunPlainly({"library", "/nowhere/libpam.so", FakePam(), "pam", "alice", "secret"}).lines);
}

TEST(oxAuthPAM, OnlyAFailedLoadIsTriedAgain) {
    TestAccounts accounts;
    std::filesystem::copy_file(FakePam(), accounts.Directory().File("later.so"));
    const std::string path = accounts.Directory().File("libpam.so");
    const HelperRun run = accounts.RunPlainly({"library",   path,
                                               NOWHERE,  //
                                               "pam",       "alice",
                                               "secret",  //
                                               "library",   FakePam("pam_end"),
                                               NOWHERE,  //
                                               "pam",       "alice",
                                               "secret",  //
                                               "library",   path,
                                               NOWHERE,  //
                                               "rename",    "later.so",
                                               "libpam.so",  //
                                               "pam",       "alice",
                                               "secret",  //
                                               "rename",    "libpam.so",
                                               "gone.so",  //
                                               "library",   "/nowhere/libpam.so",
                                               NOWHERE,  //
                                               "pam",       "alice",
                                               "secret"});
    EXPECT_EQ((Lines{"0 2 No such file or directory", "0 38 Function not implemented", PASSED, PASSED}), run.lines);
}

TEST(oxAuthPAM, OneCheckAtATime) {
    TestAccounts accounts;
    const std::string release = accounts.Directory().File("release");
    accounts.Plan("ask=2,1\nwait=" + release + "\n");
    EXPECT_EQ((Lines{PASSED, PASSED, "waited"}), WithFake(accounts, {"two", release}));
    EXPECT_EQ((Lines{"pam_start login first", "pam_authenticate 1", "conversation 0: [first]/0 [secret1]/0",
                     "pam_acct_mgmt 1", "pam_setcred 2", "pam_end 0",  //
                     "pam_start login second", "pam_authenticate 1", "conversation 0: [second]/0 [secret2]/0",
                     "pam_acct_mgmt 1", "pam_setcred 2", "pam_end 0"}),
              Calls(accounts));
}

TEST(oxAuthPAM, RaisesToRootAndRestores) {
    SKIP_UNLESS_ROOT();
    TestAccounts accounts;
    EXPECT_EQ((Lines{PASSED, "euid=1 groups=1"}),
              WithFake(accounts, {"groups", "1", "lower", "threads", "2", "pam", "alice", "secret", "ids"}));
    EXPECT_EQ((Lines{"pam_start login alice euid=0", "pam_authenticate 1 euid=0", "pam_acct_mgmt 1 euid=0",
                     "pam_setcred 2 euid=0", "pam_end 0 euid=0"}),
              accounts.PamCalls());
}

TEST(oxAuthPAM, WithoutRootPamIsAskedAllTheSame) {
    SKIP_UNLESS_ROOT();
    TestAccounts accounts;
    EXPECT_EQ((Lines{PASSED}), WithFake(accounts, {"drop", "pam", "alice", "secret"}));
    EXPECT_EQ("pam_start login alice euid=1", accounts.PamCalls().at(0));
}

// Whatever user the other threads have: the C library ends a process whose threads get different answers.
TEST(oxAuthPAM, ModulesThatChangeGroupsChangeNothing) {
    SKIP_UNLESS_ROOT();
    for (const char* call : {"set", "init"}) {
        for (const bool lowered : {false, true}) {
            TestAccounts accounts;
            accounts.Plan(std::string("groups=") + call + "\n");
            EXPECT_EQ((Lines{PASSED, lowered ? "euid=1 groups=1" : "euid=0 groups=1"}),
                      WithFake(accounts, CheckAmongThreads(lowered)));
            EXPECT_EQ(std::string(call) + "groups 0", Calls(accounts).at(4)) << "the module's own call worked";
        }
    }
}

TEST(oxAuthPAM, ConversationOutsideACheckHasNoTexts) {
    pam_response* answers = nullptr;
    ASSERT_EQ(0, Converse({1, 2, 3, 4}, &answers));
    ASSERT_NE(nullptr, answers);
    for (int i = 0; i < 4; ++i) {
        EXPECT_EQ(nullptr, answers[i].resp) << i;
        EXPECT_EQ(0, answers[i].resp_retcode) << i;
    }
    std::free(answers);
}

TEST(oxAuthPAM, ConversationRefusesWhatItDoesNotKnow) {
    for (const std::vector<int>& styles : {std::vector<int>{5}, {0}, {-3}, {1, 2, 6}, {}}) {
        pam_response unset{};
        pam_response* answers = &unset;
        EXPECT_EQ(19, Converse(styles, &answers));
        EXPECT_EQ(nullptr, answers);
    }
}

TEST(oxAuthPAM, WithTheSystemsLibrary) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    accounts.Add("modern", "x", HashOf("secret", "$y$"));
    accounts.Add("expired", "x", HashOf("secret"), true);
    accounts.Add("locked", "x", "!" + HashOf("secret"));
    accounts.Add("nothing", "x", "");
    const HelperRun run = accounts.Run({"pam", "alice",   "secret", "pam", "alice",  "wrong",  "pam", "alice", "",  //
                                        "pam", "modern",  "secret", "pam", "modern", "wrong",                       //
                                        "pam", "expired", "secret", "pam", "locked", "secret",                      //
                                        "pam", "nothing", "",       "pam", "alice",  "secret"});
    EXPECT_EQ(0, run.status);
    EXPECT_EQ(Lines{}, run.errors);
    EXPECT_EQ(
        (Lines{PASSED, "0 7 Authentication failure", "0 7 Authentication failure", PASSED, "0 7 Authentication failure",
               "0 13 User account has expired", "0 7 Authentication failure", "0 7 Authentication failure", PASSED}),
        run.lines);
    const HelperRun unknown = accounts.Run({"pam", "nobody-of-that-name", "secret", "pam", "", ""});
    ASSERT_EQ(2u, unknown.lines.size());
    for (const std::string& line : unknown.lines)
        EXPECT_TRUE(line.starts_with("0 ") && !line.starts_with("0 0 ")) << line;
}

TEST(oxAuthPAM, TheSystemsGroupModuleChangesNothing) {
    SKIP_UNLESS_ROOT();
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    for (const bool lowered : {false, true}) {
        const HelperRun run = accounts.Run(CheckAmongThreads(lowered));
        EXPECT_EQ(0, run.status);
        EXPECT_EQ((Lines{PASSED, lowered ? "euid=1 groups=1" : "euid=0 groups=1"}), run.lines);
    }
}

TEST(oxAuthPAM, APlantedLibraryComesFirst) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.Add("alice", "x", HashOf("secret"));
    accounts.PlantPam(FakePam());
    const HelperRun run = accounts.Run({"pam", "alice", "wrong"});
    if (run.status == TestAccounts::NO_OVERLAY)
        GTEST_SKIP() << "the kernel has no overlays to plant the library with";
    EXPECT_EQ((Lines{PASSED}), run.lines);
    EXPECT_EQ("pam_start login alice", Calls(accounts).at(0));
}

TEST(oxAuthPAM, WithoutAnyLibraryIsTheSystemsError) {
    SKIP_WITHOUT_ACCOUNTS();
    TestAccounts accounts;
    accounts.ReplacePam("/dev/null");
    const HelperRun run = accounts.Run({"pam", "alice", "secret"});
    ASSERT_EQ(1u, run.lines.size());
    EXPECT_TRUE(run.lines[0].starts_with("0 ") && !run.lines[0].starts_with("0 0 ")) << run.lines[0];
}
