#include "app/scriptingserver.h"

#include <array>
#include <chrono>

#include "app/urltext.h"
#include "platform/encrypt.h"

namespace {

// Made by the first command of a thread: most threads never serve one.
char* ReplyBuffer() {
    using Buffer = std::array<char, oxScriptingHttpServer::REPLY_BUFFER>;
    thread_local const std::unique_ptr<Buffer> buffer = std::make_unique<Buffer>();
    return buffer->data();
}

// The raw text of the command that this thread serves.
class RawText {
public:
    explicit RawText(const char* text) { Current() = text; }
    ~RawText() { WipeText(Current()); }  // may hold a password
    RawText(const RawText&) = delete;
    RawText& operator=(const RawText&) = delete;

    static std::string& Current() {
        thread_local std::string text;
        return text;
    }
};

}  // namespace

oxApplicationCallback oxScriptingHttpServer::m_pScriptCallBack = nullptr;

oxScriptingHttpServer::oxScriptingHttpServer() = default;

oxScriptingHttpServer::oxScriptingHttpServer(oxApplicationCallback callback, const oxClock& clock)
    : oxAuthenticatedHttpServer(clock) {
    m_pScriptCallBack = callback;
}

oxScriptingHttpServer::~oxScriptingHttpServer() {
    while (!Close()) {
    }
}

std::unique_ptr<oxResource_Script> oxScriptingHttpServer::CreateScript(const std::string& homeDirectory,
                                                                       const std::string& scriptFile,
                                                                       const std::string& includeDirectory,
                                                                       const std::string& parameters) {
    auto script = std::make_unique<oxResource_Script>(homeDirectory, scriptFile, includeDirectory, parameters,
                                                      &oxScriptingHttpServer::ScriptCallback);
    script->SetTimeLimit(std::chrono::seconds(Settings()->scriptTimeout));
    return script;
}

const char* oxScriptingHttpServer::ScriptCallback(void*, const char* contextString, int command, char* argumentText,
                                                  int* status) {
    char* const reply = ReplyBuffer();
    reply[0] = '\0';
    if (m_pScriptCallBack == nullptr)
        return reply;
    const RawText raw(argumentText);
    DecodeUrlTextInPlace(argumentText);
    *status = m_pScriptCallBack(contextString, command, argumentText, reply, REPLY_SIZE);
    return reply;
}

const std::string& oxScriptingHttpServer::RawArguments() {
    return RawText::Current();
}
