#include <sys/resource.h>

#include <algorithm>
#include <csignal>
#include <cstring>

#include "app/appfixture.h"
#include "app/fakeservice.h"
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

// What a command answers: "status|reply".
class ScriptCommands : public AppFixture {
protected:
    std::string Do(int command, const std::string& arguments, const std::string& context = {},
                   std::size_t size = 65535) {
        std::string buffer(size + 1, '#');
        const int status =
            oxxHttpServer::ScriptCallback(context.c_str(), command, arguments.c_str(), buffer.data(), size);
        EXPECT_EQ(buffer[size], '#') << "wrote behind its buffer";
        return IntToText(status) + "|" + buffer.substr(0, std::strlen(buffer.c_str()));
    }
    bool Accepts(const std::string& name, const std::string& password) {
        return oxxHttpServer::m_oxxUserBase.Authenticate(name, password, nullptr);
    }
};

const std::string USERS = "u1=admin&p1=1&u2=alice&p2=2&u3=bob&p3=0";

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
        {32, "profile_id=sales", "0|"},
        {33, "profile_id=sales", "0|"},
        {34, "profile_id=sales", "0|"},
        {35, "profile_id=sales", "0|"},
        {35, "", "-1|"},
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

TEST_F(ScriptCommands, OutsideCallbackGetsWhatNobodyElseTakes) {
    server.reset();
    server = std::make_unique<oxxHttpServer>(
        [](const char* context, int command, const char* arguments, char* reply, std::size_t size) {
            std::snprintf(reply, size, "%s,%d,%s", context, command, arguments);
            return command + 1;
        },
        clock);
    SetUp("", "");
    EXPECT_EQ(Do(99, "a=b", "ctx"), "100|ctx,99,a=b");
    EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), "36|ctx,35,profile_id=sales");
    EXPECT_EQ(Do(22, ""), "0|" + USERS);
    // The bounds of a context are those of the remote service's line.
    EXPECT_EQ(Do(99, "c|d", "a|b\n\x7f"), "100|a|b\n\x7f,99,c|d");
    EXPECT_EQ(Do(35, "profile_id=sales", "a|b"), "36|a|b,35,profile_id=sales");
}

TEST_F(ScriptCommands, UnreachableRemoteService) {
    SetUp("", "127.0.0.1:1");
    const std::string unavailable = "-9|statusdesc=Server is unavailable at 127.0.0.1:1.";
    EXPECT_EQ(Do(99, "a=b"), unavailable);
    EXPECT_EQ(Do(35, "profile_id=sales"), unavailable);
    EXPECT_EQ(Do(22, ""), "0|" + USERS) << "what is answered here does not need it";
    EXPECT_EQ(Do(99, "a=b", "a|b"), "-1|");
    EXPECT_EQ(Do(99, "a=b", "a\nb"), "-1|");
    EXPECT_EQ(Do(99, "a=b", "a\x7f"), "-1|");
    EXPECT_EQ(Do(35, "profile_id=sales", "a\x7f"), "-1|");
    EXPECT_EQ(Do(99, "a=b", "a ~\x80\xff"), unavailable) << "no control character";
}

// Its status for that is not one that a service may give.
TEST_F(ScriptCommands, ServiceThatCallsItselfUnreachableIsTakenAtItsWord) {
    FakeService service("-256|x|EOT");
    SetUp("", service.Address());
    EXPECT_EQ(Do(99, "a=b"), "-9|statusdesc=Server is unavailable at " + service.Address() + ".");
    EXPECT_EQ(Do(35, "profile_id=sales"), "-9|statusdesc=Server is unavailable at " + service.Address() + ".");
    EXPECT_EQ(service.Requests().size(), 2u);
}
