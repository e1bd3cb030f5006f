#include "unix/filelimit.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>

#include "platform/text.h"
#include "proc.h"
#include "support/auditfile.h"

namespace {
constexpr int NOT_CONFIGURED = -1;
constexpr int UNLIMITED = std::numeric_limits<int>::max();

// Limits are 64 bits wide and the log speaks of ints: what does not fit counts as unlimited.
int AsInt(rlim_t limit) {
    return static_cast<int>(std::min<rlim_t>(limit, UNLIMITED));
}
}  // namespace

int oxLimitCalls::Get(rlimit& limit) {
    return getrlimit(RLIMIT_NOFILE, &limit);
}
int oxLimitCalls::Set(const rlimit& limit) {
    return setrlimit(RLIMIT_NOFILE, &limit);
}
uid_t oxLimitCalls::EffectiveUser() {
    return geteuid();
}
void oxLimitCalls::KeepForChildren(const rlimit& limit) {
    oxProc::SetChildFileLimit(limit);
}

void RaiseFileLimit(int wanted, oxAuditFile& audit, oxLimitCalls& calls) {
    rlimit limit{};
    if (calls.Get(limit) != 0) {
        audit.Printf(5, "getrlimit: %s", GetLastErrorText(errno));
        return;
    }
    calls.KeepForChildren(limit);
    const int hard = AsInt(limit.rlim_max);
    if (wanted == NOT_CONFIGURED)
        wanted = hard;
    if (calls.EffectiveUser() != 0 && wanted > hard) {
        audit.Printf("Warning: Non-root users cannot set RLIMIT_NOFILE to greater than %d handles. (handles=%d)", hard,
                     wanted);
        wanted = hard;
    }
    if (AsInt(limit.rlim_cur) >= wanted)
        return;
    limit.rlim_cur = limit.rlim_max = static_cast<rlim_t>(wanted);
    if (calls.Set(limit) != 0) {
        audit.Printf(5, "setrlimit: %s", GetLastErrorText(errno));
        return;
    }
    if (wanted == UNLIMITED)
        audit.Printf(5, "RLIMIT_NOFILE set to unlimited.");
    else if (calls.Get(limit) == 0)
        audit.Printf(5, "RLIMIT_NOFILE set to %d.", AsInt(limit.rlim_cur));
}

void RaiseFileLimit(int wanted, oxAuditFile& audit) {
    oxLimitCalls calls;
    RaiseFileLimit(wanted, audit, calls);
}
