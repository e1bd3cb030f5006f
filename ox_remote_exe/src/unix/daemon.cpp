#include "unix/daemon.h"

#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <thread>
#include <utility>

#include "platform/text.h"
#include "support/auditfile.h"
#include "unix/detach.h"
#include "unix/processwatch.h"
#include "unix/programpath.h"
#include "unix/remotesignals.h"
#include "unix/servercontrol.h"
#include "unix/theserver.h"

namespace {
// The C library keeps signal 32 for itself: it is in no mask it builds and its calls refuse it, so only the system
// itself can be told not to end the process on it.
constexpr int LIBRARY_SIGNAL = 32;

void IgnoreLibrarySignal() {
    struct KernelAction {
        void (*handler)(int);
        unsigned long flags;
        void (*restorer)();
        unsigned char mask[8];
    };
    KernelAction action{};
    action.handler = SIG_IGN;
    syscall(SYS_rt_sigaction, LIBRARY_SIGNAL, &action, nullptr, sizeof action.mask);
}

// Some supervisors start their children with ended children ignored; then no exit status would ever be seen.
void ReceiveChildNotices() {
    signal(SIGCHLD, SIG_DFL);
}

std::string HostName() {
    char name[oxDaemon::HOST_NAME_BUFFER];
    if (gethostname(name, sizeof name) != 0)
        return "local";
    name[sizeof name - 1] = '\0';
    return name;
}
// What the server process is controlled with.
struct ProcessControl {
    ProcessControl(oxAuditFile& audit, const std::string& ersAddress, const sigset_t& previousMask)
        : server(audit), record{audit, server, ersAddress}, signals(record, previousMask) {}

    oxTheServerControl server;
    oxControlRecord record;
    oxRemoteSignals signals;
};
}  // namespace

oxDaemon::oxDaemon(const oxStartupConfig& config, const oxFilename& program, std::string title, oxAuditFile& audit)
    : m_config(config),
      m_program(program),
      m_title(std::move(title)),
      m_audit(audit),
      m_pidFile(BesideProgram(program, "pid"), audit) {}

oxDaemon::Result oxDaemon::Start(bool debug) {
    MoveAudit();
    if (debug)
        std::printf("\n[Debug]\n\n");
    if (m_pidFile.NamesRunningProcess()) {
        std::printf("The server is already running!\n\n");
        return {false, false};
    }
    if (!debug) {
        const pid_t child = fork();
        if (child < 0)
            return {false, false};
        if (child > 0) {
            AwaitChild(child);
            return {true, false};
        }
    }
    return {RunServer(debug), true};
}

void oxDaemon::MoveAudit() {
    unlink(BesideProgram(m_program, "startup").c_str());
    m_audit.Close();
    const std::string path = oxFilename::Join(m_config.logDir, m_config.logFile);
    // Standard error still leads into the deleted start-up log, so a failure is told here.
    if (!m_audit.Open(path.c_str(), "a+", stderr))
        std::printf("Error: can't open %s: %s\n", path.c_str(), GetLastErrorText(errno));
    m_audit.SetDebugLevel(m_config.debugLevel);
    m_audit.SetEcho(stdout);
}

// The pause has its full length also when the child ends early. A child that ended is reaped at once, or it would
// pass for a running server.
void oxDaemon::AwaitChild(pid_t child) {
    const auto end = std::chrono::steady_clock::now() + START_PAUSE;
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(START_PAUSE);
    if (oxProcessWatch(child).WaitEnd(left)) {
        while (waitpid(child, nullptr, 0) < 0 && errno == EINTR) {
        }
    }
    std::this_thread::sleep_until(end);
}

bool oxDaemon::RunServer(bool debug) {
    // From here on signals wait for the loop: the first may come as soon as the pid file can be read.
    const sigset_t previousMask = BlockAllSignals();
    ReceiveChildNotices();
    IgnoreLibrarySignal();
    FillStandardDescriptors();
    DropInheritedDescriptors(!debug);
    oxDetachOptions options;
    options.newSession = !debug;
    DetachProcess(options, m_program.Directory(), m_config, m_audit);
    return m_pidFile.Write(m_title, getpid()) && ServeUntilSignalled(debug, previousMask);
}

bool oxDaemon::ServeUntilSignalled(bool debug, const sigset_t& previousMask) {
    // Never destroyed: that would let signals in again, and a second request to stop would end the process, with
    // another exit status, in the middle of its clean-up.
    auto& control = *new ProcessControl(m_audit, m_config.ersAddress, previousMask);
    control.signals.SetHandshake(oxSignals::HANDSHAKE_NONE);
    control.signals.SetOwnThread(false);

    oxRemoteConfig remote(control.server);
    const bool started = StartServer(remote, debug);
    if (started)
        control.signals.Run();
    m_pidFile.Remove();
    remote.Stop();
    // Sessions that do not end in time still use what exit handlers take apart.
    if (!theServer().Close())
        _exit(started ? EXIT_SUCCESS : EXIT_FAILURE);
    return started;
}

bool oxDaemon::StartServer(oxRemoteConfig& server, bool debug) {
    const std::string host = HostName();
    oxServerArguments arguments;
    arguments.ersAddress = m_config.ersAddress;
    if (server.Start(arguments) != oxServerControl::START_GOOD) {
        m_audit.Printf("Error: The remote interface server failed to initialize.");
        m_audit.Printf("Refer to \"ox_remote.err\" for more information.");
        return false;
    }
    m_audit.Printf("Remote interface server available on http://%s:%d.", host.c_str(), server.GetPort());
    m_audit.Printf("The remote configuration server has been started (%d).", getpid());
    if (!debug)
        SilenceStandardStreams();
    return true;
}
