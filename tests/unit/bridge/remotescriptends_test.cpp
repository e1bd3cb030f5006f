// What an engine meets on its pipes after its last word.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <thread>

#include "bridge/scriptrun.h"
#include "testing/waiting.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

// An engine that waits in vain is killed after END_WAIT: well before that it has ended by itself.
constexpr milliseconds AT_ONCE{5000};
static_assert(AT_ONCE < milliseconds(oxRemoteScript::END_WAIT));

// A shell script in the place of the engine.
void InstallEngine(const EngineHome& home, const std::string& text) {
    ASSERT_EQ(0, unlink(home.Engine().c_str()));
    home.Files().Write("ox_script.bin", "#!/bin/sh\n" + text);
    ASSERT_EQ(0, chmod(home.Engine().c_str(), S_IRWXU));
}

}  // namespace

TEST_F(ScriptRun, AfterTheLastWordTheInputHasAnEnd) {
    InstallEngine(m_home, "printf EXIT\ncat | wc -c >" + m_home.File("count") + "\n");
    for (const std::size_t size : {std::size_t{0}, std::size_t{10}, std::size_t{300000}}) {
        oxRemoteScript script(m_home.Path().c_str());
        const auto start = steady_clock::now();
        EXPECT_EQ(0, script.Run(0, nullptr, nullptr, EchoCallback, std::string(size, 'x'))) << size;
        EXPECT_LT(steady_clock::now() - start, AT_ONCE) << size;
        EXPECT_EQ(std::to_string(size) + "\n", m_home.Files().Read("count"));
    }
}

TEST_F(ScriptRun, AfterTheLastWordNobodyReadsTheMessages) {
    const auto start = steady_clock::now();
    EXPECT_EQ(SIGPIPE, Play("exitmsg\nflood 1000000 4096\n").result);
    EXPECT_LT(steady_clock::now() - start, AT_ONCE);
}

TEST_F(ScriptRun, TextForTheInputMayBeNull) {
    InstallEngine(m_home, "printf EXIT\ncat | wc -c >" + m_home.File("count") + "\n");
    const struct {
        const char* text;
        const char* count;
    } cases[] = {{nullptr, "0\n"}, {"", "0\n"}, {"four", "4\n"}};
    for (const auto& c : cases) {
        EXPECT_EQ(0, oxRemoteScript(m_home.Path().c_str()).Run(0, nullptr, nullptr, EchoCallback, c.text));
        EXPECT_EQ(c.count, m_home.Files().Read("count"));
    }
}

// Not with its last word: what it does after that may still need the lock.
TEST_F(ScriptRun, LocksOfAnEngineAreFreeWhenItHasEnded) {
    // Takes the lock for writing, says EXIT, and knows by the end of its input that this was heard.
    InstallEngine(m_home, R"(printf '\075\000\000\0002\000\000\000\000'
head -c 11 >/dev/null
printf EXIT
cat >/dev/null
: >)" + m_home.File("heard") + "\nwhile [ ! -e " +
                              m_home.File("go") + " ]; do sleep 0.01; done\n");
    oxRemoteScript other;
    const auto granted = [&other] {
        int status = 0;
        const std::string answer = other.ServeWriteLock("2", &status);
        EXPECT_EQ(status == 0 ? "OK" : "ERROR", answer);
        return status == 0;
    };
    std::jthread run([this] {
        oxRemoteScript script(m_home.Path().c_str());
        EXPECT_EQ(0, script.Run(0, nullptr, nullptr, EchoCallback, std::string_view()));
        EXPECT_EQ(oxRemoteScript::rwUnlocked, script.GetLockState());
    });
    EXPECT_TRUE(Eventually([this] { return std::filesystem::exists(m_home.File("heard")); }));
    EXPECT_FALSE(Eventually(granted, milliseconds(300)));
    m_home.Files().Write("go", "");
    run.join();
    EXPECT_TRUE(granted());
}
