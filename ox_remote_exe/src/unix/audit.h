// The process's own log.
#pragma once

#include "support/auditfile.h"

// The start-up log of a command, later the status log of the server. Built on first use and never destroyed, so that
// exit handlers and the handlers of last resort may still write to it.
oxAuditFile& theAudit();
