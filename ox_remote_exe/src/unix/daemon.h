// The start command.
#pragma once

#include <signal.h>
#include <sys/types.h>

#include <chrono>
#include <string>

#include "platform/filename.h"
#include "unix/pidfile.h"
#include "unix/remoteconfig.h"
#include "unix/startupconfig.h"

class oxAuditFile;

// Turns the process, or with a fork its child, into the server.
class oxDaemon {
public:
    // How long the command waits after the fork, so that what goes wrong at once shows on the terminal.
    static constexpr std::chrono::seconds START_PAUSE{5};
    static constexpr std::size_t HOST_NAME_BUFFER = 64;

    struct Result {
        bool success;
        bool wasServer;  // this process was the server; it has nothing more to do
    };

    // The title names the program in messages.
    oxDaemon(const oxStartupConfig& config, const oxFilename& program, std::string title, oxAuditFile& audit);

    // Debugging runs the server in this process, in the foreground.
    Result Start(bool debug);

private:
    void MoveAudit();
    void AwaitChild(pid_t child);
    bool RunServer(bool debug);
    bool ServeUntilSignalled(bool debug, const sigset_t& previousMask);
    bool StartServer(oxRemoteConfig& server, bool debug);

    const oxStartupConfig& m_config;
    const oxFilename m_program;
    const std::string m_title;
    oxAuditFile& m_audit;
    oxPidFile m_pidFile;
};
