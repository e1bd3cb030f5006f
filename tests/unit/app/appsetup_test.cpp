#include "app/appsetup.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "testing/scratch.h"

namespace {

std::string HostName() {
    char name[260] = {};
    return gethostname(name, 259) == 0 ? name : "localhost";
}

oxxSetup Read(const std::string& text, const std::string& home, const std::string& remote = "") {
    oxConfig config;
    EXPECT_TRUE(config.OpenText("[S]\n" + text));
    return oxxSetup::Read(config, "S", home, home + "/wwwroot", remote);
}

}  // namespace

TEST(OxRemoteAddress, HostAndPort) {
    const struct {
        const char* text;
        std::string host;
        int port;
    } CASES[] = {{"h:1", "h", 1},
                 {"127.0.0.1:9999", "127.0.0.1", 9999},
                 {"a:b:65535", "a:b", 65535},
                 {":80", "", 80},
                 {"9999", HostName(), 9999},
                 {"h:", "h", 0},
                 {"h:0", "h", 0},
                 {"h:65536", "h", 0},
                 {"h:-1", "h", 0},
                 {"h:99999999999999999999", "h", 0},
                 {"h:12x", "h", 12},
                 {"nonsense", HostName(), 0}};
    for (const auto& c : CASES) {
        EXPECT_EQ(oxRemoteAddress::Parse(c.text).host, c.host) << c.text;
        EXPECT_EQ(oxRemoteAddress::Parse(c.text).port, c.port) << c.text;
    }
}

TEST(OxxSetup, Defaults) {
    const Scratch dir;
    const oxxSetup setup = Read("", dir.Path());
    EXPECT_EQ(setup.homeDirectory, dir.Path());
    EXPECT_EQ(setup.documentRoot, dir.File("wwwroot"));
    EXPECT_EQ(setup.scriptsDirectory, dir.File("scripts"));
    EXPECT_EQ(setup.dataDirectory, dir.File("oxm_oxx/datfiles"));
    EXPECT_EQ(setup.includeDirectory, dir.File("ox_script"));
    EXPECT_EQ(setup.usersDirectory, dir.File("oxm_oxx/datfiles/users"));
    EXPECT_EQ(setup.mainSettingsFile, dir.File("oxm_oxx/oxm_oxx.ini"));
    EXPECT_FALSE(setup.osAuthentication);
    EXPECT_EQ(setup.ntDomain, "");
    EXPECT_FALSE(setup.remoteEnabled);
}

TEST(OxxSetup, Values) {
    const Scratch dir;
    const oxxSetup setup = Read(
        "osauthentication=yes\nNTAuthenticationDomain=D\nuserspath=/some/where\nErsTimeout=7\n"
        "ErsRetries=2\n",
        dir.Path(), "h:5");
    EXPECT_TRUE(setup.osAuthentication);
    EXPECT_EQ(setup.ntDomain, "D");
    EXPECT_EQ(setup.usersDirectory, "/some/where");
    EXPECT_TRUE(setup.remoteEnabled);
    EXPECT_EQ(setup.remote.host, "h");
    EXPECT_EQ(setup.remote.port, 5);
    EXPECT_EQ(setup.ersTimeout, 7);
    EXPECT_EQ(setup.ersRetries, 2);
}

TEST(OxxSetup, WaitsBelowOneAreTheDefault) {
    const Scratch dir;
    for (const char* text : {"ErsTimeout=0\nErsRetries=0\n", "ErsTimeout=-3\nErsRetries=-1\n", "ErsTimeout=x\n"}) {
        const oxxSetup setup = Read(text, dir.Path(), "1");
        EXPECT_EQ(setup.ersTimeout, 5) << text;
        EXPECT_EQ(setup.ersRetries, 3) << text;
    }
}

TEST(OxxSetup, RelativeDirectoriesBecomeAbsolute) {
    const Scratch dir;
    const std::filesystem::path before = std::filesystem::current_path();
    std::filesystem::current_path(dir.Path());
    oxConfig config;
    ASSERT_TRUE(config.OpenText("[S]\n"));
    const oxxSetup setup = oxxSetup::Read(config, "S", ".", "./wwwroot", "");
    std::filesystem::current_path(before);
    EXPECT_EQ(setup.homeDirectory, dir.Path());
    EXPECT_EQ(setup.documentRoot, dir.File("wwwroot"));
    EXPECT_EQ(setup.scriptsDirectory, dir.File("scripts"));
}
