// Runs of the test engine, for the tests of oxRemoteScript.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <string_view>
#include <vector>

#include "remotescript.h"
#include "testing/engine.h"

// Answers with all that it was given, so that a mixed-up answer shows.
inline const char* EchoCallback(void* context, const char* contextString, int command, char* argumentText,
                                int* status) {
    thread_local std::string text;
    text = std::to_string(command) + "|" + contextString + "|" + argumentText +
           (context == nullptr ? "" : static_cast<const char*>(context));
    *status = command == 9 ? -9 : 0;
    return text.c_str();
}

class ScriptRun : public testing::Test {
protected:
    struct Outcome {
        int result;
        std::string output;
    };

    // One run with the usual eight arguments.
    Outcome Play(const std::string& moves, std::string_view data = {}, const oxScriptLimits& limits = {},
                 oxScriptCallback callback = EchoCallback, const std::string& name = "script") const {
        std::string script = m_home.Script(name + ".pl", moves);
        std::string output = m_home.Files().Write(name + ".out", "");
        std::string marker = "OX_WEBSERVER";
        std::string directory = m_home.Path();
        std::string length = std::to_string(data.size());
        std::string parameters = "parameters";
        char* arguments[] = {marker.data(), script.data(),    nullptr,       output.data(),
                             nullptr,       directory.data(), length.data(), parameters.data()};
        oxRemoteScript run(m_home.Path().c_str());
        run.SetLimits(limits);
        const int result = run.Run(8, arguments, nullptr, callback, data);
        EXPECT_EQ(oxRemoteScript::rwUnlocked, run.GetLockState());
        return {result, m_home.Files().Read(name + ".out")};
    }

    // What the function writes on standard error.
    template <typename Function>
    static std::string StandardError(Function function) {
        testing::internal::CaptureStderr();
        function();
        return testing::internal::GetCapturedStderr();
    }

    const EngineHome m_home;
};
