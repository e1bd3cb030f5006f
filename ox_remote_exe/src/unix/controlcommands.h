// The commands for a running server.
#pragma once

#include <chrono>
#include <cstdio>
#include <string>

class oxPidFile;
struct oxStartupConfig;

// One step of the spinner: each call gives the next of four characters, in the whole process. The message, unless null,
// follows and is padded over what may have stood in the line before.
std::string SpinnerStep(const char* message);

// Finds the server through the pid file and sends it signals. The results are true for success; everything is reported
// on the stream.
class oxControlCommands {
public:
    struct StopWait {
        std::chrono::milliseconds limit{30000};
        std::chrono::milliseconds step{1000};  // one step of the spinner
    };

    oxControlCommands(const oxPidFile& pidFile, const oxStartupConfig& config, std::FILE* out = stdout)
        : m_pidFile(pidFile), m_config(config), m_out(out) {}

    // Tells the server to end and waits for that. A server that takes longer than the wait is a success too.
    bool Stop(const StopWait& wait);
    bool Stop() { return Stop(StopWait()); }
    // Has the server write its report; does not wait for it.
    bool Status();

private:
    bool Fail(const char* what, int error);

    const oxPidFile& m_pidFile;
    const oxStartupConfig& m_config;
    std::FILE* m_out;
};
