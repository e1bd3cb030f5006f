#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <thread>
#include <vector>

#include "testing/ordinaryuser.h"
#include "testing/waiting.h"
#include "userbasefixture.h"
#include "users/oxuserbase.h"

using namespace std::string_literals;

namespace {

using List = std::vector<std::string>;

class oxUserBaseLoading : public UserBaseTest {};

}  // namespace

TEST_F(oxUserBaseLoading, TakesTheUsersOfADirectory) {
    WriteUser("alice.usr", "alice", "permissions=1");
    WriteUser("any name at all.usr", "bob smith", "permissions=2");
    Write("crlf.usr", "\xEF\xBB\xBF[UserInfo]\r\nusername=carol\r\nPlaintextPassword=secret\r\npermissions=3\r\n");
    WriteUser(".hidden.usr", "hidden");
    WriteUser("notes.txt", "notes");
    WriteUser("alice.usr.bak", "backup");
    WriteUser("upper.USR", "upper");
    WriteUser("nameless.usr", "");
    Write("empty.usr", "");
    Write("nul.usr", "[UserInfo]\nusername=nul\n\0"s);
    Write("garbage.usr", "\xFF\xFE\x01 [[[ = ");
    Write("section.usr", "[Other]\nusername=other\n");
    Write("large.usr", "[UserInfo]\nusername=large\nx=" + std::string(1 << 20, 'x') + "\n");
    ASSERT_EQ(0, mkdir(PathOf("directory.usr").c_str(), 0700));
    ASSERT_EQ(0, mkfifo(PathOf("pipe.usr").c_str(), 0600));
    ASSERT_EQ(0, symlink("nowhere", PathOf("dangling.usr").c_str()));
    oxUserBase users;
    EXPECT_EQ("User file " + PathOf("large.usr") + " cannot be read: File too large\n",
              StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); }));
    EXPECT_EQ("u1=alice&p1=1&u2=bob smith&p2=2&u3=carol&p3=3", ListOf(users));
    EXPECT_TRUE(users.Authenticate("carol", "secret", nullptr));
    EXPECT_FALSE(users.Authenticate("carol", "secret\r", nullptr));
    EXPECT_FALSE(users.Authenticate("", "", nullptr));
}

TEST_F(oxUserBaseLoading, APlaintextPasswordIsEncipheredAtOnce) {
    const std::string longest(40, 'p');
    Write("alice.usr", "; by hand\n[UserInfo]\nusername=alice\nPlaintextPassword=" + longest +
                           "\npermissions=3\nlogfileurl=/x\nemail=a@b\n[Other]\nkey=value\n");
    oxUserBase users;
    EXPECT_EQ("", StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); }));
    EXPECT_EQ(longest, PasswordIn("alice.usr"));
    EXPECT_EQ("-", KeyOf("alice.usr", "PlaintextPassword"));
    EXPECT_EQ("3", KeyOf("alice.usr", "permissions"));
    EXPECT_EQ("/x", KeyOf("alice.usr", "logfileurl"));
    EXPECT_EQ("a@b", KeyOf("alice.usr", "email"));
    EXPECT_EQ("value", KeyOf("alice.usr", "key", "Other"));
    EXPECT_EQ(std::string::npos, TextOf("alice.usr").find(longest));
    EXPECT_EQ(0u, TextOf("alice.usr").find("; by hand"));
    struct stat status {};
    ASSERT_EQ(0, stat(PathOf("alice.usr").c_str(), &status));
    EXPECT_EQ(0600u, status.st_mode & 07777);
    EXPECT_TRUE(users.Authenticate("alice", longest, nullptr));
    const std::string written = TextOf("alice.usr");
    EXPECT_TRUE(users.LoadAll());
    EXPECT_TRUE(oxUserBase(Directory()).Authenticate("alice", longest, nullptr));
    EXPECT_EQ(written, TextOf("alice.usr")) << "once";
}

TEST_F(oxUserBaseLoading, AnEmptyPlaintextPasswordIsTheEmptyPassword) {
    WriteUser("alice.usr", "alice", "PlaintextPassword=");
    oxUserBase users(Directory());
    EXPECT_TRUE(users.Authenticate("alice", "anything", nullptr));
    EXPECT_EQ("-", KeyOf("alice.usr", "PlaintextPassword"));
    EXPECT_EQ("", PasswordIn("alice.usr"));
}

TEST_F(oxUserBaseLoading, OnlyAPlaintextPasswordIsAReasonToWrite) {
    WriteUser("none.usr", "none", "permissions=1");
    WriteUser("empty.usr", "empty", "password=");
    WriteUser("sealed.usr", "sealed", "password=" + Sealed("x"));
    WriteUser("both.usr", "both", "password=" + Sealed("counts") + "\nPlaintextPassword=ignored");
    WriteUser("damaged.usr", "damaged", "password=damaged\nPlaintextPassword=ignored");
    WriteUser("long.usr", "long", "PlaintextPassword=" + std::string(41, 'p'));
    const auto before = Texts();
    oxUserBase users;
    StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); });
    EXPECT_TRUE(users.LoadAll());
    EXPECT_EQ(before, Texts());
    EXPECT_TRUE(users.Authenticate("both", "counts", nullptr));
    EXPECT_FALSE(users.Authenticate("both", "ignored", nullptr));
    EXPECT_TRUE(users.SetPermissions("both", 3));
    EXPECT_EQ("-", KeyOf("both.usr", "PlaintextPassword")) << "the next change of the user takes it away";
    EXPECT_EQ("counts", PasswordIn("both.usr"));
}

TEST_F(oxUserBaseLoading, APlaintextPasswordThatIsTooLongMakesTheUserUnusable) {
    const std::string text = "[UserInfo]\nusername=bob smith\nPlaintextPassword=" + std::string(41, 'p') + "\n";
    Write("bob.usr", text);
    WriteUser("alice.usr", "alice");
    oxUserBase users;
    const std::string errors = StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); });
    EXPECT_EQ(
        "Plaintext password for user bob smith exceeds max allowable length. (40)\nUser bob smith will not be used.\n",
        errors);
    EXPECT_FALSE(users.Authenticate("bob smith", std::string(41, 'p'), nullptr));
    EXPECT_FALSE(users.Authenticate("bob smith", std::string(40, 'p'), nullptr));
    EXPECT_FALSE(users.Authenticate("bob smith", "", nullptr));
    EXPECT_FALSE(users.SetPassword("bob smith", "x"));
    EXPECT_EQ(text, TextOf("bob.usr"));
    EXPECT_EQ("u1=alice&p1=0", ListOf(users));
}

TEST_F(oxUserBaseLoading, APasswordThatCannotBeDecipheredMakesTheUserUnusable) {
    const std::string sealed = Sealed("secret");
    const std::string good = "[UserInfo]\nusername=bob\npassword=" + sealed + "\npermissions=1\n";
    for (std::size_t i = 0; i < sealed.size(); i += 5) {
        std::string damaged = sealed;
        damaged[i] = damaged[i] == 'A' ? 'B' : 'A';
        WriteUser("bob.usr", "bob", "password=" + damaged);
        const std::string text = TextOf("bob.usr");
        oxUserBase users;
        const std::string errors = StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); });
        EXPECT_EQ("Password for user bob cannot be deciphered. User bob will not be used.\n", errors);
        for (const char* password : {"", "secret", "anything"})
            EXPECT_FALSE(users.Authenticate("bob", password, nullptr));
        EXPECT_FALSE(users.FindUser("bob", nullptr));
        EXPECT_FALSE(users.SetPermissions("bob", 3));
        EXPECT_EQ(text, TextOf("bob.usr"));
        Write("bob.usr", good);
        EXPECT_TRUE(users.LoadAll());
        EXPECT_TRUE(users.Authenticate("bob", "secret", nullptr)) << "repaired";
    }
}

TEST_F(oxUserBaseLoading, ALostKeyMakesUsersUnusableUntilItReturns) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret"));
    WriteUser("open.usr", "open");
    const auto before = Texts();
    SetEncryptionKeyFile(m_scratch.File("lost.key"));
    oxUserBase users;
    const std::string line = "Password for user alice cannot be deciphered. User alice will not be used.\n";
    EXPECT_EQ(line, StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); }));
    EXPECT_EQ("", StandardErrorOf([&] { EXPECT_TRUE(users.LoadAll()); })) << "one line for one state of the file";
    EXPECT_FALSE(users.Authenticate("alice", "", nullptr));
    EXPECT_TRUE(users.Authenticate("open", "", nullptr));
    EXPECT_FALSE(std::filesystem::exists(m_scratch.File("lost.key")));
    EXPECT_EQ(before, Texts());
    std::filesystem::rename(m_scratch.File("ox_remote.key"), m_scratch.File("lost.key"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
}

TEST_F(oxUserBaseLoading, NamesFromFilesForgeNoLine) {
    WriteUser("bob.usr", "b\x1B[2Jb", "password=damaged");
    oxUserBase users;
    EXPECT_EQ("Password for user b\\x1b[2Jb cannot be deciphered. User b\\x1b[2Jb will not be used.\n",
              StandardErrorOf([&] { EXPECT_TRUE(users.Open(Directory())); }));
}

TEST_F(oxUserBaseLoading, WithoutAKeyPlaintextUsersWorkAndKeepTheirFiles) {
    m_scratch.Write("damaged.key", "short");
    SetEncryptionKeyFile(m_scratch.File("damaged.key"));
    WriteUser("alice.usr", "alice", "PlaintextPassword=secret");
    const auto before = Texts();
    oxUserBase users(Directory());
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    EXPECT_FALSE(users.SetPermissions("alice", 3));
    EXPECT_FALSE(users.AddUser("bob", "x", 1, "", ""));
    EXPECT_EQ(before, Texts());
    EXPECT_EQ("u1=alice&p1=0", ListOf(users));

    SetEncryptionKeyFile(m_scratch.File("good.key"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_EQ("secret", PasswordIn("alice.usr")) << "the next reload tries again";
}

TEST_F(oxUserBaseLoading, OfSeveralFilesWithOneNameTheFirstCounts) {
    WriteUser("b.usr", "alice", "permissions=2");
    WriteUser("a.usr", "alice", "permissions=1");
    WriteUser("c.usr", "alice", "PlaintextPassword=clear\npermissions=3");
    oxUserBase users(Directory());
    EXPECT_EQ("u1=alice&p1=1", ListOf(users));
    EXPECT_EQ("-", KeyOf("c.usr", "PlaintextPassword")) << "no password stays in clear";
    EXPECT_TRUE(users.SetPermissions("alice", 9));
    EXPECT_EQ("9", KeyOf("a.usr", "permissions"));
    EXPECT_EQ("2", KeyOf("b.usr", "permissions"));
    std::filesystem::remove(PathOf("a.usr"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_EQ("u1=alice&p1=2", ListOf(users));
}

TEST_F(oxUserBaseLoading, TheFurtherTextsSurviveTheChangesOfOthers) {
    {
        oxUserBase users(Directory());
        ASSERT_TRUE(users.AddUser("alice", "a", 1, "", ""));
        ASSERT_TRUE(users.AddUser("bob", "b", 1, "", ""));
        ASSERT_TRUE(users.SetText1("bob", "/x"));
        ASSERT_TRUE(users.SetText2("bob", "7"));
        ASSERT_TRUE(users.SetPassword("alice", "new"));
    }
    oxUserBase users(Directory());
    ASSERT_TRUE(users.SetPermissions("bob", 3));
    EXPECT_EQ("/x", KeyOf("bob.usr", "logfileurl"));
    EXPECT_EQ("7", KeyOf("bob.usr", "maxprofiles"));
}

TEST_F(oxUserBaseLoading, AMissingDirectoryKeepsTheUsersAndAddUserMakesIt) {
    WriteUser("alice.usr", "alice", "permissions=1");
    oxUserBase users(Directory());
    std::filesystem::rename(Directory(), m_scratch.File("away"));
    EXPECT_FALSE(users.LoadAll());
    EXPECT_TRUE(users.Authenticate("alice", "", nullptr));
    EXPECT_FALSE(users.SetPermissions("alice", 3));
    EXPECT_FALSE(users.DeleteUser("alice"));
    EXPECT_FALSE(users.AddUser("alice", "x", 1, "", ""));
    EXPECT_FALSE(std::filesystem::exists(Directory()));
    EXPECT_EQ("u1=alice&p1=1", ListOf(users));

    const mode_t mask = umask(0);
    EXPECT_TRUE(users.AddUser("bob", "secret", 2, "", ""));
    umask(mask);
    struct stat status {};
    ASSERT_EQ(0, stat(Directory().c_str(), &status));
    EXPECT_EQ(0700u, status.st_mode & 07777);
    EXPECT_EQ("u1=alice&p1=1&u2=bob&p2=2", ListOf(users));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_EQ("u1=bob&p1=2", ListOf(users));
}

TEST_F(oxUserBaseLoading, TheFirstUserMakesTheDirectoriesAbove) {
    oxUserBase users(m_scratch.File("a/b/users"));
    EXPECT_TRUE(users.AddUser("alice", "secret", 1, "", ""));
    EXPECT_TRUE(std::filesystem::exists(m_scratch.File("a/b/users/alice.usr")));
    EXPECT_TRUE(oxUserBase(m_scratch.File("a/b/users")).Authenticate("alice", "secret", nullptr));
}

TEST_F(oxUserBaseLoading, ADirectoryThatCannotBeMadeIsReported) {
    m_scratch.Write("file", "in the way");
    for (const std::string& path : {m_scratch.File("missing/../file/users"), ""s}) {
        oxUserBase users(path);
        EXPECT_FALSE(users.LoadAll());
        EXPECT_EQ("", ListOf(users));
    }
    for (const char* path : {"file", "file/users"}) {
        oxUserBase users(m_scratch.File(path));
        bool added = true;
        EXPECT_EQ("Couldn't create user config directory.\n",
                  StandardErrorOf([&] { added = users.AddUser("alice", "secret", 1, "", ""); }));
        EXPECT_FALSE(added);
        EXPECT_EQ("", ListOf(users));
    }
    EXPECT_EQ("in the way", m_scratch.Read("file"));
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0555));
    AsOrdinaryUser([&] {
        oxUserBase users(m_scratch.File("none/users"));
        bool added = true;
        EXPECT_EQ("Couldn't create user config directory.\n",
                  StandardErrorOf([&] { added = users.AddUser("alice", "secret", 1, "", ""); }));
        EXPECT_FALSE(added);
        EXPECT_EQ("", ListOf(users));
    });
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    EXPECT_FALSE(std::filesystem::exists(m_scratch.File("none")));
}

TEST_F(oxUserBaseLoading, ADirectoryThatCannotBeListedKeepsTheUsers) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret"));
    oxUserBase users(Directory());
    const auto before = Texts();
    const std::uint64_t generation = users.Generation();
    ASSERT_EQ(0, chmod(Directory().c_str(), 0));
    AsOrdinaryUser([&] {
        EXPECT_FALSE(users.LoadAll());
        EXPECT_FALSE(users.SetPassword("alice", "new"));
        EXPECT_FALSE(users.SetPermissions("alice", 1));
        EXPECT_FALSE(users.DeleteUser("alice"));
        EXPECT_FALSE(users.AddUser("alice", "new", 1, "", ""));
        EXPECT_FALSE(users.AddUser("bob", "new", 1, "", "")) << "who knows whether there is a bob";
        EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    });
    ASSERT_EQ(0, chmod(Directory().c_str(), 0700));
    EXPECT_EQ(before, Texts());
    EXPECT_EQ(generation, users.Generation());
    EXPECT_TRUE(users.LoadAll());
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
}

TEST_F(oxUserBaseLoading, WithoutDescriptorsTheUsersAreKept) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret"));
    oxUserBase users(Directory());
    const auto before = Texts();
    rlimit limit{};
    ASSERT_EQ(0, getrlimit(RLIMIT_NOFILE, &limit));
    const rlimit none{.rlim_cur = 0, .rlim_max = limit.rlim_max};
    ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &none));
    EXPECT_FALSE(users.LoadAll());
    EXPECT_FALSE(users.AddUser("alice", "new", 1, "", ""));
    EXPECT_FALSE(users.AddUser("bob", "new", 1, "", ""));
    EXPECT_FALSE(users.SetPassword("alice", "new"));
    EXPECT_FALSE(users.DeleteUser("alice"));
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &limit));
    EXPECT_EQ(before, Texts());
    EXPECT_TRUE(users.SetPassword("alice", "new"));
}

TEST_F(oxUserBaseLoading, AFileThatCannotBeReadKeepsItsUser) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret"));
    WriteUser("bob.usr", "bob", "permissions=1");
    oxUserBase users(Directory());
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    ASSERT_EQ(0, chmod(Directory().c_str(), 0755));
    ASSERT_EQ(0, chmod(PathOf("alice.usr").c_str(), 0));
    WriteUser("new.usr", "new");
    ASSERT_EQ(0, chmod(PathOf("new.usr").c_str(), 0));
    WriteUser("bob.usr", "bob", "permissions=2");
    ASSERT_EQ(0, chmod(PathOf("bob.usr").c_str(), 0644));
    AsOrdinaryUser([&] {
        EXPECT_TRUE(users.LoadAll());
        EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr)) << "as it was";
        EXPECT_EQ("u1=alice&p1=0&u2=bob&p2=2", ListOf(users)) << "the others are read";
        EXPECT_FALSE(users.SetPermissions("alice", 3)) << "the file's text would be lost";
    });
    ASSERT_EQ(0, chmod(PathOf("alice.usr").c_str(), 0600));
    EXPECT_EQ("secret", PasswordIn("alice.usr"));
    std::filesystem::remove(PathOf("alice.usr"));
    EXPECT_TRUE(users.LoadAll());
    EXPECT_FALSE(users.FindUser("alice", nullptr)) << "a file that is gone is no failure";
}

TEST_F(oxUserBaseLoading, AFileThatCannotBeReadIsToldOncePerReason) {
    const std::string path = PathOf("alice.usr");
    const std::string denied = "User file " + path + " cannot be read: Permission denied\n";
    const std::string loops = "User file " + path + " cannot be read: Too many levels of symbolic links\n";
    WriteUser("alice.usr", "alice");
    WriteUser("bob.usr", "bob");
    oxUserBase users(Directory());
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    ASSERT_EQ(0, chmod(Directory().c_str(), 0777));
    ASSERT_EQ(0, chmod(PathOf("bob.usr").c_str(), 0666));
    const auto toldBy = [](const auto& body) { return StandardErrorOf([&] { AsOrdinaryUser(body); }); };
    const auto load = [&] { EXPECT_TRUE(users.LoadAll()); };

    std::filesystem::permissions(path, std::filesystem::perms::none);
    EXPECT_EQ(denied, toldBy(load));
    EXPECT_EQ("", toldBy(load));
    EXPECT_EQ("", toldBy([&] { EXPECT_FALSE(users.DeleteUser("nobody")); }));
    EXPECT_EQ("", toldBy([&] { EXPECT_FALSE(users.AddUser("alice", "x", 1, "", "")); }));

    std::filesystem::remove(path);
    std::filesystem::create_symlink("alice.usr", path);
    EXPECT_EQ(loops, toldBy(load)) << "another reason";
    EXPECT_EQ("", toldBy(load));
    EXPECT_EQ("u1=alice&p1=0&u2=bob&p2=0", ListOf(users)) << "as it was";

    std::filesystem::remove(path);
    WriteUser("alice.usr", "alice", "permissions=2");
    ASSERT_EQ(0, chmod(path.c_str(), 0644));
    EXPECT_EQ("", toldBy(load));
    EXPECT_EQ("u1=alice&p1=2&u2=bob&p2=0", ListOf(users)) << "readable again";
    std::filesystem::permissions(path, std::filesystem::perms::none);
    std::filesystem::rename(path, PathOf("carol.usr"));
    const std::string moved = "User file " + PathOf("carol.usr") + " cannot be read: Permission denied\n";
    EXPECT_EQ(moved, toldBy(load)) << "never read under this name";
    EXPECT_EQ("", toldBy(load));
    EXPECT_EQ("u1=bob&p1=0", ListOf(users));
    ASSERT_EQ(0, chmod(Directory().c_str(), 0700));
}

TEST_F(oxUserBaseLoading, AFileThatBecomesTooLargeIsToldOnceAndKeepsItsUser) {
    WriteUser("alice.usr", "alice", "password=" + Sealed("secret") + "\npermissions=3");
    oxUserBase users(Directory());
    const std::string small = TextOf("alice.usr");
    const std::string filling = "; " + std::string(oxUserFile::MAX_BYTES - small.size() - 3, 'x') + "\n";
    const std::string line = "User file " + PathOf("alice.usr") + " cannot be read: File too large\n";
    const auto load = [&] { EXPECT_TRUE(users.LoadAll()); };

    Write("alice.usr", small + filling);
    EXPECT_EQ("", StandardErrorOf(load)) << "the largest";
    EXPECT_EQ("u1=alice&p1=3", ListOf(users));
    Write("alice.usr", small + "x" + filling);
    EXPECT_EQ(line, StandardErrorOf(load));
    EXPECT_EQ("", StandardErrorOf(load));
    EXPECT_EQ("u1=alice&p1=3", ListOf(users));
    EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
    EXPECT_FALSE(users.Authenticate("alice", "", nullptr));
    EXPECT_EQ("", StandardErrorOf([&] {
                  EXPECT_FALSE(users.SetPermissions("alice", 4)) << "the file's text would be lost";
                  EXPECT_FALSE(users.AddUser("alice", "x", 1, "", ""));
              }));
    EXPECT_TRUE(TextOf("alice.usr") == small + "x" + filling);
    Write("alice.usr", small);
    EXPECT_EQ("", StandardErrorOf(load));
    EXPECT_TRUE(users.SetPermissions("alice", 4));
    EXPECT_EQ("u1=alice&p1=4", ListOf(users));
}

TEST_F(oxUserBaseLoading, AnotherDirectoryBringsOtherUsers) {
    WriteUser("alice.usr", "alice");
    m_scratch.Write("others/bob.usr", "[UserInfo]\nusername=bob\n");
    oxUserBase users;
    EXPECT_FALSE(users.LoadAll());
    EXPECT_TRUE(users.Open(Directory()));
    EXPECT_EQ("u1=alice&p1=0", ListOf(users));
    const std::uint64_t generation = users.Generation();
    EXPECT_TRUE(users.Open(m_scratch.File("others")));
    EXPECT_EQ("u1=bob&p1=0", ListOf(users));
    EXPECT_GT(users.Generation(), generation);
    EXPECT_FALSE(users.Open(m_scratch.File("missing")));
    EXPECT_EQ("", ListOf(users)) << "nobody of another directory logs in";
}

TEST_F(oxUserBaseLoading, WhatACrashLeftIsRemoved) {
    WriteUser("alice.usr", "alice");
    WriteUser(".alice.usr.tmp-AbC123", "alice", "permissions=9");
    oxUserBase users(Directory());
    EXPECT_EQ(List{"alice.usr"}, Files());
    EXPECT_EQ("u1=alice&p1=0", ListOf(users));
}

TEST_F(oxUserBaseLoading, UnchangedFilesAreNotReadAgain) {
    constexpr std::uint64_t USERS = 5000;
    constexpr std::uint64_t CHANGES = 4;
    const std::string sealed = Sealed("secret");
    for (std::uint64_t i = 0; i < USERS; ++i)
        WriteUser("user" + std::to_string(i) + ".usr", "user" + std::to_string(i), "password=" + sealed);
    oxUserBase users(Directory());
    EXPECT_EQ(USERS, users.FilesRead());
    const auto readBy = [&](const auto& body) {
        const std::uint64_t before = users.FilesRead();
        body();
        return users.FilesRead() - before;
    };
    // A file that was written a moment before the reading is looked at once more.
    EXPECT_TRUE(Eventually([&] { return readBy([&] { EXPECT_TRUE(users.LoadAll()); }) == 0; }));
    const std::uint64_t read = readBy([&] {
        EXPECT_TRUE(users.SetPassword("user7", "new"));
        EXPECT_TRUE(users.SetText1("user7", "/x"));
        EXPECT_TRUE(users.SetPermissions("user7", 3));
        EXPECT_TRUE(users.SetText2("user7", "9"));
    });
    EXPECT_LE(read, CHANGES) << "the changed file each time, and no other";
    EXPECT_EQ("new", PasswordIn("user7.usr"));
    EXPECT_EQ("9", KeyOf("user7.usr", "maxprofiles"));

    WriteUser("user8.usr", "user8", "permissions=77");
    const std::uint64_t byHand = readBy([&] { EXPECT_TRUE(users.LoadAll()); });
    EXPECT_GE(byHand, 1u);
    EXPECT_LE(byHand, 2u);
    std::uint32_t permissions = 0;
    EXPECT_TRUE(users.FindUser("user8", &permissions));
    EXPECT_EQ(77u, permissions);
}

TEST_F(oxUserBaseLoading, EveryEditByHandIsSeenHoweverQuickly) {
    WriteUser("alice.usr", "alice", "permissions=0");
    oxUserBase users(Directory());
    for (unsigned i = 0; i < 300; ++i) {
        // The same size and, on most file systems, the same tick of the clock.
        WriteUser("alice.usr", "alice", "permissions=" + std::to_string(i % 10));
        ASSERT_TRUE(users.LoadAll());
        std::uint32_t permissions = 99;
        ASSERT_TRUE(users.FindUser("alice", &permissions));
        ASSERT_EQ(i % 10, permissions);
    }
}
