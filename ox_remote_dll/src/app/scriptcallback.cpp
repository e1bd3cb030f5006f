// The commands that scripts call back with.
#include <algorithm>
#include <cstdio>
#include <string>
#include <string_view>

#include "app/oxxhttpserver.h"
#include "app/scriptarguments.h"
#include "app/urltext.h"
#include "platform/encrypt.h"
#include "platform/text.h"

namespace {

enum Command {
    ADD_USER = 20,
    DELETE_USER = 21,
    LIST_USERS = 22,
    CHANGE_USER = 23,
    GET_USER = 24,
    LIST_PROFILES = 30,
    TEST_PROFILE = 31,
    ADD_PROFILE = 32,
    CHANGE_PROFILE = 33,
    DELETE_PROFILE = 34,
    REFRESH_PROFILE = 35,
    ENCRYPT = 70,
    DECRYPT = 71
};

int Status(bool done) {
    return done ? oxxHttpServer::COMMAND_DONE : oxxHttpServer::COMMAND_FAILED;
}

// What follows the first "=", or the whole of a bare value.
std::string_view ValueOf(std::string_view text) {
    const std::size_t equals = text.find('=');
    return equals == std::string_view::npos ? text : text.substr(equals + 1);
}

int Encrypt(std::string_view text, char* reply, std::size_t replySize) {
    std::string sealed;
    if (!oxEncrypt(ValueOf(text), sealed) || sealed.size() >= replySize)
        return oxxHttpServer::COMMAND_FAILED;
    CopyText(reply, replySize, sealed);
    return oxxHttpServer::COMMAND_DONE;
}

int Decrypt(const oxScriptArguments& arguments, char* reply, std::size_t replySize) {
    std::string clear;
    if (!arguments.Has(oxScriptArguments::KEY_DECODE) ||
        !oxDecrypt(arguments.GetText(oxScriptArguments::KEY_DECODE), clear))
        return oxxHttpServer::COMMAND_FAILED;
    CopyText(reply, replySize, clear);
    return oxxHttpServer::COMMAND_DONE;
}

int AddUser(const oxScriptArguments& arguments) {
    return Status(oxxHttpServer::m_oxxUserBase.AddUser(
        arguments.GetText(oxScriptArguments::KEY_USERNAME), arguments.GetText(oxScriptArguments::KEY_PASSWORD),
        static_cast<std::uint32_t>(arguments.GetInt(oxScriptArguments::KEY_PERMISSIONS)),
        arguments.Has(oxScriptArguments::KEY_MAXPROFILES)
            ? IntToText(arguments.GetInt(oxScriptArguments::KEY_MAXPROFILES))
            : std::string(),
        arguments.GetText(oxScriptArguments::KEY_LOGFILEURL)));
}

// Each value that is there is set on its own; an unknown user is no failure.
int ChangeUser(const oxScriptArguments& arguments) {
    if (!arguments.Has(oxScriptArguments::KEY_USERNAME))
        return oxxHttpServer::COMMAND_FAILED;
    oxUserBase& users = oxxHttpServer::m_oxxUserBase;
    const std::string name = arguments.GetText(oxScriptArguments::KEY_USERNAME);
    if (arguments.Has(oxScriptArguments::KEY_PASSWORD))
        users.SetPassword(name, arguments.GetText(oxScriptArguments::KEY_PASSWORD));
    if (arguments.Has(oxScriptArguments::KEY_LOGFILEURL))
        users.SetText1(name, arguments.GetText(oxScriptArguments::KEY_LOGFILEURL));
    if (arguments.Has(oxScriptArguments::KEY_PERMISSIONS))
        users.SetPermissions(name, static_cast<std::uint32_t>(arguments.GetInt(oxScriptArguments::KEY_PERMISSIONS)));
    if (arguments.Has(oxScriptArguments::KEY_MAXPROFILES))
        users.SetText2(name, IntToText(arguments.GetInt(oxScriptArguments::KEY_MAXPROFILES)));
    return oxxHttpServer::COMMAND_DONE;
}

// One of the commands that are served here and take arguments. `raw` is the argument text as the script sent it.
int Serve(int command, const std::string& raw, char* reply, std::size_t replySize) {
    if (command == ENCRYPT)
        return Encrypt(DecodeUrlText(raw), reply, replySize);
    const oxScriptArguments arguments(raw);
    if (!arguments.IsGood())
        return oxxHttpServer::COMMAND_FAILED;
    const std::string name = arguments.GetText(oxScriptArguments::KEY_USERNAME);
    switch (command) {
        case ADD_USER:
            return AddUser(arguments);
        case DELETE_USER:
            return Status(oxxHttpServer::m_oxxUserBase.DeleteUser(name));
        case CHANGE_USER:
            return ChangeUser(arguments);
        case GET_USER:
            return Status(oxxHttpServer::m_oxxUserBase.GetPermissionsText(name, reply, replySize));
        case LIST_PROFILES:
            if (!arguments.Has(oxScriptArguments::KEY_USERNAME))
                return oxxHttpServer::COMMAND_FAILED;
            oxxHttpServer::m_ProfileMap.ListProfiles(name, reply, replySize);
            return oxxHttpServer::COMMAND_DONE;
        case TEST_PROFILE:
            return Status(
                oxxHttpServer::m_ProfileMap.IsPermitted(name, arguments.GetText(oxScriptArguments::KEY_PROFILE_ID)));
        default:
            return Decrypt(arguments, reply, replySize);
    }
}

// Fields of the remote service's request are separated by "|" and nothing is escaped.
bool IsForwardable(std::string_view contextString) {
    return std::none_of(contextString.begin(), contextString.end(), [](char c) { return c == '|' || IsControl(c); });
}

}  // namespace

int oxxHttpServer::ScriptCallback(const char* contextString, int command, const char* argumentText, char* reply,
                                  std::size_t replySize) {
    if (replySize > 0)
        reply[0] = '\0';
    const std::string context = contextString == nullptr ? "" : contextString;
    const std::string argument = argumentText == nullptr ? "" : argumentText;
    std::string raw = RawArguments().empty() ? argument : RawArguments();
    switch (command) {
        case LIST_USERS:
            m_oxxUserBase.ListUsers(reply, replySize);
            return COMMAND_DONE;
        case ADD_USER:
        case DELETE_USER:
        case CHANGE_USER:
        case GET_USER:
        case LIST_PROFILES:
        case TEST_PROFILE:
        case ENCRYPT:
        case DECRYPT:
            // Scripts that write their arguments into the first string and leave the second empty mean the same.
            return Serve(command, raw.empty() ? context : raw, reply, replySize);
        case ADD_PROFILE:
        case CHANGE_PROFILE:
        case DELETE_PROFILE:
        case REFRESH_PROFILE: {
            const oxScriptArguments arguments(raw);
            if (!arguments.IsGood() || !arguments.Has(oxScriptArguments::KEY_PROFILE_ID))
                return COMMAND_FAILED;
            m_ProfileMap.Refresh(arguments.GetText(oxScriptArguments::KEY_PROFILE_ID));
            return Forward(context, command, argument, reply, replySize, COMMAND_DONE);
        }
        default:
            return Forward(context, command, argument, reply, replySize, COMMAND_NOT_HANDLED);
    }
}

int oxxHttpServer::Forward(const std::string& contextString, int command, const std::string& argumentText, char* reply,
                           std::size_t replySize, int otherwise) {
    oxxHttpServer* const server = m_poxxHttpServer;
    const auto setup = server != nullptr ? server->Setup() : nullptr;
    if (setup && setup->remoteEnabled) {
        if (!IsForwardable(contextString))
            return COMMAND_FAILED;
        const int status =
            server->SendERSRequest(contextString.c_str(), command, argumentText.c_str(), reply, replySize);
        if (status != ERS_UNREACHABLE)
            return status;
        std::snprintf(reply, replySize, "statusdesc=Server is unavailable at %s:%d.", setup->remote.host.c_str(),
                      static_cast<int>(setup->remote.port));
        return COMMAND_UNREACHABLE;
    }
    if (m_pOutsideCallback != nullptr)
        return m_pOutsideCallback(contextString.c_str(), command, argumentText.c_str(), reply, replySize);
    return otherwise;
}
