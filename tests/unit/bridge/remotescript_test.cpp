// Single messages: their bounds, their answers, the lock commands, the assertions.
#include "remotescript.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstring>
#include <string>
#include <thread>

#include "platform/file.h"
#include "testing/waiting.h"

namespace {

std::string Number(std::int32_t number) {
    std::string bytes(sizeof number, '\0');
    std::memcpy(bytes.data(), &number, sizeof number);
    return bytes;
}

std::string MessageOf(int command, const std::string& first, const std::string& second) {
    std::string message = Number(command) + first + '\0' + second + '\0';
    message.resize(std::max(message.size(), oxRemoteScript::MIN_MESSAGE));
    return message;
}

std::string AnswerOf(int status, const std::string& text) {
    return Number(status) + Number(static_cast<std::int32_t>(text.size())) + text + '\0';
}

struct Call {
    const void* context;
    std::string contextString;
    int command;
    std::string argumentText;
};
thread_local std::vector<Call> calls;

const char* Record(void* context, const char* contextString, int command, char* argumentText, int* status) {
    EXPECT_EQ(0, *status);
    calls.push_back({context, contextString, command, argumentText});
    *status = command == 21 ? -1 : 0;
    return command == 22 ? "" : "reply";
}

const char* NoReply(void*, const char*, int, char*, int*) {
    return nullptr;
}

// The bytes that a message is answered with.
std::string Ask(oxRemoteScript& script, std::string message, oxScriptCallback callback = Record) {
    int ends[2];
    EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
    const UniqueFd reader(ends[0]);
    UniqueFd writer(ends[1]);
    script.PerformCallback(writer.Get(), message.data(), static_cast<int>(message.size()), callback);
    writer.Reset();
    std::string answer;
    std::array<char, 65536> block;
    for (ssize_t count; (count = read(reader.Get(), block.data(), block.size())) > 0;)
        answer.append(block.data(), static_cast<std::size_t>(count));
    return answer;
}

TEST(OxRemoteScript, EnginePathIsDirectoryAndEngine) {
    EXPECT_STREQ("/opt/x/ox_script.bin", oxRemoteScript("/opt/x").EnginePath());
    EXPECT_STREQ("/ox_script.bin", oxRemoteScript("").EnginePath());
    EXPECT_STREQ("/ox_script.bin", oxRemoteScript(nullptr).EnginePath());
    EXPECT_STREQ("", oxRemoteScript().EnginePath());
    const std::string longest(oxRemoteScript::MAX_ENGINE_PATH - std::strlen("/ox_script.bin"), 'd');
    EXPECT_EQ(longest + "/ox_script.bin", oxRemoteScript(longest.c_str()).EnginePath());
    // A path that was cut would name another program.
    EXPECT_STREQ("", oxRemoteScript((longest + "d").c_str()).EnginePath());
}

TEST(OxRemoteScript, RunsWithADirectoryAreCounted) {
    const std::uint32_t before = oxRemoteScript::PipeIDs();
    const oxRemoteScript bare;
    EXPECT_EQ(before, oxRemoteScript::PipeIDs());
    const oxRemoteScript first("x");
    EXPECT_EQ(before + 1, oxRemoteScript::PipeIDs());
    const oxRemoteScript second(nullptr);
    EXPECT_EQ(before + 2, oxRemoteScript::PipeIDs());
    EXPECT_STREQ("./.oxscriptcallback:", oxRemoteScript::m_sPipeNamePrefix);
}

TEST(OxRemoteScript, MessagesReachTheCallbackInTheirPlaces) {
    const struct {
        std::string message;
        Call expected;
        std::string answer;
    } cases[] = {
        {MessageOf(24, "ctx", "username=alice"), {nullptr, "ctx", 24, "username=alice"}, AnswerOf(0, "reply")},
        {MessageOf(20, "", "a=b"), {nullptr, "", 20, "a=b"}, AnswerOf(0, "reply")},
        {MessageOf(21, "first", ""), {nullptr, "first", 21, ""}, AnswerOf(-1, "reply")},
        {MessageOf(22, "c", "d e"), {nullptr, "c", 22, "d e"}, AnswerOf(0, "")},
        {MessageOf(-5, "", ""), {nullptr, "", -5, ""}, AnswerOf(0, "reply")},
        // What some program prints by mistake is a message too.
        {"Hello, world", {nullptr, "o, world", 0x6C6C6548, ""}, AnswerOf(0, "reply")},
        // Nothing ends them but the cleared buffer.
        {Number(70) + "k=vvv", {nullptr, "k=vvv", 70, ""}, AnswerOf(0, "reply")},
        {Number(70) + "k" + '\0' + "vvv", {nullptr, "k", 70, "vvv"}, AnswerOf(0, "reply")},
        {Number(70) + "k" + '\0' + "v" + '\0' + "more", {nullptr, "k", 70, "v"}, AnswerOf(0, "reply")},
    };
    oxRemoteScript script;
    for (const auto& c : cases) {
        calls.clear();
        EXPECT_EQ(c.answer, Ask(script, c.message));
        ASSERT_EQ(1u, calls.size());
        EXPECT_EQ(c.expected.context, calls[0].context);
        EXPECT_EQ(c.expected.contextString, calls[0].contextString);
        EXPECT_EQ(c.expected.command, calls[0].command);
        EXPECT_EQ(c.expected.argumentText, calls[0].argumentText);
    }
}

TEST(OxRemoteScript, MessagesOutOfBoundsAreNotAnswered) {
    constexpr std::size_t MAX = oxRemoteScript::MAX_MESSAGE;
    const std::string head = Number(24);
    const struct {
        std::string message;
        std::string fault;  // empty: answered
    } cases[] = {
        {"", "it is too short"},
        {"E", "it is too short"},
        {head + '\0' + '\0', "it is too short"},
        {head + "1234", "it is too short"},
        {head + "12345", ""},
        {MessageOf(24, "", ""), ""},
        // The first text and both zeros just fit.
        {head + std::string(MAX - 6, 'a'), ""},
        {head + std::string(MAX - 5, 'a'), "its second text has no end"},
        {head + std::string(MAX - 4, 'a'), "its first text has no end"},
        {head + '\0' + std::string(MAX - 6, 'b'), ""},
        {head + '\0' + std::string(MAX - 5, 'b'), "its second text has no end"},
        {head + "a" + '\0' + std::string(MAX - 7, 'b'), ""},
        {head + "a" + '\0' + std::string(MAX - 6, 'b'), "its second text has no end"},
        {head + std::string(MAX - 3, '\0'), "it is too long"},
    };
    oxRemoteScript script;
    for (const auto& c : cases) {
        const std::string what = std::to_string(c.message.size()) + " bytes";
        testing::internal::CaptureStderr();
        const std::string answer = Ask(script, c.message);
        const std::string line = testing::internal::GetCapturedStderr();
        EXPECT_EQ(c.fault.empty() ? AnswerOf(0, "reply") : "", answer) << what << c.fault;
        EXPECT_EQ(c.fault.empty()
                      ? ""
                      : "A message of the scripting engine (" + what + ") is not answered: " + c.fault + ".\n",
                  line);
    }
}

TEST(OxRemoteScript, NothingOfTheLastMessageIsSeenInTheNext) {
    oxRemoteScript script;
    Ask(script, MessageOf(24, "long first text", "long second text"));
    calls.clear();
    Ask(script, Number(24) + "short");
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ("short", calls[0].contextString);
    EXPECT_EQ("", calls[0].argumentText);
}

TEST(OxRemoteScript, AnswerToAnEngineThatIsGoneIsNoError) {
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC));
    const UniqueFd writer(ends[1]);
    UniqueFd(ends[0]).Reset();
    std::string message = MessageOf(24, "", "");
    oxRemoteScript().PerformCallback(writer.Get(), message.data(), static_cast<int>(message.size()), Record);
    // The signal of the broken pipe was swallowed as well.
    sigset_t pending;
    ASSERT_EQ(0, sigpending(&pending));
    EXPECT_EQ(0, sigismember(&pending, SIGPIPE));
}

TEST(OxRemoteScript, AnswerWaitsForRoomInThePipe) {
    static const std::string large(300000, 'x');
    int ends[2];
    ASSERT_EQ(0, pipe2(ends, O_CLOEXEC | O_NONBLOCK));
    const UniqueFd reader(ends[0]);
    UniqueFd writer(ends[1]);
    std::jthread server([&] {
        std::string message = MessageOf(24, "", "");
        oxRemoteScript().PerformCallback(writer.Get(), message.data(), static_cast<int>(message.size()),
                                         [](void*, const char*, int, char*, int*) { return large.c_str(); });
        writer.Reset();
    });
    std::string answer;
    std::array<char, 5000> block;
    EXPECT_TRUE(Eventually([&] {
        ssize_t count;
        while ((count = read(reader.Get(), block.data(), block.size())) > 0)
            answer.append(block.data(), static_cast<std::size_t>(count));
        return count == 0;
    }));
    EXPECT_EQ(AnswerOf(0, large), answer);
}

// The lock.

const std::string READ_OK = AnswerOf(0, "TOKEN RETREIVED SUCCESSFULLY");
const std::string WRITE_OK = AnswerOf(0, "OK");
const std::string REFUSED = AnswerOf(-1, "ERROR");

TEST(OxRemoteScriptLock, CommandsOfOneRun) {
    const auto unlocked = oxRemoteScript::rwUnlocked;
    const auto reading = oxRemoteScript::rwReading;
    const auto writing = oxRemoteScript::rwWriting;
    struct Step {
        int command;
        const char* arguments;
        const std::string& answer;
        oxRemoteScript::LockState state;
    };
    const std::vector<Step> cases[] = {
        {{60, "1", READ_OK, reading}, {60, "0", READ_OK, unlocked}},
        {{60, "2", READ_OK, reading}, {60, "0", READ_OK, unlocked}},
        {{61, "1", WRITE_OK, writing}, {61, "0", WRITE_OK, unlocked}},
        {{61, "2", WRITE_OK, writing}, {61, "0", WRITE_OK, unlocked}},
        // The number counts, not what follows it.
        {{60, "01 and more", READ_OK, reading}, {60, "00", READ_OK, unlocked}},
        // Given back without being held: the same words.
        {{60, "0", READ_OK, unlocked}, {61, "0", WRITE_OK, unlocked}},
        {{60, "1", READ_OK, reading}, {61, "0", WRITE_OK, reading}, {61, "2", REFUSED, reading}},
        {{61, "1", WRITE_OK, writing}, {60, "0", READ_OK, writing}, {60, "2", REFUSED, writing}},
        // Waits that would never end.
        {{60, "1", READ_OK, reading}, {61, "1", REFUSED, reading}},
        {{61, "1", WRITE_OK, writing}, {60, "1", REFUSED, writing}},
        {{61, "1", WRITE_OK, writing}, {61, "1", REFUSED, writing}, {61, "2", REFUSED, writing}},
        // Readers count.
        {{60, "1", READ_OK, reading},
         {60, "1", READ_OK, reading},
         {60, "0", READ_OK, unlocked},
         {61, "2", REFUSED, unlocked},
         {61, "1", REFUSED, unlocked},
         {60, "0", READ_OK, unlocked},
         {61, "2", WRITE_OK, writing}},
    };
    for (const auto& steps : cases) {
        std::string told;
        oxRemoteScript script;
        for (const Step& step : steps) {
            told += std::to_string(step.command) + " " + step.arguments + "; ";
            EXPECT_EQ(step.answer, Ask(script, MessageOf(step.command, step.arguments, ""))) << told;
            EXPECT_EQ(step.state, script.GetLockState()) << told;
        }
    }
    // All of them gave back what they held.
    oxRemoteScript last;
    EXPECT_EQ(WRITE_OK, Ask(last, MessageOf(61, "2", "")));
}

TEST(OxRemoteScriptLock, RunsExcludeEachOther) {
    oxRemoteScript one;
    oxRemoteScript other;
    EXPECT_EQ(WRITE_OK, Ask(one, MessageOf(61, "2", "")));
    EXPECT_EQ(REFUSED, Ask(other, MessageOf(60, "2", "")));
    EXPECT_EQ(REFUSED, Ask(other, MessageOf(61, "2", "")));
    EXPECT_EQ(WRITE_OK, Ask(other, MessageOf(61, "0", "")));  // not its own: nothing is given back
    EXPECT_EQ(REFUSED, Ask(other, MessageOf(61, "2", "")));
    EXPECT_EQ(WRITE_OK, Ask(one, MessageOf(61, "0", "")));
    EXPECT_EQ(READ_OK, Ask(other, MessageOf(60, "2", "")));
    EXPECT_EQ(READ_OK, Ask(one, MessageOf(60, "2", "")));
    EXPECT_EQ(REFUSED, Ask(one, MessageOf(61, "2", "")));
}

TEST(OxRemoteScriptLock, StopEndsTheWaitForIt) {
    for (const char* command : {"60", "61"}) {
        oxRemoteScript holder;
        EXPECT_EQ(WRITE_OK, Ask(holder, MessageOf(61, "2", "")));
        std::atomic<bool> stop{false};
        std::string answer;
        std::jthread waiter([&] {
            oxRemoteScript script;
            script.SetLimits({&stop, {}});
            answer = Ask(script, MessageOf(std::atoi(command), "1", ""));
        });
        stop = true;
        waiter.join();
        EXPECT_EQ(REFUSED, answer);
    }
}

// Programming errors of scripts.

class OxRemoteScriptDeathTest : public testing::Test {
protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(OxRemoteScriptDeathTest, WrongLockMessagesEndTheProcess) {
    const std::string digit = R"(\(__ctype_b\[\(int\) \(\(\*pszArgs\)\)\] & \(unsigned short int\) _ISdigit\))";
    const struct {
        int command;
        const char* arguments;
        int line;
        std::string text;
    } cases[] = {
        {60, "x", 275, digit}, {60, "", 275, digit},   {60, "-1", 275, digit},
        {60, "9", 297, "0"},   {60, "3", 297, "0"},    {60, "99999999999", 297, "0"},
        {61, "x", 243, digit}, {61, " 1", 243, digit}, {61, "3", 265, "0"},
    };
    for (const auto& c : cases) {
        oxRemoteScript script;
        EXPECT_DEATH(Ask(script, MessageOf(c.command, c.arguments, "")),
                     R"(: \./ox_remote_dll/src/remotescript:)" + std::to_string(c.line) +
                         (c.command == 60 ? ": .*ServeReadLock.*: Assertion `" : ": .*ServeWriteLock.*: Assertion `") +
                         c.text + "' failed")
            << c.command << " " << c.arguments;
    }
}

TEST_F(OxRemoteScriptDeathTest, NullArgumentsEndTheProcess) {
    oxRemoteScript script;
    int status = 0;
    EXPECT_DEATH(script.ServeReadLock(nullptr, &status), R"(remotescript:274: .*Assertion `pszArgs' failed)");
    EXPECT_DEATH(script.ServeWriteLock(nullptr, &status), R"(remotescript:242: .*Assertion `pszArgs' failed)");
}

TEST_F(OxRemoteScriptDeathTest, CallbackWithoutResultEndsTheProcess) {
    oxRemoteScript script;
    EXPECT_DEATH(Ask(script, MessageOf(24, "", ""), NoReply), R"(remotescript:311: .*Assertion `pszResult' failed)");
}

TEST_F(OxRemoteScriptDeathTest, RunWithALockHeldEndsTheProcess) {
    oxRemoteScript script("/nowhere");
    Ask(script, MessageOf(60, "1", ""));
    EXPECT_DEATH(script.Run(0, nullptr, nullptr, Record, ""),
                 R"(remotescript:364: .*Assertion `m_locked == rwUnlocked' failed)");
}

}  // namespace
