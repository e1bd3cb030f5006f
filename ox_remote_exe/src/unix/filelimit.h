// The open-files limit of the process.
#pragma once

#include <sys/resource.h>
#include <sys/types.h>

class oxAuditFile;

// The calls that the limit is read and set with; tests bring their own.
class oxLimitCalls {
public:
    virtual ~oxLimitCalls() = default;
    virtual int Get(rlimit& limit);
    virtual int Set(const rlimit& limit);
    virtual uid_t EffectiveUser();
    // Keeps the limit as it was found: children get it back, who may count on small descriptor numbers.
    virtual void KeepForChildren(const rlimit& limit);
};

// Raises the limit to the wanted number; -1 wants the hard limit. A limit that is high enough already is left alone,
// and no failure stops the program: each is a line in the log.
void RaiseFileLimit(int wanted, oxAuditFile& audit, oxLimitCalls& calls);
void RaiseFileLimit(int wanted, oxAuditFile& audit);
