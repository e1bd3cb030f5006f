#include "http/httpsettings.h"

#include <gtest/gtest.h>

namespace {

oxHttpSettings Read(const std::string& text) {
    oxConfig config;
    EXPECT_TRUE(config.OpenText("[RemoteConfiguration]\n" + text));
    return oxHttpSettings::Read(config, "RemoteConfiguration", "/home", "/home/www", 80);
}

TEST(oxHttpSettings, Defaults) {
    const oxHttpSettings s = Read("");
    EXPECT_EQ(s.webAddress, "");
    EXPECT_EQ(s.port, 80u);
    EXPECT_EQ(s.sessionTimeout, 600);
    EXPECT_TRUE(s.logErrors);
    EXPECT_EQ(s.errorLogName, "ox_remote.err");
    EXPECT_TRUE(s.logging);
    EXPECT_EQ(s.logFileName, "ox_remote.log");
    EXPECT_FALSE(s.noCache);
    EXPECT_EQ(s.maxSessionsPerAddress, 256);
    EXPECT_EQ(s.homeDirectory, "/home");
    EXPECT_EQ(s.documentRoot, "/home/www");
}

TEST(oxHttpSettings, EveryKeyIsRead) {
    const oxHttpSettings s = Read(
        "WebAddress=127.0.0.1\nWebPort=8080\nWebUserTimeout=90\nWebLogErrors=0\nWebErrorLog=/var/e\nWebLogging=no\n"
        "WebLogFileName=a.log\nWebNoCache=1\nWebMaxConnectionsPerAddress=2\n");
    EXPECT_EQ(s.webAddress, "127.0.0.1");
    EXPECT_EQ(s.port, 8080u);
    EXPECT_EQ(s.sessionTimeout, 90);
    EXPECT_FALSE(s.logErrors);
    EXPECT_EQ(s.errorLogName, "/var/e");
    EXPECT_FALSE(s.logging);
    EXPECT_EQ(s.logFileName, "a.log");
    EXPECT_TRUE(s.noCache);
    EXPECT_EQ(s.maxSessionsPerAddress, 2);
}

TEST(oxHttpSettings, TimeoutIsNeverBelowThirtySeconds) {
    struct Case {
        const char* text;
        int seconds;
    };
    for (const Case& c : {Case{"10", 30}, {"0", 30}, {"-5", 30}, {"29", 30}, {"30", 30}, {"31", 31}, {"600", 600}})
        EXPECT_EQ(Read(std::string("WebUserTimeout=") + c.text).sessionTimeout, c.seconds) << c.text;
}

TEST(oxHttpSettings, PortThatIsNoneCountsAsNotGiven) {
    struct Case {
        const char* text;
        std::uint32_t port;
    };
    for (const Case& c : {Case{"0", 0}, {"-1", 0}, {"65536", 0}, {"65535", 65535}, {"1", 1}, {"web", 80}, {"", 80}})
        EXPECT_EQ(Read(std::string("WebPort=") + c.text).port, c.port) << c.text;
}

}  // namespace
