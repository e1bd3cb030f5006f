#include "unix/remoteconfig.h"

#include <gtest/gtest.h>

#include "unix/fakecontrol.h"
#include "unix/testtools.h"

namespace {
using Texts = std::vector<std::string>;
}

TEST(OxRemoteConfig, StopsOnlyWhatItStarted) {
    FakeControl server;
    { oxRemoteConfig config(server); }
    EXPECT_EQ(server.calls, Texts{});
    { oxRemoteConfig(server).Stop(); }
    EXPECT_EQ(server.calls, Texts{});
    {
        oxRemoteConfig config(server);
        config.Start({});
    }
    EXPECT_EQ(server.calls, (Texts{"start", "stop"}));
    server.calls.clear();
    {
        oxRemoteConfig config(server);
        config.Start({});
        config.Stop();
    }
    EXPECT_EQ(server.calls, (Texts{"start", "stop"}));
}

TEST(OxRemoteConfig, DirectoriesThatBeginWithADotAreMadeAbsolute) {
    const ScratchDirectory scratch;
    const std::string here = std::filesystem::current_path();
    std::filesystem::create_directory("wwwroot");
    FakeControl server;
    oxRemoteConfig config(server);
    oxServerArguments arguments;
    arguments.ersAddress = "9999";
    EXPECT_EQ(config.Start(arguments), 0);
    EXPECT_EQ(server.started.baseDirectory, here);
    EXPECT_EQ(server.started.documentRoot, here + "/wwwroot");
    EXPECT_EQ(server.started.ersAddress, "9999");
    arguments.baseDirectory = "home";
    arguments.documentRoot = "/srv/www";
    config.Start(arguments);
    EXPECT_EQ(server.started.baseDirectory, "home");
    EXPECT_EQ(server.started.documentRoot, "/srv/www");
}

TEST(OxRemoteConfig, ThePortIsTheOneListenedOn) {
    FakeControl server;
    oxRemoteConfig config(server);
    EXPECT_EQ(config.GetPort(), 80);
    config.SetPort(81);
    EXPECT_EQ(config.GetPort(), 81);
    EXPECT_EQ(config.Start({}), 0);
    EXPECT_EQ(config.GetPort(), 8081);
    server.status = oxServerControl::STATUS_ERROR;
    EXPECT_EQ(config.GetPort(), -1);
    server.status = oxServerControl::STATUS_STOPPED;
    EXPECT_EQ(config.GetPort(), 8081);
}

TEST(OxRemoteConfig, AFailedStartKeepsThePortAskedFor) {
    FakeControl server;
    server.startResult = oxServerControl::START_FAILED;
    server.status = oxServerControl::STATUS_STOPPED;
    oxRemoteConfig config(server);
    oxServerArguments arguments;
    arguments.defaultPort = 90;
    EXPECT_EQ(config.Start(arguments), -2);
    EXPECT_EQ(config.GetPort(), 90);
    int port = 0;
    EXPECT_EQ(config.Status(port), -1);
}
