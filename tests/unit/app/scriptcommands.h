// The commands of scripts, given to the server in a scratch installation.
#pragma once

#include <cstring>
#include <string>

#include "app/appfixture.h"

class ScriptCommands : public AppFixture {
protected:
    static inline const std::string USERS = "u1=admin&p1=1&u2=alice&p2=2&u3=bob&p3=0";

    // What a command answers: "status|reply".
    std::string Do(int command, const std::string& arguments, const std::string& context = {},
                   std::size_t size = 65535) {
        std::string buffer(size + 1, '#');
        const int status =
            oxxHttpServer::ScriptCallback(context.c_str(), command, arguments.c_str(), buffer.data(), size);
        EXPECT_EQ(buffer[size], '#') << "wrote behind its buffer";
        return IntToText(status) + "|" + (size == 0 ? "" : buffer.substr(0, std::strlen(buffer.c_str())));
    }
    bool Accepts(const std::string& name, const std::string& password) {
        return oxxHttpServer::m_oxxUserBase.Authenticate(name, password, nullptr);
    }
};
