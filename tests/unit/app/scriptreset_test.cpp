// Scripts that run while the server is set up anew.
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>

#include "app/appfixture.h"
#include "app/fakeservice.h"
#include "app/scriptingserver.h"
#include "remotescript.h"
#include "testing/client.h"
#include "testing/engine.h"
#include "testing/waiting.h"

namespace {

class ScriptsThroughResets : public AppFixture {
protected:
    // Plays the moves to their end; 0 when every answer was the expected one.
    int Play(const std::string& moves) const {
        std::string script = m_home.Script("script.pl", moves);
        char* arguments[] = {nullptr, script.data()};
        return oxRemoteScript(m_home.Path().c_str())
            .Run(2, arguments, nullptr, oxScriptingHttpServer::ScriptCallback, {});
    }
    // A script waits at such a place until it is passed.
    std::string Place(const std::string& name) const {
        return "touch " + m_home.File(name) + "\nwait-file " + m_home.File(name + ".passed") + "\n";
    }
    bool Reached(const std::string& name) const {
        return Eventually([&] { return access(m_home.File(name).c_str(), F_OK) == 0; });
    }
    void Pass(const std::string& name) const { m_home.Files().Write(name + ".passed", ""); }

    const EngineHome m_home;
};

}  // namespace

TEST_F(ScriptsThroughResets, EachCommandGoesByTheSettingsOfItsTime) {
    FakeService service("0|done|EOT");
    const std::string nowhere = "127.0.0.1:" + std::to_string(FreePort());
    SetUp("", nowhere);
    std::jthread script([&] {
        EXPECT_EQ(
            0, Play("send 99 ctx x\nexpect -9 statusdesc=Server is unavailable at " + nowhere + ".\n" + Place("away") +
                    "send 99 ctx x\nexpect -2 -\n" + Place("off") + "send 99 ctx x\nexpect 0 done\nexitmsg\n"));
    });
    EXPECT_TRUE(Reached("away"));
    SetUp("", "");
    Pass("away");
    EXPECT_TRUE(Reached("off"));
    SetUp("", service.Address());
    Pass("off");
    script.join();
    EXPECT_EQ(1u, service.Requests().size());
}

TEST_F(ScriptsThroughResets, ACommandUnderWayKeepsTheSettingsItBeganWith) {
    std::atomic<bool> speak{false};
    FakeService service([&](FakeService::Peer& peer, const std::string&) {
        EXPECT_TRUE(Eventually([&] { return speak.load(); }));
        EXPECT_TRUE(peer.Send("7|late|EOT"));
    });
    SetUp("ErsTimeout=60\nErsRetries=1\n", service.Address());
    std::jthread script(
        [&] { EXPECT_EQ(0, Play("send 99 ctx x\nexpect 7 late\nsend 99 ctx x\nexpect -2 -\nexitmsg\n")); });
    EXPECT_TRUE(Eventually([&] { return !service.Requests().empty(); }));
    SetUp("", "");
    speak = true;
}
