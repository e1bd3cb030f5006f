// The commands of scripts that others carry out: the remote service, or the program around the server.
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "app/fakeservice.h"
#include "app/scriptcommands.h"

namespace {

using Lines = std::vector<std::string>;
using Peer = FakeService::Peer;
using ScriptForwarding = ScriptCommands;

int Outside(const char* context, int command, const char* arguments, char* reply, std::size_t size) {
    std::snprintf(reply, size, "%s,%d,%s", context, command, arguments);
    return command + 1;
}

}  // namespace

TEST_F(ScriptForwarding, OutsideCallbackGetsWhatNobodyElseTakes) {
    server.reset();
    server = std::make_unique<oxxHttpServer>(&Outside, clock);
    SetUp("", "");
    EXPECT_EQ(Do(99, "a=b", "ctx"), "100|ctx,99,a=b");
    EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), "36|ctx,35,profile_id=sales");
    EXPECT_EQ(Do(22, ""), "0|" + USERS);
    // The bounds of a context are those of the remote service's line.
    EXPECT_EQ(Do(99, "c|d", "a|b\n\x7f"), "100|a|b\n\x7f,99,c|d");
    EXPECT_EQ(Do(35, "profile_id=sales", "a|b"), "36|a|b,35,profile_id=sales");
}

TEST_F(ScriptForwarding, UnreachableRemoteService) {
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
TEST_F(ScriptForwarding, ServiceThatCallsItselfUnreachableIsTakenAtItsWord) {
    FakeService service("-256|x|EOT");
    SetUp("", service.Address());
    EXPECT_EQ(Do(99, "a=b"), "-9|statusdesc=Server is unavailable at " + service.Address() + ".");
    EXPECT_EQ(Do(35, "profile_id=sales"), "-9|statusdesc=Server is unavailable at " + service.Address() + ".");
    EXPECT_EQ(service.Requests().size(), 2u);
}

TEST_F(ScriptForwarding, OutsideCallbackServesAlsoWithoutAServer) {
    server.reset();
    server = std::make_unique<oxxHttpServer>(&Outside, clock);
    server.reset();
    ASSERT_EQ(oxxHttpServer::m_poxxHttpServer, nullptr);
    EXPECT_EQ(Do(99, "a=b", "ctx"), "100|ctx,99,a=b");
    EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), "36|ctx,35,profile_id=sales");
    EXPECT_EQ(Do(24, "username=bob"), "0|permissions=0");
    server = std::make_unique<oxxHttpServer>(nullptr, clock);
    server.reset();
    EXPECT_EQ(Do(99, "a=b", "ctx"), "-2|");
    EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), "0|");
}

TEST_F(ScriptForwarding, RemoteServiceComesBeforeTheOutsideCallback) {
    server.reset();
    server = std::make_unique<oxxHttpServer>(&Outside, clock);
    FakeService service("4|the service's|EOT");
    SetUp("", service.Address());
    EXPECT_EQ(Do(99, "a=b", "ctx"), "4|the service's");
    EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), "4|the service's");
    SetUp("", "127.0.0.1:1");
    EXPECT_EQ(Do(99, "a=b", "ctx"), "-9|statusdesc=Server is unavailable at 127.0.0.1:1.");
}

// The service looks at the map while it answers.
TEST_F(ScriptForwarding, ProfileIsReadAgainBeforeTheServiceIsAsked) {
    FakeService service([](Peer& peer, const std::string& request) {
        const std::string command = request.substr(request.find('|') + 1, 2);
        const bool refreshed = oxxHttpServer::m_ProfileMap.IsPermitted("user" + command, "sales");
        peer.Send("-" + command + (refreshed ? "|refreshed" : "|not yet") + "|EOT");
    });
    SetUp("", service.Address());
    Lines requests;
    for (const int command : {32, 33, 34, 35}) {
        const std::string number = IntToText(command);
        dir.Write("profiles/sales.wlp", "[Profile]\nUsers=user" + number + "\n");
        EXPECT_FALSE(oxxHttpServer::m_ProfileMap.IsPermitted("user" + number, "sales"));
        EXPECT_EQ(Do(command, "profile_id=sales&more=a b", "ctx"), "-" + number + "|refreshed");
        requests.push_back("ctx|" + number + "|profile_id=sales&more=a b|EOT");
    }
    EXPECT_EQ(service.Requests(), requests);
}

TEST_F(ScriptForwarding, RefusedArgumentsAreNotForwarded) {
    FakeService service("0|done|EOT");
    SetUp("", service.Address());
    for (const int command : {32, 33, 34, 35}) {
        for (const char* arguments : {"", "profile_id", "username=bob", "profile_id=a&profile_id=b"})
            EXPECT_EQ(Do(command, arguments, "ctx"), "-1|") << command << " " << arguments;
    }
    EXPECT_EQ(service.Requests(), Lines{});
}

TEST_F(ScriptForwarding, UnreachableServiceIsNamedAsFarAsTheReplyGoes) {
    SetUp("", "127.0.0.1:1");
    const std::string text = "statusdesc=Server is unavailable at 127.0.0.1:1.";
    for (const std::size_t size : {std::size_t{0}, std::size_t{1}, std::size_t{2}, std::size_t{10}, text.size(),
                                   text.size() + 1, text.size() + 2}) {
        const std::string expected = "-9|" + (size == 0 ? "" : text.substr(0, size - 1));
        EXPECT_EQ(Do(99, "a=b", "", size), expected) << size;
        EXPECT_EQ(Do(35, "profile_id=sales", "", size), expected) << size;
    }
}

TEST_F(ScriptForwarding, ServiceThatAnswersNonsenseCountsAsUnreachable) {
    for (const char* answer : {"", "nonsense", "\x80\xff\x01", "0|half an answer", "0|no marker|", "0|x|EOTxx"}) {
        FakeService service(answer);
        SetUp("", service.Address());
        const std::string unavailable = "-9|statusdesc=Server is unavailable at " + service.Address() + ".";
        EXPECT_EQ(Do(99, "a=b", "ctx"), unavailable) << answer;
        EXPECT_EQ(Do(35, "profile_id=sales", "ctx"), unavailable) << answer;
        EXPECT_EQ(service.Requests(), Lines({"ctx|99|a=b|EOT", "ctx|35|profile_id=sales|EOT"}));
    }
}
