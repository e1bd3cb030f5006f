#include <sys/resource.h>

#include <algorithm>
#include <csignal>
#include <map>
#include <string>

#include "app/scriptcommands.h"
#include "app/urltext.h"

namespace {

// While it lives, no file of this process can grow beyond that many bytes.
class LargestFile {
public:
    explicit LargestFile(std::size_t bytes) : m_handler(std::signal(SIGXFSZ, SIG_IGN)) {
        EXPECT_EQ(getrlimit(RLIMIT_FSIZE, &m_before), 0);
        const rlimit limit{.rlim_cur = bytes, .rlim_max = m_before.rlim_max};
        EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
    }
    ~LargestFile() {
        setrlimit(RLIMIT_FSIZE, &m_before);
        std::signal(SIGXFSZ, m_handler);
    }
    LargestFile(const LargestFile&) = delete;
    LargestFile& operator=(const LargestFile&) = delete;

private:
    void (*m_handler)(int);
    rlimit m_before{};
};

}  // namespace

TEST_F(ScriptCommands, Table) {
    const struct {
        int command;
        const char* arguments;
        std::string answer;
    } CASES[] = {
        {22, "", "0|" + USERS},
        {20, "username=carol&password=c&permissions=5&maxprofiles=7&logfileurl=/l", "0|"},
        {20, "username=carol&password=c&permissions=5", "-1|"},
        {20, "username=&password=c", "-1|"},
        {20, "password=c", "-1|"},
        {20, "username=..%2F..%2Fevil:&password=c", "-1|"},
        {20, "username=d&password=p", "0|"},
        {24, "username=d", "0|permissions=0"},
        {21, "username=d", "0|"},
        {20, "username=d", "0|"},
        {24, "username=d", "0|permissions=0"},
        {21, "username=d", "0|"},
        {20, "username=e&permissions=0&permissions=1", "-1|"},
        {20, "username=e&permissions=many", "-1|"},
        {20, "username=e&logfileurl=a%0Ab", "-1|"},
        {20, "username=e%0Apermissions%3D1&password=c", "-1|"},
        {20, "username=e%0D&password=c", "-1|"},
        {20, "username=%09e&password=c", "-1|"},
        {20, "username=e%00&password=c", "-1|"},
        {20, "username=e%7F&password=c", "-1|"},
        {23, "username=bob%0A&permissions=1", "-1|"},
        {21, "username=bob%00", "-1|"},
        {24, "username=bob%00", "-1|"},
        {30, "username=bob%1F", "-1|"},
        {31, "username=bob%0D&profile_id=sales", "-1|"},
        {22, "", "0|" + USERS + "&u4=carol&p4=5"},
        {22, "username=a&username=b", "0|" + USERS + "&u4=carol&p4=5"},
        {22, "permissions=many", "0|" + USERS + "&u4=carol&p4=5"},
        {22, "%zz%00&&==", "0|" + USERS + "&u4=carol&p4=5"},
        {24, "username=carol", "0|permissions=5"},
        {24, "username=nobody", "-1|"},
        {24, "", "-1|"},
        {23, "username=carol&permissions=6", "0|"},
        {24, "username=carol", "0|permissions=6"},
        {23, "permissions=7", "-1|"},
        {23, "username=nobody&permissions=1", "0|"},
        {24, "username=nobody", "-1|"},
        {21, "username=carol", "0|"},
        {21, "username=carol", "-1|"},
        {21, "", "-1|"},
        {22, "", "0|" + USERS},
        {30, "username=bob", "0|profile_id=sales.wlp&profile_id=support.wlp"},
        {30, "username=admin", "0|profile_id=sales.wlp&profile_id=support.wlp"},
        {30, "username=alice", "0|"},
        {30, "", "-1|"},
        {31, "username=bob&profile_id=sales", "0|"},
        {31, "username=bob&profile_id=sales.wlp", "0|"},
        {31, "username=alice&profile_id=sales", "-1|"},
        {31, "username=admin&profile_id=sales", "0|"},
        {31, "username=admin", "-1|"},
        {31, "profile_id=sales", "-1|"},
        {31, "username=nobody&profile_id=sales", "-1|"},
        {31, "username=bob&profile_id=none", "-1|"},
        {31, "username=admin&profile_id=none", "-1|"},
        {31, "", "-1|"},
        {32, "profile_id=sales", "0|"},
        {33, "profile_id=sales", "0|"},
        {34, "profile_id=sales", "0|"},
        {35, "profile_id=sales", "0|"},
        {32, "", "-1|"},
        {33, "", "-1|"},
        {34, "", "-1|"},
        {35, "", "-1|"},
        {32, "profile=sales", "-1|"},
        {33, "username=bob", "-1|"},
        {34, "profile_id", "-1|"},
        {34, "profile_id=sales&profile_id=sales", "-1|"},
        {71, "decode=", "-1|"},
        {71, "decode=nonsense", "-1|"},
        {71, "", "-1|"},
        {19, "a=b", "-2|"},
        {25, "a=b", "-2|"},
        {60, "1", "-2|"},
        {72, "", "-2|"},
        {99, "a=b", "-2|"},
        {-5, "", "-2|"},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(Do(c.command, c.arguments), c.answer) << c.command << " " << c.arguments;
}

TEST_F(ScriptCommands, UserThatIsAddedWithoutAPasswordIsOpenToAll) {
    EXPECT_EQ(Do(20, "username=e"), "0|");
    EXPECT_TRUE(Accepts("e", ""));
    EXPECT_TRUE(Accepts("e", "any"));
    EXPECT_EQ(Do(20, "username=f&password=p"), "0|");
    EXPECT_TRUE(Accepts("f", "p"));
    EXPECT_FALSE(Accepts("f", ""));
}

// A file without a usable name is nobody's, so nothing that is done to nobody reaches it.
TEST_F(ScriptCommands, NobodysFilesSurviveWhatIsDoneToNobody) {
    const std::string place = "oxm_oxx/datfiles/users/";
    dir.Write(place + "damaged.usr", "no settings\n");
    dir.Write(place + "nameless.usr", "[UserInfo]\npermissions=1\nPlaintextPassword=x\n");
    dir.Write(place + "empty.usr", "[UserInfo]\nusername=\n");
    dir.Write(place + "nul.usr", std::string("[UserInfo]\nusername=a\0b\n", 24));
    const auto texts = [&] {
        std::map<std::string, std::string> all;
        for (const auto& entry : std::filesystem::directory_iterator(dir.File(place)))
            all[entry.path().filename()] = dir.Read(place + entry.path().filename().string());
        return all;
    };
    const auto before = texts();
    ASSERT_EQ(before.size(), 7u);
    const struct {
        int command;
        const char* arguments;
        const char* answer;
    } CASES[] = {
        {21, "", "-1|"},
        {21, "username=", "-1|"},
        {21, "username", "-1|"},
        {21, "x=y", "-1|"},
        {21, "username=%00", "-1|"},
        {21, "username%3D", "-1|"},
        {20, "username=&password=x", "-1|"},
        {20, "password=x&permissions=1", "-1|"},
        {23, "username=&password=x&logfileurl=/x&permissions=1&maxprofiles=1", "0|"},
        {23, "password=x&permissions=1", "-1|"},
        {24, "username=", "-1|"},
    };
    for (const auto& c : CASES) {
        EXPECT_EQ(Do(c.command, c.arguments), c.answer) << c.command << " " << c.arguments;
        EXPECT_TRUE(texts() == before) << c.command << " " << c.arguments;
    }
    EXPECT_EQ(Do(22, ""), "0|" + USERS);
}

TEST_F(ScriptCommands, ValuesSmuggleInNoKeys) {
    EXPECT_EQ(Do(23, "username=bob&password=x%26permissions%3D1"), "0|");
    EXPECT_EQ(Do(24, "username=bob"), "0|permissions=0");
    EXPECT_TRUE(Accepts("bob", "x&permissions=1"));
}

TEST_F(ScriptCommands, TextThatWasEscapedAsAWhole) {
    EXPECT_EQ(Do(24, "username%3Dbob"), "0|permissions=0");
    EXPECT_EQ(Do(23, "username%3Dbob%26permissions%3D3"), "0|");
    EXPECT_EQ(Do(24, "username=bob"), "0|permissions=3");
}

TEST_F(ScriptCommands, ArgumentsInTheFirstStringCountWhenTheSecondIsEmpty) {
    EXPECT_EQ(Do(24, "", "username=alice"), "0|permissions=2");
    EXPECT_EQ(Do(24, "username=bob", "username=alice"), "0|permissions=0");
    EXPECT_EQ(Do(35, "", "profile_id=sales"), "-1|") << "only for what is answered here";
}

TEST_F(ScriptCommands, EncryptionThereAndBack) {
    for (const char* text : {"abc", "", "a=b", "pass%20word", "a+b", "\xc3\xa4&%25"}) {
        const std::string sealed = Do(70, "secret=" + std::string(text));
        ASSERT_EQ(sealed.substr(0, 2), "0|") << text;
        EXPECT_EQ(sealed.find_first_of("+/=& "), std::string::npos);
        EXPECT_EQ(Do(71, "decode=" + sealed.substr(2)), "0|" + DecodeUrlText(text)) << text;
    }
    EXPECT_EQ(Do(71, "decode=" + Do(70, "bare").substr(2)), "0|bare");
    EXPECT_EQ(Do(71, "decode=" + Do(70, "a=b=c").substr(2)), "0|b=c");
    EXPECT_EQ(Do(71, "decode=" + Do(70, "secret=abcdef").substr(2), "", 4), "0|abc") << "cut to the buffer";
}

TEST_F(ScriptCommands, SmallBuffers) {
    EXPECT_EQ(Do(30, "username=bob", "", 100), "0|");
    EXPECT_EQ(Do(30, "username=bob", "", 101), "0|profile_id=sales.wlp");
    EXPECT_EQ(Do(22, "", "", 99), "0|");
    EXPECT_EQ(Do(22, "", "", 100), "0|u1=admin&p1=1");
    EXPECT_EQ(Do(24, "username=bob", "", 5), "-1|");
    EXPECT_EQ(Do(70, "a=b", "", 10), "-1|");
    const auto status = [](const std::string& answer) { return answer.substr(0, answer.find('|')); };
    for (const int command : {20, 21, 22, 23, 24, 30, 31, 35, 71, 99}) {
        const std::string answer = Do(command, "", "", 1);
        EXPECT_EQ(status(answer) + "|", answer) << command;
        EXPECT_EQ(status(Do(command, "")), status(answer)) << command;
    }
}

TEST_F(ScriptCommands, WhatFitsExactly) {
    EXPECT_EQ(Do(24, "username=bob", "", 14), "0|permissions=0");
    EXPECT_EQ(Do(24, "username=bob", "", 13), "-1|");
    const std::string sealed = Do(70, "secret=abc").substr(2);
    EXPECT_EQ(Do(70, "secret=abc", "", sealed.size() + 1).substr(0, 2), "0|");
    EXPECT_EQ(Do(70, "secret=abc", "", sealed.size()), "-1|");
    for (const std::size_t size : {0u, 1u, 2u, 3u, 4u})
        EXPECT_EQ(Do(71, "decode=" + sealed, "", size), "0|" + std::string("abc").substr(0, size == 0 ? 0 : size - 1));
}

TEST_F(ScriptCommands, NothingAtAllIsEncryptedToo) {
    const std::string sealed = Do(70, "");
    ASSERT_EQ(sealed.substr(0, 2), "0|");
    EXPECT_GT(sealed.size(), 2u);
    EXPECT_EQ(Do(71, "decode=" + sealed.substr(2)), "0|");
}

TEST_F(ScriptCommands, WhatRepliesNothingNeedsNoRoom) {
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}}) {
        const struct {
            int command;
            const char* arguments;
        } CASES[] = {{20, "username=x&password=p&permissions=1"},
                     {23, "username=x&permissions=2"},
                     {31, "username=bob&profile_id=sales"},
                     {32, "profile_id=sales"},
                     {21, "username=x"}};
        for (const auto& c : CASES)
            EXPECT_EQ(Do(c.command, c.arguments, "", size), "0|") << c.command << " " << size;
    }
}

TEST_F(ScriptCommands, FurtherTextsLastThroughChangesOfOthers) {
    EXPECT_EQ(Do(23, "username=bob&logfileurl=/x&maxprofiles=7"), "0|");
    EXPECT_EQ(Do(23, "username=alice&permissions=9"), "0|");
    const std::string text = dir.Read("oxm_oxx/datfiles/users/bob.usr");
    EXPECT_NE(text.find("logfileurl"), std::string::npos) << text;
    EXPECT_NE(text.find("/x"), std::string::npos) << text;
    EXPECT_NE(text.find("maxprofiles"), std::string::npos) << text;
}

// Where there is room for one change only, it is the first one's.
TEST_F(ScriptCommands, ChangesOfAUserComeInTheirOrderWhateverThatOfTheArguments) {
    static const struct {
        const char* name;
        std::string first;
        std::string second;
    } CASES[] = {
        {"password, logfileurl", "password=" + std::string(300, 'p'), "logfileurl=/" + std::string(300, 'l')},
        {"logfileurl, permissions", "logfileurl=/" + std::string(300, 'l'), "permissions=2147483647"},
        {"permissions, maxprofiles", "permissions=2147483647", "maxprofiles=7"},
    };
    const std::string file = "oxm_oxx/datfiles/users/bob.usr";
    const auto size = [&] { return dir.Read(file).size(); };
    const auto holds = [&](const std::string& argument) {
        const std::string key = argument.substr(0, argument.find('='));
        const std::string value = argument.substr(key.size() + 1);
        if (key == "password")
            return Accepts("bob", value);
        oxConfig stored;
        return stored.Open(dir.File(file)) && stored.GetText("UserInfo", key.c_str(), "") == value;
    };
    for (const auto& c : CASES) {
        SCOPED_TRACE(c.name);
        AddUser("bob", "b", 0);
        ASSERT_EQ(Do(23, "username=bob&password=b&permissions=0"), "0|");
        const std::string before = dir.Read(file);
        std::size_t room = 0;
        for (const std::string& one : {c.first, c.second}) {
            ASSERT_EQ(Do(23, "username=bob&" + one), "0|");
            ASSERT_TRUE(holds(one));
            ASSERT_GT(size(), before.size());
            room = std::max(room, size());
            dir.Write(file, before);
        }
        {
            const LargestFile limit(room);
            EXPECT_EQ(Do(23, c.second + "&username=bob&" + c.first), "0|") << "a change that is refused is no failure";
        }
        EXPECT_TRUE(holds(c.first));
        EXPECT_FALSE(holds(c.second));
        EXPECT_LE(size(), room);
    }
}

TEST_F(ScriptCommands, PermissionsOpenNoProfileToWhomItsListLeavesOut) {
    EXPECT_EQ(Do(23, "username=alice&permissions=3"), "0|");
    EXPECT_EQ(Do(31, "username=alice&profile_id=sales"), "-1|");
    EXPECT_EQ(Do(30, "username=alice"), "0|");
}

TEST_F(ScriptCommands, RefreshTakesTheChangedFile) {
    dir.Write("profiles/sales.wlp", "[Profile]\nUsers=alice\n");
    EXPECT_EQ(Do(31, "username=alice&profile_id=sales"), "-1|");
    EXPECT_EQ(Do(34, "profile_id=sales"), "0|");
    EXPECT_EQ(Do(31, "username=alice&profile_id=sales"), "0|");
    EXPECT_EQ(Do(31, "username=bob&profile_id=sales"), "-1|");
    dir.Write("oxm_oxx/datfiles/users/x.usr", "[Profile]\nUsers=alice\n");
    for (const char* name : {"../oxm_oxx/datfiles/users/x.usr", "..%2Fsales.wlp", ".hidden.wlp", "none"})
        EXPECT_EQ(Do(35, std::string("profile_id=") + name), "0|") << name;
    EXPECT_EQ(Do(30, "username=admin"), "0|profile_id=sales.wlp&profile_id=support.wlp");
}
