#include "unix/detach.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "platform/file.h"
#include "platform/text.h"
#include "support/auditfile.h"
#include "unix/runas.h"

namespace {
constexpr const char* NULL_DEVICE = "/dev/null";
// Both are "no id" to some system call or other, the second where ids have 16 bits, and leave the process root.
constexpr int NO_USER = -1;
constexpr int NO_USER_16 = 65535;

void StartSession(oxAuditFile& audit) {
    if (setsid() >= 0)
        return;
    const int error = errno;
    audit.Printf("WARNING: setsid() failed: %s (%d)", GetLastErrorText(error), error);
}

void ChangeDirectory(const std::string& directory, oxAuditFile& audit) {
    audit.Printf(3, "Changing dir to %s;", directory.c_str());
    if (chdir(directory.c_str()) != 0)
        audit.Printf(3, "WARNING: Unable to chdir to %s.", directory.c_str());
}

void SettleUser(const oxStartupConfig& config, oxAuditFile& audit) {
    if (getuid() != 0) {
        DropSetUid();
        return;
    }
    const auto failed = [&audit](const char* call, int error) {
        audit.Printf(7, "%s: %s", call, GetLastErrorText(error));
    };
    TakeRoot();
    TakeGroup(config.gid, failed);
    audit.Printf(7, "gid=%d egid=%d", static_cast<int>(getgid()), static_cast<int>(getegid()));
    TakeEffectiveUser(config.uid, failed);
    audit.Printf(7, "uid=%d euid=%d", static_cast<int>(getuid()), static_cast<int>(geteuid()));
    if (config.uid == NO_USER || config.uid == NO_USER_16)
        audit.Printf(1, "Warning: running as uid %d is a security risk.", config.uid);
}
}  // namespace

void FillStandardDescriptors() {
    // Without close-on-exec: these three are what a started program expects to have.
    int descriptor;
    do {
        descriptor = open(NULL_DEVICE, O_RDWR | O_NOCTTY);
    } while ((descriptor >= 0 && descriptor <= STDERR_FILENO) || (descriptor < 0 && errno == EINTR));
    if (descriptor >= 0)
        close(descriptor);
}

void DropInheritedDescriptors(bool close) {
    // By number: not every C library that the program runs with has the call.
    constexpr long CLOSE_RANGE = 436;
    constexpr unsigned SET_CLOSE_ON_EXEC = 4;
    syscall(CLOSE_RANGE, STDERR_FILENO + 1U, ~0U, close ? 0U : SET_CLOSE_ON_EXEC);
}

void SilenceStandardStreams() {
    UniqueFd null = OpenFile(NULL_DEVICE, O_RDWR);
    if (!null)
        return;
    DuplicateOnto(null.Get(), STDIN_FILENO);
    DuplicateOnto(null.Get(), STDOUT_FILENO);
    if (null.Get() <= STDERR_FILENO)
        null.Release();
}

void DetachProcess(const oxDetachOptions& options, const std::string& programDirectory, const oxStartupConfig& config,
                   oxAuditFile& audit) {
    umask(0);
    if (options.newSession)
        StartSession(audit);
    if (options.changeDirectory)
        ChangeDirectory(programDirectory, audit);
    SettleUser(config, audit);
}
