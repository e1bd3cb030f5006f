#include "unix/remotecmdline.h"

#include <utility>

#include "platform/text.h"

oxRemoteCmdLine::CommandCode oxRemoteCmdLine::Command(const std::string* option) {
    if (option == nullptr)
        return CMD_NONE;
    static constexpr std::pair<const char*, CommandCode> COMMANDS[] = {
        {m_sSTART, CMD_START}, {m_sSTOP, CMD_STOP}, {m_sSTATUS, CMD_STATUS}, {m_sDEBUG, CMD_DEBUG}};
    for (const auto& [name, code] : COMMANDS) {
        if (StartsWithNoCase(*option, name))
            return code;
    }
    return CMD_UNKNOWN;
}

void oxRemoteCmdLine::Usage(std::FILE* out) const {
    std::fprintf(out, "\nUsage:\n\n");
    std::fprintf(out, "\t%s [-option]\n\n", ProgramPath().FileName().c_str());
    std::fprintf(out, "Where [-option] is one of:\n\n");
    std::fprintf(out, "\t-%s\t\tStarts the remote interface server.\n", m_sSTART);
    std::fprintf(out, "\t-%s\t\tStops the remote interface server.\n", m_sSTOP);
    std::fprintf(out, "\t-%s\t\tReports the current server status.\n\n", m_sSTATUS);
}
