// What the server does on each signal.
#pragma once

#include <string>

#include "unix/servercontrol.h"
#include "unix/signals.h"

class oxAuditFile;

// What the reactions work on. Everything outlives the signal object.
struct oxControlRecord {
    oxAuditFile& audit;
    oxServerControl& server;
    std::string ersAddress;
};

class oxRemoteSignals : public oxSignals {
public:
    // Numbers, not names: they are part of how the server is controlled from outside.
    enum SignalNumber {
        SIGNAL_INTERRUPT = 2,   // stop
        SIGNAL_ABORT = 6,       // stop
        SIGNAL_TERMINATE = 15,  // stop
        oxSIGRESET = 16,        // stop and start again
        SIGNAL_CHILD = 17,      // end at once
        oxSIGSTATUS = 31,       // report
        SIGNAL_LAST = 31        // what lies above is only logged
    };

    explicit oxRemoteSignals(oxControlRecord& control) : m_control(control) {}
    oxRemoteSignals(oxControlRecord& control, const sigset_t& previousMask)
        : oxSignals(previousMask), m_control(control) {}

    bool OnSignal(int number) override;

private:
    void Reset();
    void ReportStatus();

    oxControlRecord& m_control;
};
