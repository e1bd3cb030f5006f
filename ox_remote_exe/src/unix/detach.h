// Becoming a daemon.
#pragma once

#include <string>

#include "unix/startupconfig.h"

class oxAuditFile;

// Opens "/dev/null" on those of the descriptors 0, 1 and 2 that are closed, so that no log, lock or socket gets their
// numbers.
void FillStandardDescriptors();
// Closes what the caller left open above them, for which it may wait; or, where the caller goes on watching the server,
// only keeps it from the programs that the server starts.
void DropInheritedDescriptors(bool close);
// Points standard input and output at "/dev/null".
void SilenceStandardStreams();

struct oxDetachOptions {
    bool newSession = true;
    bool changeDirectory = true;
};

// Settles the file-creation mask, the session, the working directory and the user. None of its failures stops the
// start.
void DetachProcess(const oxDetachOptions& options, const std::string& programDirectory, const oxStartupConfig& config,
                   oxAuditFile& audit);
