// The link between script resources and the application's commands.
#pragma once

#include <cstddef>
#include <memory>
#include <string>

#include "http/authenticatedserver.h"
#include "resources/script.h"

// Carries out one command of a script: the context string, the command code, the decoded argument text, and the buffer
// for the reply with its size. The result is the status that the script gets.
using oxApplicationCallback = int (*)(const char* contextString, int command, const char* argumentText, char* reply,
                                      std::size_t replySize);

// Thread rules: as its base. Commands run on session threads, several at once, each with a reply buffer of its own.
class oxScriptingHttpServer : public oxAuthenticatedHttpServer {
public:
    static constexpr std::size_t REPLY_BUFFER = 65536;
    static constexpr std::size_t REPLY_SIZE = 65535;  // what the application is told

    // Leaves the callback of an earlier construction in force.
    oxScriptingHttpServer();
    // A later construction replaces the callback of an earlier one; none may be constructed while scripts run.
    explicit oxScriptingHttpServer(oxApplicationCallback callback, const oxClock& clock = oxClock::System());
    ~oxScriptingHttpServer() override;

    // A run of the script file with these parameters, limited to the time that the settings give it.
    // Also what builds a resource from four given values: the engine's directory, the script, and the two texts.
    std::unique_ptr<oxResource_Script> CreateScript(const std::string& homeDirectory, const std::string& scriptFile,
                                                    const std::string& includeDirectory, const std::string& parameters);

    // What the engine's commands reach. The text that is returned belongs to the calling thread and is good until its
    // next command. Without an application callback it is empty, and the status stays as it was.
    static const char* ScriptCallback(void* context, const char* contextString, int command, char* argumentText,
                                      int* status);
    // The argument text of the command that the calling thread serves, as it came, before decoding; empty between
    // commands.
    static const std::string& RawArguments();

    static oxApplicationCallback m_pScriptCallBack;  // what a construction was last given
};
