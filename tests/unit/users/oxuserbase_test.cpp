#include "users/oxuserbase.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <functional>
#include <string>
#include <vector>

#include "userbasefixture.h"

using namespace std::string_literals;

namespace {

using List = std::vector<std::string>;

class oxUserBaseOperations : public UserBaseTest {};

}  // namespace

TEST_F(oxUserBaseOperations, TheNamesOfTheKeys) {
    EXPECT_STREQ("*.usr", oxUserBase::m_pszUSER_FILE_MASK);
    EXPECT_STREQ("UserInfo", oxUserBase::m_pszINI_SECTION_USER_INFO);
    EXPECT_STREQ("username", oxUserBase::m_pszINI_KEY_USERNAME);
    EXPECT_STREQ("password", oxUserBase::m_pszINI_KEY_PASSWORD);
    EXPECT_STREQ("PlaintextPassword", oxUserBase::m_pszINI_KEY_PLAINTEXT_PASSWORD);
    EXPECT_STREQ("permissions", oxUserBase::m_pszINI_KEY_PERMISSIONS);
    EXPECT_STREQ("logfileurl", oxUserBase::m_pszINI_KEY_LOGFILEURL);
    EXPECT_STREQ("User%u", oxUserBase::m_pszINI_KEY_USER_N);
    EXPECT_STREQ("maxprofiles", oxUserBase::m_pszINI_KEY_MAXPROFILES);
    EXPECT_STREQ("u", oxUserBase::m_pszTOKEN_KEY_USERNAME);
    EXPECT_STREQ("p", oxUserBase::m_pszTOKEN_KEY_PERMISSIONS);
}

TEST_F(oxUserBaseOperations, WhoIsLetIn) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret") + "\npermissions=3");
    WriteUser("open.usr", "open", "permissions=5");
    WriteUser("empty.usr", "empty", "password=\npermissions=6");
    WriteUser("sealedempty.usr", "sealedempty", "password=" + Sealed("") + "\npermissions=7");
    oxUserBase users(Directory());
    struct Case {
        const char* name;
        const char* password;
        bool good;
        std::uint32_t permissions;
    };
    constexpr std::uint32_t UNTOUCHED = 99;
    constexpr Case CASES[] = {
        {"alice", "secret", true, 3},
        {"alice", "Secret", false, UNTOUCHED},
        {"alice", "secre", false, UNTOUCHED},
        {"alice", "secret ", false, UNTOUCHED},
        {"alice", "", false, UNTOUCHED},
        {"Alice", "secret", false, UNTOUCHED},
        {"alice ", "secret", false, UNTOUCHED},
        {"", "", false, UNTOUCHED},
        {"", "secret", false, UNTOUCHED},
        {"bob", "secret", false, UNTOUCHED},
        {"open", "", true, 5},
        {"open", "anything", true, 5},
        {"empty", "", true, 6},
        {"empty", "anything", true, 6},
        {"sealedempty", "", true, 7},
        {"sealedempty", "anything", true, 7},
    };
    for (const Case& c : CASES) {
        std::uint32_t permissions = UNTOUCHED;
        EXPECT_EQ(c.good, users.Authenticate(c.name, c.password, &permissions)) << c.name << ":" << c.password;
        EXPECT_EQ(c.permissions, permissions) << c.name << ":" << c.password;
        EXPECT_EQ(c.good, users.Authenticate(c.name, c.password, nullptr)) << c.name << ":" << c.password;
    }
}

TEST_F(oxUserBaseOperations, AnAddedUserIsThereAtOnceAndAfterANewStart) {
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 3, "7", "/logs/a.log"));
    EXPECT_EQ(List{"alice.usr"}, Files());
    EXPECT_EQ("alice", KeyOf("alice.usr", "username"));
    EXPECT_EQ("secret", PasswordIn("alice.usr"));
    EXPECT_EQ("3", KeyOf("alice.usr", "permissions"));
    EXPECT_EQ("7", KeyOf("alice.usr", "maxprofiles"));
    EXPECT_EQ("/logs/a.log", KeyOf("alice.usr", "logfileurl"));
    EXPECT_EQ("-", KeyOf("alice.usr", "PlaintextPassword"));
    struct stat status {};
    ASSERT_EQ(0, stat(PathOf("alice.usr").c_str(), &status));
    EXPECT_EQ(0600u, status.st_mode & 07777);

    ASSERT_TRUE(users.AddUser("bob", "", 0, "", ""));
    EXPECT_EQ("-", KeyOf("bob.usr", "maxprofiles")) << "an empty text has no key";
    EXPECT_EQ("-", KeyOf("bob.usr", "logfileurl"));
    oxUserBase later(Directory());
    for (oxUserBase* const base : {&users, &later}) {
        std::uint32_t permissions = 0;
        EXPECT_TRUE(base->Authenticate("alice", "secret", &permissions));
        EXPECT_EQ(3u, permissions);
        EXPECT_TRUE(base->Authenticate("bob", "anything", &permissions));
        EXPECT_EQ(0u, permissions);
        EXPECT_EQ("u1=alice&p1=3&u2=bob&p2=0", ListOf(*base));
    }
}

TEST_F(oxUserBaseOperations, WhomAddUserTakes) {
    struct Case {
        std::string name;
        bool taken;
        const char* file;
    };
    const Case cases[] = {
        {"alice", true, "alice.usr"},
        {"a", true, "a.usr"},
        {"bob smith", true, "bob%20smith.usr"},
        {"domain\\bob", true, "domain%5Cbob.usr"},
        {"../../evil", true, "%2E.%2F..%2Fevil.usr"},
        {"a/b", true, "a%2Fb.usr"},
        {".", true, "%2E.usr"},
        {"a@b.c", true, "a@b.c.usr"},
        {"100%", true, "100%25.usr"},
        {"a+b", true, "a%2Bb.usr"},
        {"a;b#c", true, "a%3Bb%23c.usr"},
        {"[x]", true, "%5Bx%5D.usr"},
        {"\xC3\xA9", true, "%C3%A9.usr"},
        {"anonymous", true, "anonymous.usr"},
        {std::string(255, 'n'), true, nullptr},
        {"", false, nullptr},
        {std::string(256, 'n'), false, nullptr},
        {"a:b", false, nullptr},
        {"a&b", false, nullptr},
        {"a=b", false, nullptr},
        {" alice", false, nullptr},
        {"alice ", false, nullptr},
        {" ", false, nullptr},
        {"\talice", false, nullptr},
        {"alice\t", false, nullptr},
        {"a\nb", false, nullptr},
        {"a\rb", false, nullptr},
        {"a\x01"s + "b", false, nullptr},
        {"a\x7F"s + "b", false, nullptr},
        {"a\0b"s, false, nullptr},
    };
    for (const Case& c : cases) {
        oxUserBase users(Directory());
        EXPECT_EQ(c.taken, users.AddUser(c.name, "secret", 1, "", "")) << c.name;
        EXPECT_EQ(c.taken, users.Authenticate(c.name, "secret", nullptr)) << c.name;
        EXPECT_EQ(c.taken, users.FindUser(c.name, nullptr)) << c.name;
        EXPECT_EQ(c.taken ? 1u : 0u, Files().size()) << c.name;
        if (c.file != nullptr) {
            EXPECT_EQ(List{c.file}, Files());
        }
        oxUserBase later(Directory());
        EXPECT_EQ(c.taken, later.Authenticate(c.name, "secret", nullptr)) << c.name;
        EXPECT_EQ(c.taken, later.DeleteUser(c.name)) << c.name;
        EXPECT_EQ(List{}, Files()) << c.name;
    }
    const std::filesystem::directory_iterator files(m_scratch.Path());
    EXPECT_EQ(2, std::distance(begin(files), end(files))) << "the users directory and the key, nothing outside";
}

TEST_F(oxUserBaseOperations, TheLimitsOfTheFields) {
    struct Case {
        std::string password;
        std::string maxProfiles;
        std::string logFileUrl;
        bool taken;
    };
    const Case cases[] = {
        {std::string(351, 'p'), "", "", true},
        {std::string(352, 'p'), "", "", false},
        {"", std::string(4095, '1'), "", true},
        {"", std::string(4096, '1'), "", false},
        {"", "", std::string(4095, 'u'), true},
        {"", "", std::string(4096, 'u'), false},
        {"", "1\n2", "", false},
        {"", "1\x1F"s, "", false},
        {"", "", "a\r", false},
        {"", "", "a\0b"s, false},
        {"", "", "a\x7F"s, false},
        {"p\n&=:\x01"s, "", "", true},
        {" ", "7", "http://h/?a=b&c=d e", true},
    };
    for (const Case& c : cases) {
        oxUserBase users(Directory());
        EXPECT_EQ(c.taken, users.AddUser("alice", c.password, 0, c.maxProfiles, c.logFileUrl));
        EXPECT_EQ(c.taken ? List{"alice.usr"} : List{}, Files());
        users.DeleteUser("alice");

        ASSERT_TRUE(users.AddUser("bob", "before", 0, "", ""));
        EXPECT_EQ(c.taken, users.SetPassword("bob", c.password) && users.SetText2("bob", c.maxProfiles) &&
                               users.SetText1("bob", c.logFileUrl));
        oxUserBase later(Directory());
        for (oxUserBase* const base : {&users, &later})
            EXPECT_TRUE(base->Authenticate("bob", c.password.size() <= 351 ? c.password : "before", nullptr));
        if (c.taken) {
            EXPECT_EQ(c.maxProfiles.empty() ? "-" : c.maxProfiles, KeyOf("bob.usr", "maxprofiles"));
            EXPECT_EQ(c.logFileUrl.empty() ? "-" : c.logFileUrl, KeyOf("bob.usr", "logfileurl"));
        }
        ASSERT_TRUE(users.DeleteUser("bob"));
    }
}

TEST_F(oxUserBaseOperations, ATakenNameIsRefusedAndKeepsItsUser) {
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 3, "", ""));
    const auto before = Texts();
    EXPECT_FALSE(users.AddUser("alice", "other", 1, "", ""));
    oxUserBase another(Directory());
    EXPECT_FALSE(another.AddUser("alice", "other", 1, "", ""));
    EXPECT_EQ(before, Texts());
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    EXPECT_TRUE(users.AddUser("Alice", "other", 1, "", "")) << "names are compared exactly";
    WriteUser("by-hand.usr", "carol");
    EXPECT_FALSE(users.AddUser("carol", "x", 1, "", "")) << "written by hand since the last look";
}

TEST_F(oxUserBaseOperations, AFileOfAnotherUserKeepsItsName) {
    WriteUser("bob.usr", "carol", "password=" + Sealed("carols"));
    WriteUser("joe-smith.usr", "joe", "password=" + Sealed("joes"));
    Write("dave.usr", "no user at all");
    oxUserBase users(Directory());
    EXPECT_TRUE(users.AddUser("bob", "bobs", 1, "", ""));
    EXPECT_TRUE(users.AddUser("dave", "daves", 1, "", ""));
    EXPECT_TRUE(users.SetPermissions("joe", 4));
    EXPECT_TRUE(users.SetPermissions("carol", 5));
    EXPECT_EQ((List{"bob-1.usr", "bob.usr", "dave-1.usr", "dave.usr", "joe-smith.usr"}), Files());
    EXPECT_EQ("no user at all", TextOf("dave.usr"));
    EXPECT_EQ("4", KeyOf("joe-smith.usr", "permissions"));
    oxUserBase later(Directory());
    for (oxUserBase* const base : {&users, &later}) {
        EXPECT_TRUE(base->Authenticate("bob", "bobs", nullptr));
        EXPECT_TRUE(base->Authenticate("carol", "carols", nullptr));
        EXPECT_TRUE(base->Authenticate("dave", "daves", nullptr));
        EXPECT_TRUE(base->Authenticate("joe", "joes", nullptr));
    }
    EXPECT_TRUE(users.DeleteUser("bob"));
    EXPECT_EQ((List{"bob.usr", "dave-1.usr", "dave.usr", "joe-smith.usr"}), Files());
}

TEST_F(oxUserBaseOperations, EachChangeIsInTheFileAndInMemory) {
    struct Case {
        const char* what;
        std::function<bool(oxUserBase&, const char*)> change;
        const char* key;
        const char* value;
    };
    const Case cases[] = {
        {"permissions", [](oxUserBase& u, const char* n) { return u.SetPermissions(n, 17); }, "permissions", "17"},
        {"all permissions", [](oxUserBase& u, const char* n) { return u.SetPermissions(n, 0xFFFFFFFFu); },
         "permissions", "-1"},
        {"text 1", [](oxUserBase& u, const char* n) { return u.SetText1(n, "/x"); }, "logfileurl", "/x"},
        {"text 1 with blanks", [](oxUserBase& u, const char* n) { return u.SetText1(n, " /x y "); }, "logfileurl",
         "/x y"},
        {"no text 1", [](oxUserBase& u, const char* n) { return u.SetText1(n, ""); }, "logfileurl", "-"},
        {"blank text 1", [](oxUserBase& u, const char* n) { return u.SetText1(n, "  "); }, "logfileurl", "-"},
        {"text 2", [](oxUserBase& u, const char* n) { return u.SetText2(n, "12"); }, "maxprofiles", "12"},
        {"no text 2", [](oxUserBase& u, const char* n) { return u.SetText2(n, ""); }, "maxprofiles", "-"},
        {"saving", [](oxUserBase& u, const char* n) { return u.SaveUser(n); }, "permissions", "3"},
    };
    for (const Case& c : cases) {
        Write("alice.usr", "; by hand\n[UserInfo]\nusername=alice\nemail=a@b\npassword=" + Sealed("secret") +
                               "\npermissions=3\nlogfileurl=/old\nmaxprofiles=1\n[Other]\nkey=value\n");
        WriteUser("bob.usr", "bob", "password=" + Sealed("bobs"));
        const std::string bob = TextOf("bob.usr");
        oxUserBase users(Directory());
        EXPECT_TRUE(c.change(users, "alice")) << c.what;
        EXPECT_FALSE(c.change(users, "nobody")) << c.what;
        EXPECT_FALSE(c.change(users, "")) << c.what;
        EXPECT_EQ((List{"alice.usr", "bob.usr"}), Files()) << c.what;
        EXPECT_EQ(bob, TextOf("bob.usr")) << c.what;
        EXPECT_EQ(c.value, KeyOf("alice.usr", c.key)) << c.what;
        EXPECT_EQ("secret", PasswordIn("alice.usr")) << c.what;
        EXPECT_EQ("value", KeyOf("alice.usr", "key", "Other")) << c.what;
        EXPECT_EQ("a@b", KeyOf("alice.usr", "email")) << c.what;
        EXPECT_EQ(0u, TextOf("alice.usr").find("; by hand\n")) << c.what;
        struct stat status {};
        ASSERT_EQ(0, stat(PathOf("alice.usr").c_str(), &status));
        EXPECT_EQ(0600u, status.st_mode & 07777) << c.what;
    }
}

TEST_F(oxUserBaseOperations, ANewPasswordReplacesTheOldOne) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("old") + "\npermissions=3");
    oxUserBase users(Directory());
    for (const std::string& password : {"new"s, "&=+%:"s, std::string(351, 'x'), "old"s}) {
        ASSERT_TRUE(users.SetPassword("alice", password));
        EXPECT_EQ(password, PasswordIn("alice.usr"));
        EXPECT_TRUE(users.Authenticate("alice", password, nullptr));
        EXPECT_FALSE(users.Authenticate("alice", "wrong", nullptr));
        EXPECT_TRUE(oxUserBase(Directory()).Authenticate("alice", password, nullptr));
    }
    EXPECT_FALSE(users.SetPassword("nobody", "x"));
    EXPECT_FALSE(users.SetPassword("alice", std::string(352, 'x')));
    EXPECT_TRUE(users.Authenticate("alice", "old", nullptr));
    ASSERT_TRUE(users.SetPassword("alice", ""));
    EXPECT_TRUE(users.Authenticate("alice", "anything", nullptr)) << "the empty password opens, on purpose";
}

TEST_F(oxUserBaseOperations, ADeletedUserIsGoneWithEveryFileOfTheName) {
    WriteUser("alice.usr", "alice", "permissions=1");
    WriteUser("z-alice.usr", "alice", "permissions=2");
    WriteUser("damaged.usr", "alice", "password=damaged");
    WriteUser("Alice.usr", "Alice", "permissions=4");
    WriteUser("bob.usr", "bob", "permissions=8");
    oxUserBase users;
    StandardErrorOf([&] { users.Open(Directory()); });
    EXPECT_EQ("u1=Alice&p1=4&u2=alice&p2=1&u3=bob&p3=8", ListOf(users));
    EXPECT_TRUE(users.DeleteUser("alice"));
    EXPECT_EQ((List{"Alice.usr", "bob.usr"}), Files());
    EXPECT_FALSE(users.Authenticate("alice", "", nullptr));
    EXPECT_FALSE(users.DeleteUser("alice"));
    EXPECT_FALSE(users.DeleteUser(""));
    EXPECT_FALSE(users.DeleteUser("nobody"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_EQ("u1=Alice&p1=4&u2=bob&p2=8", ListOf(users));
    EXPECT_EQ("u1=Alice&p1=4&u2=bob&p2=8", ListOf(*std::make_unique<oxUserBase>(Directory())));
}

TEST_F(oxUserBaseOperations, AnonymousIsATakenNameOnlyWhereItIsAllowed) {
    class Strict : public oxUserBase {
    public:
        using oxUserBase::oxUserBase;
        bool AllowsAnonymousUser() override { return false; }
    };
    Strict strict(Directory());
    EXPECT_FALSE(strict.AddUser("anonymous", "", 0, "", ""));
    EXPECT_TRUE(strict.AddUser("Anonymous", "", 0, "", ""));
    oxUserBase users(Directory());
    EXPECT_TRUE(users.AllowsAnonymousUser());
    EXPECT_TRUE(users.AddUser("anonymous", "", 0, "", ""));
}

TEST_F(oxUserBaseOperations, FindsUsersWithoutAPassword) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret") + "\npermissions=-1");
    oxUserBase users(Directory());
    std::uint32_t permissions = 5;
    EXPECT_TRUE(users.FindUser("alice", &permissions));
    EXPECT_EQ(0xFFFFFFFFu, permissions);
    EXPECT_TRUE(users.FindUser("alice", nullptr));
    permissions = 5;
    EXPECT_FALSE(users.FindUser("bob", &permissions));
    EXPECT_FALSE(users.FindUser("", &permissions));
    EXPECT_EQ(5u, permissions);
}

TEST_F(oxUserBaseOperations, AppendsThePermissionsText) {
    struct Case {
        const char* permissions;
        const char* before;
        const char* after;
    };
    constexpr Case CASES[] = {
        {"0", "", "permissions=0"},
        {"3", "", "permissions=3"},
        {"-1", "", "permissions=-1"},
        {"3", "username=alice", "username=alice&permissions=3"},
    };
    for (const Case& c : CASES) {
        WriteUser("alice.usr", "alice", "permissions="s + c.permissions);
        oxUserBase users(Directory());
        const std::size_t exact = std::string(c.after).size() + 1;
        for (const std::size_t size : {exact, std::size_t{1000}}) {
            std::string buffer(c.before);
            buffer.resize(1001, '\0');
            EXPECT_TRUE(users.GetPermissionsText("alice", buffer.data(), size));
            EXPECT_STREQ(c.after, buffer.c_str());
            EXPECT_FALSE(users.GetPermissionsText("nobody", buffer.data(), size));
            EXPECT_STREQ(c.after, buffer.c_str());
        }
        std::string buffer(c.before);
        buffer.resize(exact - 1, '\0');
        EXPECT_FALSE(users.GetPermissionsText("alice", buffer.data(), exact - 1)) << "no room for it";
        EXPECT_STREQ(c.before, buffer.c_str());
    }
}

TEST_F(oxUserBaseOperations, ListsUsersInTheOrderOfTheirNames) {
    oxUserBase users(Directory());
    EXPECT_EQ("", ListOf(users));
    WriteUser("1.usr", "bob", "permissions=1");
    WriteUser("2.usr", "alice", "permissions=3");
    WriteUser("3.usr", "Zoe", "permissions=-1");
    ASSERT_TRUE(users.LoadAll());
    EXPECT_EQ("u1=Zoe&p1=-1&u2=alice&p2=3&u3=bob&p3=1", ListOf(users));
}

TEST_F(oxUserBaseOperations, TheListStopsWhenNoMoreThan99BytesAreLeft) {
    for (const char* name : {"a", "b", "c"})
        WriteUser(name + ".usr"s, name, "permissions=1");
    oxUserBase users(Directory());
    struct Case {
        std::size_t size;
        const char* list;
    };
    constexpr std::size_t PAIR = 9;  // "u1=a&p1=1", and one more for each later "&"
    constexpr Case CASES[] = {
        {1, ""},
        {50, ""},
        {99, ""},
        {100, "u1=a&p1=1"},
        {99 + PAIR, "u1=a&p1=1"},
        {100 + PAIR, "u1=a&p1=1&u2=b&p2=1"},
        {99 + 2 * PAIR + 1, "u1=a&p1=1&u2=b&p2=1"},
        {100 + 2 * PAIR + 1, "u1=a&p1=1&u2=b&p2=1&u3=c&p3=1"},
        {1000, "u1=a&p1=1&u2=b&p2=1&u3=c&p3=1"},
    };
    for (const Case& c : CASES) {
        std::string buffer(c.size + 1, '#');
        users.ListUsers(buffer.data(), c.size);
        EXPECT_STREQ(c.list, buffer.c_str()) << c.size;
        EXPECT_EQ('#', buffer[c.size]);
    }
    char untouched = '#';
    users.ListUsers(&untouched, 0);
    EXPECT_EQ('#', untouched);
}

TEST_F(oxUserBaseOperations, TheListHoldsWholeUsersOnlyHoweverLongTheirNames) {
    oxUserBase users(Directory());
    const std::string a(255, 'a');
    const std::string b(255, 'b');
    ASSERT_TRUE(users.AddUser(a, "", 123456789, "", ""));
    ASSERT_TRUE(users.AddUser(b, "", 0xFFFFFFFF, "", ""));
    const std::string first = "u1=" + a + "&p1=123456789";
    const std::string second = first + "&u2=" + b + "&p2=-1";
    for (std::size_t size = 1; size < 700; ++size) {
        std::string buffer(size + 1, '#');
        users.ListUsers(buffer.data(), size);
        const std::string expected = size <= 99 || size < first.size() + 1                   ? ""
                                     : size - first.size() <= 99 || size < second.size() + 1 ? first
                                                                                             : second;
        ASSERT_STREQ(expected.c_str(), buffer.c_str()) << size;
        ASSERT_EQ('#', buffer[size]) << size;
    }
}

TEST_F(oxUserBaseOperations, TheGenerationGrowsWithEveryChange) {
    oxUserBase users(Directory());
    std::uint64_t last = users.Generation();
    const auto grew = [&] { return users.Generation() > std::exchange(last, users.Generation()); };
    EXPECT_TRUE(users.AddUser("alice", "a", 1, "", "") && grew());
    EXPECT_TRUE(users.AddUser("bob", "b", 1, "", "") && grew());
    EXPECT_TRUE(users.SetPassword("alice", "x") && grew());
    EXPECT_TRUE(users.SetPermissions("alice", 2) && grew());
    EXPECT_TRUE(users.SetText1("alice", "x") && grew());
    EXPECT_TRUE(users.SetText2("alice", "1") && grew());
    EXPECT_TRUE(users.DeleteUser("alice") && grew());

    EXPECT_FALSE(users.SetPassword("alice", "x") || grew()) << "refused changes are none";
    EXPECT_FALSE(users.AddUser("bob", "x", 1, "", "") || grew());
    EXPECT_FALSE(users.DeleteUser("alice") || grew());
    EXPECT_TRUE(users.LoadAll());
    EXPECT_TRUE(users.SaveUser("bob"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_TRUE(users.Authenticate("bob", "b", nullptr));
    EXPECT_FALSE(grew()) << "nothing changed";

    WriteUser("bob.usr", "bob", "password=" + Sealed("b") + "\npermissions=9");
    EXPECT_TRUE(users.LoadAll() && grew()) << "changed by hand";
    WriteUser("carol.usr", "carol");
    EXPECT_TRUE(users.LoadAll() && grew()) << "new";
    std::filesystem::remove(PathOf("carol.usr"));
    EXPECT_TRUE(users.LoadAll() && grew()) << "removed";
    Write("bob.usr", "damaged");
    EXPECT_TRUE(users.LoadAll() && grew()) << "damaged";
    Write("bob.usr", "damaged otherwise");
    EXPECT_TRUE(users.LoadAll());
    EXPECT_FALSE(grew()) << "no user changed";
}

TEST_F(oxUserBaseOperations, AUserOfAnotherProcessIsSeenByTheNextChange) {
    oxUserBase one(Directory());
    oxUserBase other(Directory());
    ASSERT_TRUE(one.AddUser("alice", "secret", 1, "", ""));
    EXPECT_FALSE(other.Authenticate("alice", "secret", nullptr)) << "a check does not reload";
    ASSERT_TRUE(other.SetText1("alice", "/x"));
    ASSERT_TRUE(one.SetPermissions("alice", 3));
    EXPECT_EQ("/x", KeyOf("alice.usr", "logfileurl")) << "the change of the other is kept";
    ASSERT_TRUE(other.DeleteUser("alice"));
    EXPECT_FALSE(one.SetPermissions("alice", 4));
    EXPECT_EQ(List{}, Files());
}
