// The pid file: where a running server is found, and the lock that keeps it alone.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>

#include "platform/file.h"

class oxAuditFile;

// The server writes its process id into the file and keeps it open with a write lock for its whole life.
//
// The lock belongs to the process and is lost when the process closes any descriptor of the file. So a server process,
// once it holds the lock, must neither `Read` nor `Signal` through any object for this file. The file is not truncated:
// after a shorter number the tail of a longer old one stays behind the line end.
class oxPidFile {
public:
    static constexpr std::size_t MAX_READ = 19;

    oxPidFile(std::string path, oxAuditFile& audit) : m_path(std::move(path)), m_audit(audit) {}

    const std::string& Path() const { return m_path; }

    // The number in the file; text that is no number is 0. None, with errno, when there is no file to read.
    std::optional<pid_t> Read() const;
    // Sends the signal to the process that the file names; 0 only tests. False with errno.
    bool Signal(int number) const;
    // Whether the file names a process that answers signal 0 and is not just waiting to be reaped.
    bool NamesRunningProcess() const;

    // Takes the lock and writes the number. False, with the reasons in the audit log, when another server holds the
    // lock or the file cannot be written. The title names the program in the message.
    bool Write(const std::string& title, pid_t pid);
    // Deletes the file, if this object holds its lock, and gives the lock up.
    void Remove();

    // kill(2) that never reaches a process group: to a number below 1 signal 0 succeeds (a garbage file reads as 0, and
    // nobody knows that no server runs), any other signal fails with ESRCH.
    static bool SignalProcess(pid_t pid, int number);

private:
    enum class LockResult { Locked, Replaced, Failed };
    LockResult Lock(const std::string& title);
    bool IsStillTheFile() const;
    bool WriteLocked(const std::string& title, pid_t pid);

    const std::string m_path;
    oxAuditFile& m_audit;
    UniqueFd m_descriptor;
};
