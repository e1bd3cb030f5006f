#include "app/scriptingserver.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "testing/engine.h"

namespace {

// What the application was called with last on this thread, and what it does.
struct Call {
    bool called = false;
    std::string contextString;
    bool hasContext = true;
    int command = 0;
    std::string argumentText;
    std::string raw;
    char replyBefore = 'x';
    std::size_t replySize = 0;
    std::string reply;
    int status = 0;
};
thread_local Call call;

int Application(const char* contextString, int command, const char* argumentText, char* reply, std::size_t replySize) {
    call.called = true;
    call.hasContext = contextString != nullptr;
    call.contextString = contextString != nullptr ? contextString : "";
    call.command = command;
    call.argumentText = argumentText;
    call.raw = oxScriptingHttpServer::RawArguments();
    call.replyBefore = reply[0];
    call.replySize = replySize;
    std::snprintf(reply, replySize, "%s", call.reply.c_str());
    return call.status;
}

int OtherApplication(const char*, int, const char*, char*, std::size_t) {
    return 4711;
}

// A script of these moves, run in a directory of its own.
class ScriptRun {
public:
    ScriptRun(oxScriptingHttpServer& server, const std::string& moves) : m_before(std::filesystem::current_path()) {
        std::filesystem::current_path(m_home.Path());  // the output file lies there
        m_script = server.CreateScript(m_home.Path(), m_home.Script("x.pl", moves), "", "");
    }
    ~ScriptRun() { std::filesystem::current_path(m_before); }
    ScriptRun(const ScriptRun&) = delete;
    ScriptRun& operator=(const ScriptRun&) = delete;

    // The status code of the reply.
    int Code() {
        const oxRequest request;
        const auto reply = m_script->GetReply(request);
        return reply ? reply->GetStatus().code : 0;
    }

private:
    const EngineHome m_home;
    const std::filesystem::path m_before;
    std::unique_ptr<oxResource_Script> m_script;
};

class oxScriptingHttpServerTest : public testing::Test {
protected:
    oxScriptingHttpServerTest() { call = Call(); }
    ~oxScriptingHttpServerTest() override { const oxScriptingHttpServer none(nullptr); }

    // The reply to one command of the engine.
    static std::string Run(int command, std::string argumentText, int* status) {
        return oxScriptingHttpServer::ScriptCallback(nullptr, "context", command, argumentText.data(), status);
    }
};

}  // namespace

TEST_F(oxScriptingHttpServerTest, WithoutAnApplicationTheReplyIsEmpty) {
    const oxScriptingHttpServer server(nullptr);
    std::string argument = "a+b%3D";
    int status = 77;
    EXPECT_STREQ(oxScriptingHttpServer::ScriptCallback(nullptr, "context", 20, argument.data(), &status), "");
    EXPECT_EQ(status, 77);
    EXPECT_EQ(argument, "a+b%3D") << "not decoded";
}

TEST_F(oxScriptingHttpServerTest, ApplicationGetsTheDecodedArguments) {
    const oxScriptingHttpServer server(&Application);
    static const struct {
        const char* raw;
        const char* decoded;
    } CASES[] = {{"a+b%3Dc", "a b=c"}, {"", ""}, {"x%", "x%"}, {"%41%zz+", "A%zz "}, {"a%00b", "a"}};
    for (const auto& c : CASES) {
        call = Call();
        call.status = 5;
        call.reply = "reply text";
        int status = 77;
        EXPECT_EQ(Run(99, c.raw, &status), "reply text");
        EXPECT_TRUE(call.called);
        EXPECT_EQ(call.contextString, "context");
        EXPECT_EQ(call.command, 99);
        EXPECT_EQ(call.argumentText, c.decoded);
        EXPECT_EQ(call.raw, c.raw) << "kept beside the decoded text";
        EXPECT_EQ(call.replyBefore, '\0') << "cleared before";
        EXPECT_EQ(call.replySize, 65535u);
        EXPECT_EQ(status, 5);
    }
}

TEST_F(oxScriptingHttpServerTest, ContextStringIsPassedOnAsItIs) {
    const oxScriptingHttpServer server(&Application);
    int status = 0;
    std::string argument = "x";
    oxScriptingHttpServer::ScriptCallback(&status, "a+b%41", 1, argument.data(), &status);
    EXPECT_EQ(call.contextString, "a+b%41");
    oxScriptingHttpServer::ScriptCallback(&status, nullptr, 1, argument.data(), &status);
    EXPECT_FALSE(call.hasContext);
}

TEST_F(oxScriptingHttpServerTest, RawArgumentsLastForOneCommand) {
    const oxScriptingHttpServer server(&Application);
    int status = 0;
    Run(1, "secret=x", &status);
    EXPECT_EQ(call.raw, "secret=x");
    EXPECT_EQ(oxScriptingHttpServer::RawArguments(), "");
}

TEST_F(oxScriptingHttpServerTest, LongestReplyFits) {
    const oxScriptingHttpServer server(&Application);
    call.reply.assign(oxScriptingHttpServer::REPLY_SIZE - 1, 'r');
    int status = 0;
    EXPECT_EQ(Run(1, "x", &status), call.reply);
}

TEST_F(oxScriptingHttpServerTest, LaterConstructionReplacesTheCallback) {
    const oxScriptingHttpServer first(&Application);
    int status = 0;
    Run(1, "x", &status);
    EXPECT_EQ(status, 0);
    const oxScriptingHttpServer second(&OtherApplication);
    Run(1, "x", &status);
    EXPECT_EQ(status, 4711);
    const oxScriptingHttpServer without;
    status = 0;
    Run(1, "x", &status);
    EXPECT_EQ(status, 4711) << "one without a callback leaves it in force";
}

TEST_F(oxScriptingHttpServerTest, ScriptsAreMadeForTheCallback) {
    oxScriptingHttpServer server(&Application);
    const auto script = server.CreateScript("/home", "/home/scripts/x.pl", "/home/ox_script", "username=bob");
    ASSERT_NE(script, nullptr);
    EXPECT_EQ(script->Script(), "/home/scripts/x.pl");
    EXPECT_EQ(script->Parameters(), "username=bob");
    EXPECT_EQ(script->OutputFile(), "") << "nothing runs yet";
}

// A whole run: the engine's command goes through the callback, and its answer comes back.
TEST_F(oxScriptingHttpServerTest, CommandsOfARunningScriptReachTheApplication) {
    oxScriptingHttpServer server(&Application);
    call.reply = "reply=1";
    call.status = -7;
    ScriptRun run(server, "send 99 context a+b\\x253Dc\nexpect -7 reply=1\nexitmsg\n");
    EXPECT_EQ(run.Code(), 200);
    EXPECT_EQ(call.contextString, "context");
    EXPECT_EQ(call.command, 99);
    EXPECT_EQ(call.argumentText, "a b=c");
    EXPECT_EQ(call.raw, "a+b%3Dc");
}

TEST_F(oxScriptingHttpServerTest, ScriptsAreLimitedToTheTimeOfTheSettings) {
    oxScriptingHttpServer server(&Application);
    oxHttpSettings settings;
    settings.logErrors = false;
    settings.scriptTimeout = 1;
    server.Configure(settings);
    ScriptRun run(server, "forever\n");
    EXPECT_EQ(run.Code(), 500);
}

// Every thread has a reply of its own, however long another one takes.
TEST_F(oxScriptingHttpServerTest, RepliesOfThreadsNeverMix) {
    const oxScriptingHttpServer server(
        +[](const char*, int command, const char* argumentText, char* reply, std::size_t replySize) {
            std::snprintf(reply, replySize, "%d:%s:%s", command, argumentText,
                          oxScriptingHttpServer::RawArguments().c_str());
            return command;
        });
    constexpr int THREADS = 8;
    constexpr int ROUNDS = 2000;
    std::atomic<int> mixed{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < THREADS; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < ROUNDS; ++i) {
                const std::string number = std::to_string(t) + "+" + std::to_string(i);
                std::string argument = number;
                int status = -1;
                const char* reply = oxScriptingHttpServer::ScriptCallback(nullptr, "", t, argument.data(), &status);
                std::this_thread::yield();
                const std::string expected = std::to_string(t) + ":" + argument + ":" + number;
                mixed += reply != expected || status != t;
            }
        });
    }
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(mixed, 0);
}
