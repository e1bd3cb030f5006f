// What an engine meets on its pipes after its last word.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "bridge/scriptrun.h"

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

// An engine that waits in vain is killed after END_WAIT: well before that it has ended by itself.
constexpr milliseconds AT_ONCE{5000};
static_assert(AT_ONCE < milliseconds(oxRemoteScript::END_WAIT));

}  // namespace

TEST_F(ScriptRun, AfterTheLastWordTheInputHasAnEnd) {
    const std::string engine = m_home.Engine();
    const std::string count = m_home.File("count");
    ASSERT_EQ(0, unlink(engine.c_str()));
    m_home.Files().Write("ox_script.bin", "#!/bin/sh\nprintf EXIT\ncat | wc -c >" + count + "\n");
    ASSERT_EQ(0, chmod(engine.c_str(), S_IRWXU));
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
