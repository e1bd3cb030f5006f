// Files of users that cannot be used: their names are taken, and they are told of.
#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "testing/waiting.h"
#include "userbasefixture.h"
#include "users/oxuserbase.h"

using namespace std::string_literals;

namespace {

using List = std::vector<std::string>;

const std::string TOO_LONG = "PlaintextPassword=" + std::string(41, 'p');
const std::string DAMAGED = "password=damaged";

std::string TooLongLines(const std::string& name) {
    return "Plaintext password for user " + name + " exceeds max allowable length. (40)\nUser " + name +
           " will not be used.\n";
}
std::string DamagedLine(const std::string& name) {
    return "Password for user " + name + " cannot be deciphered. User " + name + " will not be used.\n";
}

class oxUserBaseUnusable : public UserBaseTest {
protected:
    // What a body that shall be good writes to standard error.
    template <typename Body>
    static std::string Told(const Body& body) {
        return StandardErrorOf([&] { EXPECT_TRUE(body()); });
    }
};

}  // namespace

TEST_F(oxUserBaseUnusable, ItsNameIsRefusedToANewUser) {
    for (const std::string& text : {TOO_LONG, DAMAGED}) {
        WriteUser("any.usr", "alice", text);
        const auto before = Texts();
        StandardErrorOf([&] {
            oxUserBase users(Directory());
            EXPECT_FALSE(users.AddUser("alice", "secret", 1, "", "")) << text;
            EXPECT_EQ(before, Texts()) << text;
            EXPECT_EQ("", ListOf(users)) << text;
            EXPECT_TRUE(users.AddUser("Alice", "secret", 1, "", "")) << "another name";
            EXPECT_TRUE(users.DeleteUser("Alice"));
            WriteUser("any.usr", "alice", "PlaintextPassword=mended\npermissions=5");
            EXPECT_TRUE(users.LoadAll());
            EXPECT_TRUE(users.Authenticate("alice", "mended", nullptr));
        });
    }
}

TEST_F(oxUserBaseUnusable, ItsNameIsRefusedAlsoWhenItsFileIsNewerThanTheLastLook) {
    oxUserBase users(Directory());
    WriteUser("1.usr", "alice", DAMAGED);
    WriteUser("2.usr", "bob", TOO_LONG);
    const std::string errors = StandardErrorOf([&] {
        EXPECT_FALSE(users.AddUser("alice", "secret", 1, "", ""));
        EXPECT_FALSE(users.AddUser("bob", "secret", 1, "", ""));
    });
    EXPECT_EQ(DamagedLine("alice") + TooLongLines("bob"), errors);
    EXPECT_EQ((List{"1.usr", "2.usr"}), Files());
}

TEST_F(oxUserBaseUnusable, DeletingRemovesItsFiles) {
    WriteUser("1.usr", "alice", DAMAGED);
    WriteUser("2.usr", "alice", TOO_LONG);
    WriteUser("3.usr", "bob", TOO_LONG);
    WriteUser("4.usr", "carol", "permissions=1");
    oxUserBase users;
    StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); });
    WriteUser("5.usr", "dave", DAMAGED);
    const std::uint64_t generation = users.Generation();
    const std::string errors = StandardErrorOf([&] {
        EXPECT_TRUE(users.DeleteUser("alice"));
        EXPECT_EQ((List{"3.usr", "4.usr", "5.usr"}), Files());
        EXPECT_FALSE(users.DeleteUser("alice")) << "gone";
        EXPECT_TRUE(users.DeleteUser("bob"));
        EXPECT_TRUE(users.DeleteUser("dave"));
    });
    EXPECT_EQ(DamagedLine("dave"), errors);
    EXPECT_EQ(List{"4.usr"}, Files());
    EXPECT_EQ(generation, users.Generation()) << "nobody who could log in has changed";
    EXPECT_TRUE(users.AddUser("alice", "secret", 2, "", ""));
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    EXPECT_EQ("u1=alice&p1=2&u2=carol&p2=1", ListOf(users));
}

// Whatever has no usable name is nobody's.
TEST_F(oxUserBaseUnusable, NoOperationWithoutANameReachesNobodysFiles) {
    Write("damaged.usr", "no settings\n");
    Write("nosection.usr", "username=alice\n");
    WriteUser("nameless.usr", "", "PlaintextPassword=x\npermissions=1");
    Write("nokey.usr", "[UserInfo]\npermissions=1\n");
    WriteUser("nul.usr", "a\0b"s);
    Write("empty.usr", "");
    WriteUser("carol.usr", "carol", "permissions=1");
    const auto before = Texts();
    const struct {
        const char* operation;
        std::function<bool(oxUserBase&)> call;
    } CASES[] = {
        {"AddUser", [](oxUserBase& users) { return users.AddUser("", "x", 1, "1", "/x"); }},
        {"DeleteUser", [](oxUserBase& users) { return users.DeleteUser(""); }},
        {"SetPermissions", [](oxUserBase& users) { return users.SetPermissions("", 2); }},
        {"SetPassword", [](oxUserBase& users) { return users.SetPassword("", "x"); }},
        {"SetText1", [](oxUserBase& users) { return users.SetText1("", "/x"); }},
        {"SetText2", [](oxUserBase& users) { return users.SetText2("", "1"); }},
        {"SaveUser", [](oxUserBase& users) { return users.SaveUser(""); }},
    };
    oxUserBase users(Directory());
    const std::uint64_t generation = users.Generation();
    for (const auto& c : CASES) {
        EXPECT_FALSE(c.call(users)) << c.operation;
        EXPECT_TRUE(before == Texts()) << c.operation;
    }
    EXPECT_EQ(generation, users.Generation());
    EXPECT_EQ("u1=carol&p1=1", ListOf(users));
}

TEST_F(oxUserBaseUnusable, EachOpeningTellsOfItAndNoOtherReloadDoes) {
    WriteUser("1.usr", "alice", DAMAGED);
    WriteUser("2.usr", "bob", TOO_LONG);
    WriteUser("3.usr", "carol", "permissions=1");
    const std::string lines = DamagedLine("alice") + TooLongLines("bob");
    oxUserBase users;
    const auto open = [&] { return users.Open(Directory()); };
    const auto load = [&] { return users.LoadAll(); };
    EXPECT_EQ(lines, Told(open));
    EXPECT_EQ("", Told(load));
    EXPECT_EQ("", Told([&] { return users.SetPermissions("carol", 2); }));
    EXPECT_EQ("", Told([&] { return users.AddUser("dave", "x", 1, "", ""); }));
    EXPECT_EQ("", Told([&] { return users.DeleteUser("dave"); }));
    EXPECT_EQ(lines, Told(open)) << "a moment after they were written";
    // A file that was written a moment before the reading is looked at once more; the two that may be mended always.
    EXPECT_TRUE(Eventually([&] {
        const std::uint64_t before = users.FilesRead();
        EXPECT_EQ("", Told(load));
        return users.FilesRead() - before == 2;
    }));
    EXPECT_EQ(lines, Told(open)) << "and later";
    EXPECT_EQ(lines, Told(open));

    WriteUser("2.usr", "bob", TOO_LONG + "p");
    EXPECT_EQ(TooLongLines("bob") + DamagedLine("alice"), Told(open)) << "each once, what has changed first";
    WriteUser("2.usr", "bob", TOO_LONG + "pp");
    EXPECT_EQ(TooLongLines("bob"), Told(load)) << "a change is told of at once";
    EXPECT_EQ("", Told(load));
    WriteUser("1.usr", "alice", "password=" + Sealed("secret"));
    EXPECT_EQ(TooLongLines("bob"), Told(open)) << "one of them is mended";
}

TEST_F(oxUserBaseUnusable, AnotherDirectoryTellsOfItsOwn) {
    WriteUser("1.usr", "alice", DAMAGED);
    m_scratch.Write("others/1.usr", "[UserInfo]\nusername=bob\n" + TOO_LONG + "\n");
    oxUserBase users;
    EXPECT_EQ(DamagedLine("alice"), Told([&] { return users.Open(Directory()); }));
    EXPECT_EQ(TooLongLines("bob"), Told([&] { return users.Open(m_scratch.File("others")); }));
    EXPECT_EQ(DamagedLine("alice"), Told([&] { return users.Open(Directory()); }));
}
