#include "protocol/credentials.h"

#include <gtest/gtest.h>

#include "protocol/base64.h"

using namespace std::string_view_literals;

namespace {
std::string Basic(std::string_view pair) {
    return "Basic " + oxBase64::Encode(pair);
}
}  // namespace

TEST(OxCredentials, StartEmptyAndTakeTexts) {
    oxCredentials credentials;
    EXPECT_EQ("", credentials.GetUser());
    EXPECT_EQ("", credentials.GetPassword());
    credentials.SetUser("user");
    credentials.SetPassword("pass");
    EXPECT_EQ("user", credentials.GetUser());
    EXPECT_EQ("pass", credentials.GetPassword());
}

TEST(OxCredentials, PairIsSplitAtTheFirstColon) {
    static const struct {
        std::string header;
        std::string_view user;
        std::string_view password;
    } CASES[] = {
        {"Basic dXNlcjpwYXNz", "user", "pass"},
        {"Basic   \t dXNlcjpwYXNz", "user", "pass"},
        {"BasicdXNlcjpwYXNz", "user", "pass"},
        {"Basic dXNlcjpwYXNz\r\nHost: x", "user", "pass"},
        {"Basic QWxhZGRpbjpvcGVuIHNlc2FtZQ==", "Aladdin", "open sesame"},
        {"Basic QWxhZGRpbjpvcGVuIHNlc2FtZQ", "Aladdin", "open sesame"},
        {"Basic Og==", "", ""},
        {"Basic", "", ""},
        {"Basic ", "", ""},
        {"Basic ====", "", ""},
        {Basic("user"), "user", ""},
        {Basic("user:"), "user", ""},
        {Basic(":pass"), "", "pass"},
        {Basic("user:pa:s:s"), "user", "pa:s:s"},
        {Basic("domain\\user:pass"), "domain\\user", "pass"},
        {Basic("x\n1.2.3.4 - root:pass"), "x\n1.2.3.4 - root", "pass"},
        {Basic("us\xc3\xa9r:p\xff"), "us\xc3\xa9r", "p\xff"},
        // A zero byte ends the pair.
        {Basic("admin\0x:pass"sv), "admin", ""},
        {Basic("user:pa\0ss"sv), "user", "pa"},
        {Basic("\0user:pass"sv), "", ""},
    };
    for (const auto& c : CASES) {
        oxCredentials credentials;
        credentials.SetUser("earlier user");
        credentials.SetPassword("earlier password");
        credentials.ParseBasic(c.header);
        EXPECT_EQ(c.user, credentials.GetUser()) << c.header;
        EXPECT_EQ(c.password, credentials.GetPassword()) << c.header;
    }
}

TEST(OxCredentials, OtherSchemesLeaveThemAsTheyAre) {
    for (const char* header : {"basic dXNlcjpwYXNz", "BASIC dXNlcjpwYXNz", "Basi", "", " Basic dXNlcjpwYXNz",
                               "Digest username=\"user\"", "Bearer dXNlcjpwYXNz"}) {
        oxCredentials credentials;
        credentials.ParseBasic(header);
        EXPECT_EQ("", credentials.GetUser()) << header;
        EXPECT_EQ("", credentials.GetPassword()) << header;
        credentials.SetUser("user");
        credentials.SetPassword("pass");
        credentials.ParseBasic(header);
        EXPECT_EQ("user", credentials.GetUser()) << header;
        EXPECT_EQ("pass", credentials.GetPassword()) << header;
    }
}

TEST(OxCredentials, PairOf255IsTakenAndOf256IsNone) {
    const std::string user(100, 'u');
    static const struct {
        std::size_t passwordLength;
        bool taken;
    } CASES[] = {{153, true}, {154, true}, {155, false}, {156, false}, {100000, false}};
    for (const auto& c : CASES) {
        const std::string password(c.passwordLength, 'p');
        oxCredentials credentials;
        credentials.SetUser("earlier user");
        credentials.SetPassword("earlier password");
        credentials.ParseBasic(Basic(user + ':' + password));
        EXPECT_EQ(c.taken ? user : "", credentials.GetUser()) << c.passwordLength;
        EXPECT_EQ(c.taken ? password : "", credentials.GetPassword()) << c.passwordLength;
    }
}

TEST(OxCredentials, LengthIsCountedUpToTheZeroByte) {
    oxCredentials credentials;
    credentials.ParseBasic(Basic("user:pass" + std::string(1, '\0') + std::string(1000, 'x')));
    EXPECT_EQ("user", credentials.GetUser());
    EXPECT_EQ("pass", credentials.GetPassword());
}
