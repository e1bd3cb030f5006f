#include "users/userfile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include "platform/config.h"
#include "platform/encrypt.h"
#include "testing/ordinaryuser.h"
#include "testing/scratch.h"
#include "testing/waiting.h"

using namespace std::string_literals;
using State = oxUserFile::State;

namespace {

class UserFile : public testing::Test {
protected:
    UserFile() { SetEncryptionKeyFile(m_scratch.File("ox_remote.key")); }
    ~UserFile() override { SetEncryptionKeyFile(DEFAULT_ENCRYPTION_KEY_FILE); }

    Scratch m_scratch;
};

std::string Sealed(const std::string& clear) {
    std::string sealed;
    EXPECT_TRUE(oxEncrypt(clear, sealed));
    return sealed;
}

oxUserRecord Record(const std::string& name, const std::string& password = "", std::uint32_t permissions = 0) {
    oxUserRecord record;
    record.name = name;
    record.password = password;
    record.permissions = permissions;
    return record;
}

std::string Composed(const std::string& before, const oxUserRecord& record) {
    std::string after;
    EXPECT_TRUE(oxUserFile::Compose(before, record, after));
    return after;
}

}  // namespace

TEST_F(UserFile, WhoseFileItIs) {
    struct Case {
        std::string text;
        State state;
        const char* name;
    };
    const Case cases[] = {
        {"[UserInfo]\nusername=alice\n", State::User, "alice"},
        {"[userinfo]\nUSERNAME=alice\n", State::User, "alice"},
        {"[UserInfo]\r\nusername = alice \r\n", State::User, "alice"},
        {"\xEF\xBB\xBF[UserInfo]\nusername=alice", State::User, "alice"},
        {"; comment\n[Other]\nusername=bob\n[UserInfo]\nusername=alice\n", State::User, "alice"},
        {"[UserInfo]\nusername=alice\nusername=bob\n", State::User, "bob"},
        {"[UserInfo]\nusername=bob smith\n", State::User, "bob smith"},
        {"[UserInfo]\nusername=Alice;x#y\n", State::User, "Alice;x#y"},
        {"", State::NoUser, ""},
        {"username=alice\n", State::NoUser, ""},
        {"[User]\nusername=alice\n", State::NoUser, ""},
        {"[UserInfo]\n", State::NoUser, ""},
        {"[UserInfo]\npassword=\npermissions=1\n", State::NoUser, ""},
        {"[UserInfo]\nusername=\nPlaintextPassword=x\n", State::NoUser, ""},
        {"[UserInfo]\nusername= \t\n", State::NoUser, ""},
        {"[UserInfo]\nusername=alice\n\0"s, State::NoUser, ""},
        {"[UserInfo\nusername=alice\n", State::NoUser, ""},
    };
    for (const Case& c : cases) {
        const oxUserFile::Content content = oxUserFile::Parse(c.text);
        EXPECT_EQ(c.state, content.state) << c.text;
        EXPECT_EQ(c.name, content.record.name) << c.text;
    }
}

TEST_F(UserFile, WhichPasswordCounts) {
    const std::string sealed = Sealed("secret");
    const std::string damaged = (sealed[9] == 'A' ? "B" : "A") + sealed.substr(1);
    struct Case {
        std::string keys;
        State state;
        std::string password;
        bool isPlaintext;
    };
    const Case cases[] = {
        {"password=" + sealed, State::User, "secret", false},
        {"password=" + sealed + "\r", State::User, "secret", false},
        {"PASSWORD = " + sealed + " ", State::User, "secret", false},
        {"password=" + Sealed(""), State::User, "", false},
        {"password=" + Sealed(" &=+%\xC3\xA9"), State::User, " &=+%\xC3\xA9", false},
        {"password=" + Sealed(std::string(351, 'p')), State::User, std::string(351, 'p'), false},
        {"password=" + Sealed(std::string(352, 'p')), State::Undecipherable, "", false},
        {"password=" + damaged, State::Undecipherable, "", false},
        {"password=secret", State::Undecipherable, "", false},
        {"password=" + sealed + "\nPlaintextPassword=other", State::User, "secret", false},
        {"PlaintextPassword=other\npassword=" + sealed, State::User, "secret", false},
        {"password=" + sealed + "\nPlaintextPassword=" + std::string(41, 'p'), State::User, "secret", false},
        {"password=" + damaged + "\nPlaintextPassword=other", State::Undecipherable, "", false},
        {"", State::User, "", false},
        {"password=", State::User, "", false},
        {"password=\nPlaintextPassword=other", State::User, "other", true},
        {"PlaintextPassword=other", State::User, "other", true},
        {"plaintextpassword = other \r", State::User, "other", true},
        {"PlaintextPassword=", State::User, "", true},
        {"PlaintextPassword=a=b;c#d", State::User, "a=b;c#d", true},
        {"PlaintextPassword=" + std::string(39, 'p'), State::User, std::string(39, 'p'), true},
        {"PlaintextPassword=" + std::string(40, 'p'), State::User, std::string(40, 'p'), true},
        {"PlaintextPassword=" + std::string(41, 'p'), State::PlaintextTooLong, "", true},
        {"PlaintextPassword=" + std::string(5000, 'p'), State::PlaintextTooLong, "", true},
        {"PlaintextPassword=" + std::string(38, 'p') + "\xC3\xA9", State::User, std::string(38, 'p') + "\xC3\xA9",
         true},
        {"PlaintextPassword=" + std::string(39, 'p') + "\xC3\xA9", State::PlaintextTooLong, "", true},
    };
    for (const Case& c : cases) {
        const oxUserFile::Content content = oxUserFile::Parse("[UserInfo]\nusername=alice\n" + c.keys + "\n");
        EXPECT_EQ(c.state, content.state) << c.keys;
        EXPECT_EQ("alice", content.record.name) << c.keys;
        EXPECT_EQ(c.password, content.record.password) << c.keys;
        EXPECT_EQ(c.isPlaintext, content.isPlaintext) << c.keys;
    }
}

TEST_F(UserFile, WithoutTheKeyAPasswordIsUndecipherableAndNoneIsNone) {
    const std::string sealed = Sealed("secret");
    SetEncryptionKeyFile(m_scratch.File("missing.key"));
    EXPECT_EQ(State::Undecipherable, oxUserFile::Parse("[UserInfo]\nusername=a\npassword=" + sealed).state);
    EXPECT_EQ(State::User, oxUserFile::Parse("[UserInfo]\nusername=a").state);
    EXPECT_FALSE(std::filesystem::exists(m_scratch.File("missing.key")));
}

TEST_F(UserFile, TheOtherValues) {
    struct Case {
        std::string keys;
        std::uint32_t permissions;
        std::string text1;
        std::string text2;
    };
    const Case cases[] = {
        {"", 0, "", ""},
        {"permissions=3", 3, "", ""},
        {"Permissions = 0x11 ", 17, "", ""},
        {"permissions=-1", 0xFFFFFFFFu, "", ""},
        {"permissions=2147483647", 0x7FFFFFFFu, "", ""},
        {"permissions=-2147483648", 0x80000000u, "", ""},
        {"permissions=", 0, "", ""},
        {"permissions=all", 0, "", ""},
        {"permissions=1\npermissions=2", 2, "", ""},
        {"logfileurl=/x?a=b", 0, "/x?a=b", ""},
        {"maxprofiles=7", 0, "", "7"},
        {"maxprofiles= 7 \nlogfileurl= /x \npermissions=1", 1, "/x", "7"},
        {"logfileurl=" + std::string(4095, 'u'), 0, std::string(4095, 'u'), ""},
        {"logfileurl=" + std::string(5000, 'u'), 0, std::string(4095, 'u'), ""},
    };
    for (const Case& c : cases) {
        const oxUserFile::Content content = oxUserFile::Parse("[UserInfo]\nusername=alice\n" + c.keys + "\n");
        EXPECT_EQ(State::User, content.state);
        EXPECT_EQ(c.permissions, content.record.permissions) << c.keys;
        EXPECT_EQ(c.text1, content.record.text1) << c.keys;
        EXPECT_EQ(c.text2, content.record.text2) << c.keys;
    }
}

TEST_F(UserFile, WhatIsComposedReadsBack) {
    for (const std::size_t length : {0u, 1u, 40u, 41u, 350u, 351u}) {
        for (const std::uint32_t permissions : {0u, 1u, 0x7FFFFFFFu, 0x80000000u, 0xFFFFFFFFu}) {
            oxUserRecord record = Record("alice;#[x] \xC3\xA9", std::string(length, '='), permissions);
            record.text1 = "http://x/?a=b&c";
            record.text2 = "12";
            const oxUserFile::Content content = oxUserFile::Parse(Composed("", record));
            EXPECT_EQ(State::User, content.state);
            EXPECT_EQ(record, content.record);
            EXPECT_FALSE(content.isPlaintext);
        }
    }
}

TEST_F(UserFile, ComposingWritesTheKeysAndNothingElse) {
    std::string text = Composed("", Record("alice", "secret", 3));
    const std::string sealed = text.substr(text.find("password=") + 9, 63);
    EXPECT_EQ("[UserInfo]\nusername=alice\npassword=" + sealed + "\npermissions=3\n", text);
    std::string clear;
    EXPECT_TRUE(oxDecrypt(sealed, clear));
    EXPECT_EQ("secret", clear);

    oxUserRecord record = Record("alice");
    record.text1 = "/x";
    text = Composed("", record);
    EXPECT_NE(std::string::npos, text.find("\npermissions=0\nlogfileurl=/x\n"));
    EXPECT_EQ(std::string::npos, text.find("maxprofiles"));
    record.text1 = "";
    record.text2 = "7";
    text = Composed(text, record);
    EXPECT_EQ(std::string::npos, text.find("logfileurl")) << "an empty text has no key";
    EXPECT_NE(std::string::npos, text.find("maxprofiles=7\n"));
}

TEST_F(UserFile, ComposingKeepsWhatItDoesNotKnow) {
    const std::string text = Composed(
        "; by hand\n[Other]\nkey=value\npassword=kept\nPlaintextPassword=kept\n[UserInfo]\n# about alice\n"
        "UserName=alice\nUser1=x\nplaintextPASSWORD=clear\nemail=a@b\npermissions=9\n[Last]\nz=1\n; the end\n",
        Record("alice", "secret", 3));
    oxConfig config;
    ASSERT_TRUE(config.OpenText(text));
    EXPECT_EQ("value", config.GetText("Other", "key", ""));
    EXPECT_EQ("kept", config.GetText("Other", "password", ""));
    EXPECT_EQ("kept", config.GetText("Other", "PlaintextPassword", ""));
    EXPECT_EQ("x", config.GetText("UserInfo", "User1", ""));
    EXPECT_EQ("a@b", config.GetText("UserInfo", "email", ""));
    EXPECT_EQ("1", config.GetText("Last", "z", ""));
    EXPECT_EQ("3", config.GetText("UserInfo", "permissions", ""));
    EXPECT_FALSE(config.HasKey("UserInfo", "PlaintextPassword"));
    for (const char* comment : {"; by hand\n", "# about alice\n", "; the end\n"})
        EXPECT_NE(std::string::npos, text.find(comment)) << comment;
    EXPECT_EQ(std::string::npos, text.find("clear"));
    EXPECT_LT(text.find("[Other]"), text.find("[UserInfo]"));
    EXPECT_LT(text.find("[UserInfo]"), text.find("[Last]"));
}

TEST_F(UserFile, ComposingRefusesWhatWouldNotBeReadBack) {
    std::string after = "before";
    for (const char* text : {"a\nb", "a\rb"}) {
        oxUserRecord record = Record("alice");
        record.text1 = text;
        EXPECT_FALSE(oxUserFile::Compose("", record, after));
        record = Record("alice");
        record.text2 = text;
        EXPECT_FALSE(oxUserFile::Compose("", record, after));
        EXPECT_FALSE(oxUserFile::Compose("", Record(text), after));
    }
    EXPECT_FALSE(oxUserFile::Compose("[UserInfo]\n\0"s, Record("alice"), after)) << "a damaged file is left as it is";
    m_scratch.Write("damaged.key", "short");
    SetEncryptionKeyFile(m_scratch.File("damaged.key"));
    EXPECT_FALSE(oxUserFile::Compose("", Record("alice", "secret"), after)) << "there is no key";
    EXPECT_EQ("before", after);
}

TEST_F(UserFile, ReadsRegularFilesOfABoundedSize) {
    struct Case {
        std::size_t size;
        int error;
    };
    constexpr Case CASES[] = {
        {0, 0}, {1, 0}, {4095, 0}, {4096, 0}, {4097, 0}, {oxUserFile::MAX_BYTES, 0}, {oxUserFile::MAX_BYTES + 1, EFBIG},
    };
    for (const Case& c : CASES) {
        const std::string content(c.size, 'x');
        std::string text = "old";
        oxFileStamp stamp;
        bool certain = false;
        EXPECT_EQ(c.error, oxUserFile::Read(m_scratch.Write("a.usr", content), text, stamp, certain)) << c.size;
        if (c.error == 0) {
            EXPECT_EQ(content, text);
        }
    }
}

TEST_F(UserFile, WhatCannotBeReadSaysWhy) {
    ASSERT_EQ(0, mkfifo(m_scratch.File("pipe.usr").c_str(), 0600));
    ASSERT_EQ(0, mkdir(m_scratch.File("directory.usr").c_str(), 0700));
    m_scratch.Write("closed.usr", "x");
    ASSERT_EQ(0, chmod(m_scratch.File("closed.usr").c_str(), 0));
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    struct Case {
        const char* name;
        int error;
    };
    constexpr Case CASES[] = {
        {"missing.usr", ENOENT}, {"pipe.usr", EINVAL}, {"directory.usr", EISDIR}, {"closed.usr", EACCES}};
    AsOrdinaryUser([&] {
        for (const Case& c : CASES) {
            std::string text = "old";
            oxFileStamp stamp;
            bool certain = false;
            // The directory of the test is open to all, but a pipe's and a directory's modes are not.
            const int error = oxUserFile::Read(m_scratch.File(c.name), text, stamp, certain);
            EXPECT_TRUE(error == c.error || (error == EACCES && c.error != ENOENT)) << c.name << " " << error;
            EXPECT_EQ("", text);
        }
    });
    std::string text;
    oxFileStamp stamp;
    bool certain = false;
    EXPECT_EQ(EINVAL, oxUserFile::Read(m_scratch.File("pipe.usr"), text, stamp, certain));
    EXPECT_EQ(EISDIR, oxUserFile::Read(m_scratch.File("directory.usr"), text, stamp, certain));
    EXPECT_EQ(ENOENT, oxUserFile::ReadStamp(m_scratch.File("missing.usr"), stamp));
}

TEST_F(UserFile, TheStampTellsAChangedFileFromAnUnchangedOne) {
    const std::string path = m_scratch.Write("a.usr", "one");
    std::string text;
    oxFileStamp first;
    bool certain = true;
    ASSERT_EQ(0, oxUserFile::Read(path, text, first, certain));
    EXPECT_FALSE(certain) << "it was written a moment ago and may change within the same tick of the clock";
    EXPECT_TRUE(Eventually([&] { return oxUserFile::Read(path, text, first, certain) == 0 && certain; }));

    oxFileStamp again;
    ASSERT_EQ(0, oxUserFile::ReadStamp(path, again));
    EXPECT_EQ(first, again);
    m_scratch.Write("a.usr", "two");
    ASSERT_EQ(0, oxUserFile::ReadStamp(path, again));
    EXPECT_NE(first, again) << "the same size, another time";
    m_scratch.Write("b.usr", "two");
    std::filesystem::rename(m_scratch.File("b.usr"), path);
    oxFileStamp third;
    ASSERT_EQ(0, oxUserFile::ReadStamp(path, third));
    EXPECT_NE(again, third) << "another file with the name";
}
