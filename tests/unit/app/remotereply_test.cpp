// The remote service's answer, field by field.
#include "app/remotereply.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>

namespace {

using namespace std::string_literals;

// 66 KB: on the heap here.
std::unique_ptr<oxRemoteReply> MakeReply() {
    return std::make_unique<oxRemoteReply>();
}

std::string Repeated(std::size_t count, char c = 'x') {
    return std::string(count, c);
}

}  // namespace

TEST(OxRemoteReply, GoodRepliesGiveStatusAndText) {
    static const struct {
        std::string received;
        int status;
        std::string text;
    } CASES[] = {
        {"0|done|EOT", 0, "done"},
        {"0||EOT", 0, ""},
        {"-256|x|EOT", -256, "x"},
        {"-9|statusdesc=no such server|EOT", -9, "statusdesc=no such server"},
        {"1|EOT|EOT", 1, "EOT"},
        {"1|aEOTb|EOT", 1, "aEOTb"},
        {"7|line\r\nline\n|EOT", 7, "line\r\nline\n"},
        {"7|\x01\xff |EOT", 7, "\x01\xff "},
        // The number is read as far as it goes.
        {"+12|x|EOT", 12, "x"},
        {"  12|x|EOT", 12, "x"},
        {"012|x|EOT", 12, "x"},
        {"12abc|x|EOT", 12, "x"},
        {"0x10|x|EOT", 0, "x"},
        {"abc|x|EOT", 0, "x"},
        {"-|x|EOT", 0, "x"},
        {" |x|EOT", 0, "x"},
        {"2147483647|x|EOT", 2147483647, "x"},
        {"2147483648|x|EOT", 2147483647, "x"},
        {"-2147483648|x|EOT", -2147483647 - 1, "x"},
        {"-999999999999999|x|EOT", -2147483647 - 1, "x"},
        // 16 characters of status
        {"0000000000000042|x|EOT", 42, "x"},
        {"9999999999999999|x|EOT", 2147483647, "x"},
        // A reply ends at its first zero.
        {"0|done|EOT\0"s, 0, "done"},
        {"0|done|EOT\0more|"s, 0, "done"},
        {"0|done|EOT"s + Repeated(70000, '\0'), 0, "done"},
        // The longest: 65534 bytes.
        {"0|" + Repeated(65534 - 6) + "|EOT", 0, Repeated(65534 - 6)},
        {"0|" + Repeated(65534 - 6) + "|EOT\0"s, 0, Repeated(65534 - 6)},
    };
    const auto reply = MakeReply();
    for (const auto& test : CASES) {
        SCOPED_TRACE(test.received.substr(0, 40));
        ASSERT_TRUE(reply->Parse(test.received));
        EXPECT_EQ(test.status, reply->Status());
        EXPECT_TRUE(test.text == reply->Text());
    }
}

TEST(OxRemoteReply, EverythingElseIsRefused) {
    static const std::string CASES[] = {
        "",
        "0",
        "0|",
        "0|done",
        "0|done|",
        "EOT",
        "|EOT",
        "||EOT",
        "|done|EOT",  // no status
        // The end marker is exactly that, with nothing behind it.
        "0|done|EO",
        "0|done|EOX",
        "0|done|eot",
        "0|done| EOT",
        "0|done|EOT ",
        "0|done|EOT\n",
        "0|done|EOT\r\n",
        "0|done|EOT|",
        "0|done|EOTEOT",
        "0|done|EOTxx",
        "0|a|b|EOT",  // nothing is escaped
        "0|done||EOT",
        // 17 characters of status
        "00000000000000042|x|EOT",
        Repeated(17, '9') + "|x|EOT",
        "HTTP/1.0 400 Bad Request\r\nServer: other|x|EOT",
        // cut by a zero
        "\0"s,
        "\0|done|EOT"s,
        "0\0|done|EOT"s,
        "0|do\0ne|EOT"s,
        "0|done\0|EOT"s,
        "0|done|\0EOT"s,
        "0|done|EO\0T"s,
        // 65535 bytes and more
        "0|" + Repeated(65534 - 5) + "|EOT",
        "0|" + Repeated(65535) + "|EOT",
        "0|" + Repeated(65536) + "|EOT",
        "0|" + Repeated(1000000) + "|EOT",
        Repeated(100000, '|'),
        Repeated(100000),
    };
    const auto reply = MakeReply();
    for (const std::string& received : CASES)
        EXPECT_FALSE(reply->Parse(received)) << received.substr(0, 40) << " (" << received.size() << " bytes)";
}

TEST(OxRemoteReply, ForgetsTheReplyBefore) {
    const auto reply = MakeReply();
    ASSERT_TRUE(reply->Parse("1234|a long text|EOT"));
    EXPECT_FALSE(reply->Parse("|x|EOT"));
    EXPECT_FALSE(reply->Parse("5|x|"));
    ASSERT_TRUE(reply->Parse("5||EOT"));
    EXPECT_EQ(5, reply->Status());
    EXPECT_EQ("", reply->Text());
}
