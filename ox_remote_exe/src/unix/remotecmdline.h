// The options of this program.
#pragma once

#include <cstdio>
#include <string>

#include "unix/commandline.h"

class oxRemoteCmdLine : public oxCommandLine {
public:
    static constexpr const char* m_sSTART = "start";
    static constexpr const char* m_sSTOP = "stop";
    static constexpr const char* m_sUPDATE = "update";  // a name without a command
    static constexpr const char* m_sSTATUS = "status";
    static constexpr const char* m_sDEBUG = "debug";

    enum CommandCode { CMD_START = 1, CMD_STOP = 2, CMD_STATUS = 3, CMD_DEBUG = 5, CMD_UNKNOWN = -1, CMD_NONE = -2 };

    // The command of a switch; null is CMD_NONE. Whatever begins with an option's name, in any case, is that option.
    static CommandCode Command(const std::string* option);
    // `debug` is for developers and is left out.
    void Usage(std::FILE* out = stdout) const;
};
