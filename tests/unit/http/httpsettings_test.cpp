#include "http/httpsettings.h"

#include <gtest/gtest.h>

#include "http/httpserver.h"

namespace {

TEST(oxHttpSettings, NamesAndDefaultTexts) {
    const struct {
        const char* name;
        const char* text;
    } cases[] = {
        {oxHttpServer::m_sINI_KEY_WEB_ADDRESS, "WebAddress"},
        {oxHttpServer::m_sINI_KEY_WEB_PORT, "WebPort"},
        {oxHttpServer::m_sINI_KEY_LOG_FILE_NAME, "WebLogFileName"},
        {oxHttpServer::m_sINI_KEY_WEB_LOGGING, "WebLogging"},
        {oxHttpServer::m_sINI_KEY_USER_TIMEOUT, "WebUserTimeout"},
        {oxHttpServer::m_sINI_KEY_LOG_ERRORS, "WebLogErrors"},
        {oxHttpServer::m_sINI_KEY_LOG_ERROR_FILE, "WebErrorLog"},
        {oxHttpServer::m_sINI_KEY_MAX_SESSIONS_PER_ADDRESS, "WebMaxConnectionsPerAddress"},
        {oxHttpServer::m_sINI_KEY_NO_CACHE, "WebNoCache"},
        {oxHttpServer::m_sINI_KEY_SCRIPT_TIMEOUT, "WebScriptTimeout"},
        {oxHttpServer::m_sDEFAULT_LOG_FILE_NAME, "ox_remote.log"},
        {oxHttpServer::m_sERROR_LOG_NAME, "ox_remote.err"},
        {oxHttpServer::m_sDEFAULT_WEB_ADDRESS, ""},
    };
    for (const auto& c : cases)
        EXPECT_STREQ(c.name, c.text);
}

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

TEST(oxHttpSettings, MessageLogAlwaysHasAName) {
    const oxHttpSettings s = Read("WebErrorLog=\nWebLogFileName=\n");
    EXPECT_EQ(s.errorLogName, "ox_remote.err");
    EXPECT_EQ(s.logFileName, "") << "without a name no access log is kept";
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
