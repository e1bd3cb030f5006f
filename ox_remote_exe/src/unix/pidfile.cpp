#include "unix/pidfile.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <limits>

#include "platform/text.h"
#include "support/auditfile.h"
#include "unix/processwatch.h"

namespace {
// How often a file that an ending server deletes under our hands is opened anew.
constexpr int REPLACED_TRIES = 100;

pid_t ToPid(const char* text) {
    constexpr long long LEAST = std::numeric_limits<pid_t>::min();
    constexpr long long MOST = std::numeric_limits<pid_t>::max();
    return static_cast<pid_t>(std::clamp(std::strtoll(text, nullptr, 10), LEAST, MOST));
}
}  // namespace

std::optional<pid_t> oxPidFile::Read() const {
    UniqueFd file = OpenFile(m_path, O_RDONLY | O_NONBLOCK);
    if (!file)
        return std::nullopt;
    if (file.Get() == 0) {
        // Happens with standard input closed. Kept on purpose: descriptor 0 has always counted as no file.
        m_audit.Printf("Error: can't open %s: %s", m_path.c_str(), GetLastErrorText(EBADF));
        errno = EBADF;
        return std::nullopt;
    }
    char text[MAX_READ + 1] = {};
    ssize_t count;
    do {
        count = read(file.Get(), text, MAX_READ);
    } while (count < 0 && errno == EINTR);
    if (count < 0)
        return std::nullopt;
    return ToPid(text);
}

bool oxPidFile::SignalProcess(pid_t pid, int number) {
    // What is no process's number is a group of processes, or all: they may be asked whether they are there.
    if (pid > 0 || number == 0)
        return kill(pid, number) == 0;
    errno = ESRCH;
    return false;
}

bool oxPidFile::Signal(int number) const {
    const auto pid = Read();
    return pid && SignalProcess(*pid, number);
}

bool oxPidFile::NamesRunningProcess() const {
    const auto pid = Read();
    return pid && SignalProcess(*pid, 0) && !oxProcessWatch(*pid).HasEnded();
}

// An ending server deletes its file while a new one may already have it open: a lock on that file guards nothing.
bool oxPidFile::IsStillTheFile() const {
    struct stat mine;
    struct stat named;
    return fstat(m_descriptor.Get(), &mine) == 0 && stat(m_path.c_str(), &named) == 0 && mine.st_dev == named.st_dev &&
           mine.st_ino == named.st_ino;
}

oxPidFile::LockResult oxPidFile::Lock(const std::string& title) {
    m_descriptor = OpenFile(m_path, O_WRONLY | O_NONBLOCK | O_CREAT, PID_FILE_MODE);
    if (!m_descriptor) {
        m_audit.Printf("Error: can't open pidfile %s: %s", m_path.c_str(), GetLastErrorText(errno));
        return LockResult::Failed;
    }
    struct flock lock {};
    lock.l_type = F_WRLCK;
    lock.l_whence = SEEK_SET;
    lock.l_start = 0;
    lock.l_len = 0;
    if (fcntl(m_descriptor.Get(), F_SETLK, &lock) != 0) {
        const int error = errno;
        if (error == EACCES || error == EAGAIN)
            m_audit.Printf("Error: %s is already running: %s", title.c_str(), GetLastErrorText(error));
        else
            m_audit.Printf("Error: can't lock %s: %s", m_path.c_str(), GetLastErrorText(error));
        m_descriptor.Reset();
        return LockResult::Failed;
    }
    return IsStillTheFile() ? LockResult::Locked : LockResult::Replaced;
}

bool oxPidFile::WriteLocked(const std::string& title, pid_t pid) {
    LockResult result = LockResult::Replaced;
    for (int i = 0; i < REPLACED_TRIES && result == LockResult::Replaced; ++i)
        result = Lock(title);
    if (result == LockResult::Failed)
        return false;
    const std::string text = std::to_string(pid) + "\n";
    if (result == LockResult::Replaced || !WriteAll(m_descriptor.Get(), text.data(), text.size())) {
        const int error = result == LockResult::Replaced ? ESTALE : errno;
        m_audit.Printf("Error: can't write to %s: %s", m_path.c_str(), GetLastErrorText(error));
        // An empty file would make every later start believe that a server runs.
        Remove();
        return false;
    }
    return true;
}

bool oxPidFile::Write(const std::string& title, pid_t pid) {
    if (WriteLocked(title, pid))
        return true;
    m_audit.Printf(1, "Error: Unable to create lock file, %s.", m_path.c_str());
    return false;
}

void oxPidFile::Remove() {
    if (m_descriptor && IsStillTheFile() && unlink(m_path.c_str()) != 0)
        m_audit.Printf("Error: can't delete %s: %s", m_path.c_str(), GetLastErrorText(errno));
    m_descriptor.Reset();
}
