#include "unix/controlcommands.h"

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "unix/pidfile.h"
#include "unix/processwatch.h"
#include "unix/remotesignals.h"
#include "unix/startupconfig.h"

namespace {
constexpr std::size_t SPINNER_MESSAGE = 78;
constexpr std::size_t SPINNER_WIDTH = 77;
constexpr const char* NOT_RUNNING = "The server is not running";
}  // namespace

std::string SpinnerStep(const char* message) {
    static unsigned count = 0;
    std::string text = "\r";
    text += "|/-\\"[count++ % 4];
    text += ' ';
    if (message != nullptr) {
        const std::string_view shown(message);
        text += shown.substr(0, SPINNER_MESSAGE);
        text.append(SPINNER_WIDTH - std::min(SPINNER_WIDTH, shown.size()), ' ');
        text += '\r';
    }
    return text;
}

bool oxControlCommands::Fail(const char* what, int error) {
    std::fprintf(m_out, "Error: %s (%d).\n\n", what, error);
    return false;
}

bool oxControlCommands::Stop(const StopWait& wait) {
    const auto pid = m_pidFile.Read();
    if (!pid || !oxPidFile::SignalProcess(*pid, 0))
        return Fail(NOT_RUNNING, errno);
    const oxProcessWatch server(*pid);
    if (!oxPidFile::SignalProcess(*pid, oxRemoteSignals::SIGNAL_TERMINATE))
        return Fail("Failed to signal the server", errno);
    const auto deadline = std::chrono::steady_clock::now() + wait.limit;
    bool ended = server.HasEnded();
    while (!ended && std::chrono::steady_clock::now() < deadline) {
        std::fputs(SpinnerStep("Server stopping... ").c_str(), m_out);
        std::fflush(m_out);
        ended = server.WaitEnd(wait.step);
    }
    std::fputs(ended ? "The server has been stopped.\n" : "The server stop is still in progress.\n", m_out);
    return true;
}

bool oxControlCommands::Status() {
    const auto pid = m_pidFile.Read();
    if (!pid || !oxPidFile::SignalProcess(*pid, 0))
        return Fail(NOT_RUNNING, errno);
    if (!oxPidFile::SignalProcess(*pid, oxRemoteSignals::oxSIGSTATUS))
        return Fail("Failed to get the server status", errno);
    std::fprintf(m_out, "Status request sent to the server.\nRefer to %s/%s for results.\n\n", m_config.logDir.c_str(),
                 m_config.logFile.c_str());
    return true;
}
