#include "app/scriptarguments.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>
#include <vector>

using namespace std::string_literals;

namespace {

constexpr const char* KEYS[] = {"username",   "password",   "permissions", "maxprofiles",
                                "logfileurl", "profile_id", "decode"};

// What is known of a text, as "key=value|", in the order of KEYS; "bad" for a bad one.
std::string Dump(const std::string& raw) {
    const oxScriptArguments arguments(raw);
    if (!arguments.IsGood())
        return "bad";
    std::string dump;
    for (const char* key : KEYS) {
        if (arguments.Has(key))
            dump += std::string(key) + "=" + arguments.GetText(key, "absent") + "|";
        else
            EXPECT_EQ(arguments.GetText(key, "absent"), "absent");
    }
    return dump;
}

}  // namespace

TEST(oxScriptArguments, TextsAreTakenApart) {
    static const struct {
        std::string raw;
        std::string dump;
    } CASES[] = {
        {"", ""},
        {"username=bob", "username=bob|"},
        {"username=bob&password=x", "username=bob|password=x|"},
        {"password=x&username=bob", "username=bob|password=x|"},
        {"username=", "username=|"},
        {"username=&password=", "username=|password=|"},
        // A key without "=" counts as absent, empty pairs are none.
        {"username", ""},
        {"username&password=x", "password=x|"},
        {"password=x&username", "password=x|"},
        {"&&username=bob&&", "username=bob|"},
        {"=bob&username=x", "username=x|"},
        {"=", ""},
        {"&", ""},
        // At the first "=" only.
        {"password=a=b=c", "password=a=b=c|"},
        {"decode==", "decode==|"},
        // Split first, then decoded.
        {"username=bob&password=x%26permissions%3D1", "username=bob|password=x&permissions=1|"},
        {"username=a%3Db", "username=a=b|"},
        {"username=a+b%2Bc", "username=a b+c|"},
        {"user%6Eame=bob", "username=bob|"},
        {"username%3Dbob&password=x", "password=x|"},
        {"password=%", "password=%|"},
        {"password=%2526", "password=%26|"},
        {"profile_id=sales.wlp", "profile_id=sales.wlp|"},
        {"profile_id=..%2Fusers", "profile_id=../users|"},
        // Escaped as a whole.
        {"username%3Dbob", "username=bob|"},
        {"username%3Dbob%26password%3Dx", "username=bob|password=x|"},
        {"username%3Dbob&password%3Dx", "username=bob|password=x|"},
        {"username%3dbob%26password%3da+b%253Dc", "username=bob|password=a b%3Dc|"},
        {"nothing%26here", ""},
        // Keys are exact, and others do not matter.
        {"Username=bob&USERNAME=x& username=y", ""},
        {"other=1&other=2&username=bob", "username=bob|"},
        {"user\0name=bob&decode=x"s, "decode=x|"},
        {"username%00x=bob&decode=x", "decode=x|"},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(Dump(c.raw), c.dump) << c.raw;
}

TEST(oxScriptArguments, KnownKeyThatComesTwiceIsBad) {
    for (const char* key : KEYS) {
        const std::string name = key;
        EXPECT_EQ(Dump(name + "=1&" + name + "=1"), "bad");
        EXPECT_EQ(Dump(name + "=1&x=y&" + name + "=2"), "bad");
        EXPECT_EQ(Dump(name + "%3D1%26" + name + "%3D1"), "bad");
        EXPECT_EQ(Dump("%" + std::string(name[0] < 'p' ? "6" : "7") + "0123456789abcdef"[name[0] % 16] +
                       name.substr(1) + "=1&" + name + "=2"),
                  "bad")
            << "an escaped key is the same key";
        EXPECT_NE(Dump(name + "=1&" + name), "bad") << "without a value it is absent";
    }
    EXPECT_EQ(Dump("username=e&permissions=0&permissions=1"), "bad");
}

TEST(oxScriptArguments, ControlCharactersAreBadInNamesAndUrlsOnly) {
    constexpr char DIGITS[] = "0123456789abcdef";
    for (int byte = 0; byte < 256; ++byte) {
        const std::string escaped{'%', DIGITS[byte / 16], DIGITS[byte % 16]};
        const bool control = byte < 32 || byte == 127;
        for (const char* key : {"username", "logfileurl"}) {
            for (const std::string& value : {"a" + escaped + "b", escaped, "a" + escaped}) {
                EXPECT_EQ(Dump(std::string(key) + "=" + value) == "bad", control) << key << value;
                EXPECT_EQ(Dump(std::string(key) + "%3D" + value) == "bad", control) << key << value;
            }
        }
        for (const char* key : {"password", "profile_id", "decode"})
            EXPECT_NE(Dump(std::string(key) + "=a" + escaped + "b"), "bad") << key << escaped;
    }
    EXPECT_EQ(Dump("username=a\nb"), "bad") << "not escaped at all";
    EXPECT_EQ(Dump("username=a\0b"s), "bad");
    EXPECT_EQ(Dump("logfileurl=x%0Apermissions=1"), "bad");
    EXPECT_EQ(Dump("logfileurl=x%250A"), "logfileurl=x%0A|");
}

TEST(oxScriptArguments, NulEndsOtherValues) {
    EXPECT_EQ(Dump("password=a%00b&decode=x"), "password=a|decode=x|");
    EXPECT_EQ(Dump("password=%00"), "password=|");
    EXPECT_EQ(Dump("password%3Da%00b%26decode%3Dx"), "password=a|decode=x|");
}

TEST(oxScriptArguments, NumbersAreWholeAndLimited) {
    constexpr int MAX = std::numeric_limits<int>::max();
    constexpr int MIN = std::numeric_limits<int>::min();
    static const struct {
        const char* value;
        bool good;
        int number;
    } CASES[] = {
        {"0", true, 0},
        {"1", true, 1},
        {"-1", true, -1},
        {"%2B7", true, 7},
        {"+7", true, 7},  // a blank before it
        {"%09%0a%0b%0c%0d%207", true, 7},
        {"0017", true, 17},
        {"-0", true, 0},
        {"2147483647", true, MAX},
        {"2147483648", true, MAX},
        {"4294967295", true, MAX},
        {"99999999999999999999999999", true, MAX},
        {"-2147483648", true, MIN},
        {"-2147483649", true, MIN},
        {"-99999999999999999999999999", true, MIN},
        {"", false, 0},
        {"+", false, 0},
        {"-", false, 0},
        {"%2B", false, 0},
        {"--1", false, 0},
        {"- 1", false, 0},
        {"-%2B1", false, 0},
        {"7+", false, 0},
        {"7 8", false, 0},
        {"7x", false, 0},
        {"x7", false, 0},
        {"0x10", false, 0},
        {"1.5", false, 0},
        {"1e3", false, 0},
        {"7%00", false, 0},
        {"7%00x", false, 0},
    };
    for (const char* key : {"permissions", "maxprofiles"}) {
        for (const auto& c : CASES) {
            const oxScriptArguments arguments(std::string(key) + "=" + c.value);
            EXPECT_EQ(arguments.IsGood(), c.good) << c.value;
            EXPECT_TRUE(arguments.Has(key));
            if (c.good) {
                EXPECT_EQ(arguments.GetInt(key, 77), c.number) << c.value;
            }
        }
    }
}

TEST(oxScriptArguments, AbsentKeysGiveTheDefault) {
    const oxScriptArguments arguments("username=bob&permissions=3");
    EXPECT_TRUE(arguments.IsGood());
    EXPECT_EQ(arguments.GetInt(oxScriptArguments::KEY_PERMISSIONS), 3);
    EXPECT_EQ(arguments.GetInt(oxScriptArguments::KEY_MAXPROFILES), 0);
    EXPECT_EQ(arguments.GetInt(oxScriptArguments::KEY_MAXPROFILES, -5), -5);
    EXPECT_EQ(arguments.GetInt(oxScriptArguments::KEY_USERNAME, -5), -5) << "no number";
    EXPECT_EQ(arguments.GetText(oxScriptArguments::KEY_PASSWORD), "");
    EXPECT_EQ(arguments.GetText(oxScriptArguments::KEY_PASSWORD, "x"), "x");
    EXPECT_FALSE(arguments.Has("other"));
}
