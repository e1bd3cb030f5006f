#include "unix/xmain.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "platform/directory.h"
#include "platform/filename.h"
#include "platform/text.h"
#include "support/auditfile.h"
#include "unix/audit.h"
#include "unix/controlcommands.h"
#include "unix/daemon.h"
#include "unix/filelimit.h"
#include "unix/handlers.h"
#include "unix/pidfile.h"
#include "unix/programpath.h"
#include "unix/remotecmdline.h"
#include "unix/runas.h"
#include "unix/startupconfig.h"

namespace {
constexpr const char* BANNER_TITLE = "Orvex Reporting UI";

void RunAsConfigured(const oxStartupConfig& config) {
    if (getuid() != 0)
        return;
    const auto failed = [](const char* call, int error) {
        std::fprintf(stderr, "%s: %s", call, GetLastErrorText(error));
    };
    TakeRoot();
    TakeGroup(config.gid, failed);
    TakeEffectiveUser(config.uid, failed);
}

void OpenStartupLog(oxAuditFile& audit, const oxFilename& program, int debugLevel) {
    audit.Open(BesideProgram(program, "startup").c_str(), "w+", stderr);
    oxAuditFile::SetDefaultDebugLevel(debugLevel);
    audit.SetDebugLevel(debugLevel);
    audit.SetEcho(stdout);
    std::setvbuf(stdout, nullptr, _IONBF, 0);
    std::setvbuf(stderr, nullptr, _IONBF, 0);
}

void MakeStatusLogsDirectory(const std::string& directory) {
    if (directory.empty() || CreateDir(directory))
        return;
    std::printf("Could not create the status logs directory - %s.", directory.c_str());
    _exit(EXIT_FAILURE);
}

int ExitStatus(bool success) {
    return success ? EXIT_SUCCESS : EXIT_FAILURE;
}

int RunCommands(oxRemoteCmdLine& commandLine, const oxStartupConfig& config, const oxFilename& program,
                oxAuditFile& audit) {
    const oxPidFile pidFile(BesideProgram(program, "pid"), audit);
    oxControlCommands control(pidFile, config);
    bool success = true;
    const std::string* option = commandLine.First();
    if (option == nullptr) {
        commandLine.Usage();
        success = false;
    }
    for (;; option = commandLine.Next()) {
        const auto command = oxRemoteCmdLine::Command(option);
        switch (command) {
            case oxRemoteCmdLine::CMD_START:
            case oxRemoteCmdLine::CMD_DEBUG: {
                oxDaemon daemon(config, program, BANNER_TITLE, audit);
                const auto result = daemon.Start(command == oxRemoteCmdLine::CMD_DEBUG);
                // What was the server must not carry out the options meant for the command.
                if (result.wasServer)
                    return ExitStatus(result.success);
                success = result.success;
                break;
            }
            case oxRemoteCmdLine::CMD_STOP:
                success = control.Stop();
                break;
            case oxRemoteCmdLine::CMD_STATUS:
                success = control.Status();
                break;
            case oxRemoteCmdLine::CMD_NONE:
                return ExitStatus(success);
            case oxRemoteCmdLine::CMD_UNKNOWN:
                if (commandLine.ArgumentCount() > 1)
                    std::printf("\nError: Invalid argument\n");
                commandLine.Usage();
                return EXIT_FAILURE;
        }
    }
}
}  // namespace

int xmain(int argc, char** argv) {
    tzset();
    oxRemoteCmdLine commandLine;
    const oxFilename program = ProgramPath(argc > 0 ? argv[0] : nullptr);
    oxAuditFile& audit = theAudit();

    oxStartupConfig config;
    if (!config.Read(audit)) {
        std::printf("Error: unable to read configuration files.");
        return EXIT_FAILURE;
    }
    RunAsConfigured(config);
    OpenStartupLog(audit, program, config.debugLevel);
    MakeStatusLogsDirectory(config.logDir);
    if (!commandLine.Parse(argc, argv)) {
        audit.Close();
        commandLine.Usage();
        return EXIT_FAILURE;
    }
    InstallNewHandler();
    RaiseFileLimit(config.handles, audit);
    InstallTerminateHandler();
    std::printf("\n%s\n", BANNER_TITLE);

    const int status = RunCommands(commandLine, config, program, audit);
    audit.Close();
    return status;
}
