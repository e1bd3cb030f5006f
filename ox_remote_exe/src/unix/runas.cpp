#include "unix/runas.h"

#include <grp.h>
#include <unistd.h>

#include <cerrno>

void TakeRoot() {
    if (setuid(0) != 0) {
        // The calls that need root fail and are reported.
    }
}

void TakeGroup(int gid, const RunAsFailure& failed) {
    const auto group = static_cast<gid_t>(gid);
    // Where this is refused, so is the next, which says so.
    static_cast<void>(setgroups(1, &group));
    if (setgid(group) != 0)
        failed("setgid", errno);
}

void TakeEffectiveUser(int uid, const RunAsFailure& failed) {
    if (seteuid(static_cast<uid_t>(uid)) != 0)
        failed("seteuid", errno);
}

void DropSetUid() {
    const uid_t user = getuid();
    if (setresuid(user, user, user) != 0) {
        // Setting the ids to the real one is always allowed.
    }
}
