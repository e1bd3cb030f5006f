#include "unix/remotesignals.h"

#include <unistd.h>

#include <cstring>

#include "support/auditfile.h"

bool oxRemoteSignals::OnSignal(int number) {
    oxAuditFile& audit = m_control.audit;
    audit.Printf(10, "Signal received: %d - %s", number, strsignal(number));
    if (number < 1 || number > SIGNAL_LAST)
        return false;
    switch (number) {
        case SIGNAL_INTERRUPT:
        case SIGNAL_ABORT:
            audit.Printf("Process %d cancelled - cleaning up...", getpid());
            m_control.server.Stop();
            return true;
        case SIGNAL_TERMINATE:
            audit.Printf("Process %d termination requested. Cleaning up...", getpid());
            m_control.server.Stop();
            return true;
        case oxSIGRESET:
            Reset();
            return false;
        case SIGNAL_CHILD:
            return true;
        case oxSIGSTATUS:
            ReportStatus();
            return false;
        default:
            return false;
    }
}

void oxRemoteSignals::Reset() {
    m_control.audit.Printf("Process %d: oxSIGRESET received - resetting the server:", getpid());
    m_control.server.Stop();
    // The directories stay relative: the process is in the program directory by now.
    oxServerArguments arguments;
    arguments.ersAddress = m_control.ersAddress;
    m_control.server.Start(arguments);
}

void oxRemoteSignals::ReportStatus() {
    oxAuditFile& audit = m_control.audit;
    audit.Printf("Process %d: oxSIGSTATUS received - current server status:", getpid());
    int port = 0;
    switch (m_control.server.Status(port)) {
        case oxServerControl::STATUS_ACTIVE:
            audit.Printf("Remote interface server is active on port %d.", port);
            break;
        case oxServerControl::STATUS_STOPPED:
            audit.Printf("Remote interface server is stopped.");
            break;
        case oxServerControl::STATUS_ERROR:
            audit.Printf("Remote interface server reports an error.");
            break;
        default:
            break;
    }
}
