// Child programs: the only place where the server forks to run something else.
#pragma once

#include <sys/resource.h>
#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/file.h"

// Starts one child program, optionally with its standard streams connected to prepared descriptors, waits for it,
// interrupts or kills it, and describes the last event in a text.
//
// The child starts with an empty signal mask, default signal actions, the file-creation mask 022 and the open-files
// limit that the server was started with, and is killed when the thread that started it ends. Where the server gave up
// root only for its effective user, the child gives it up for good (groups, real, effective and saved ids).
//
// Thread rules: an object belongs to one thread. Errors: results and the error text; nothing throws but an allocation.
class oxProc {
public:
    static constexpr std::uint32_t NO_LIMIT = 0xFFFFFFFF;  // of a wait, in milliseconds
    static constexpr int STILL_RUNNING = -1;
    static constexpr unsigned PRIORITY_UNCHANGED = 6;  // of 1 to 10
    static constexpr std::size_t MAX_ERROR_TEXT = 599;
    static constexpr std::size_t MAX_ARGUMENTS = 19;  // further ones are dropped

    oxProc();
    // Neither waits for a running child nor ends it.
    virtual ~oxProc();
    oxProc(const oxProc&) = delete;
    oxProc& operator=(const oxProc&) = delete;

    // Starts the program (null: the one of the last time) with the blank-separated arguments (null: as they are).
    // Non-zero, the child's pid, on success; 0 on failure, and also after a waited run (then the child is reaped).
    // A program or directory that does not exist is no failure: the child tells it on standard error and ends with
    // the error number as its exit code.
    virtual int Spawn(const char* program = nullptr, const char* arguments = nullptr, const char* directory = nullptr,
                      bool wait = false, unsigned priority = PRIORITY_UNCHANGED);
    // STILL_RUNNING at the limit (0: one look), else the exit code, the signal number, or 0 without a child.
    virtual int Wait(std::uint32_t milliseconds);
    virtual void Terminate(bool wait);  // SIGINT
    virtual void Kill();                // SIGKILL; the next Wait reaps it
    virtual const char* GetErrorText();

    int Pid() const { return m_pid; }  // 0 when none runs
    // Of the last look: the reaped pid or -1; after Terminate or Kill 0 or the error number.
    int LastWaitResult() const { return m_lastWait; }
    // Becomes readable when the child has ended; -1 where the system has no pid descriptors or no child runs.
    int EndDescriptor() const { return m_endDescriptor.Get(); }

    // What children get as their open-files limit: that of the process before it raised its own. Set once at start-up.
    static void SetChildFileLimit(const rlimit& limit);

    // The result and the text for the status of an ended child.
    static int DescribeEnd(int pid, int status, char* text, std::size_t size);

    // Set before Spawn. A Spawn that starts a child takes the descriptors over: it closes them and sets them to 0,
    // which means "as the server's own". After one that failed they are still the caller's.
    int m_runAsRealUser = 0;  // 1: the child's effective user becomes the real one
    int m_childStdin = 0;
    int m_childStdout = 0;
    int m_childStderr = 0;

private:
    void TakeArguments(const char* arguments);
    void SetErrorText(const char* format, ...) __attribute__((format(printf, 2, 3)));
    void CloseChildEnds();
    bool IsParent() const;
    int Look();
    int Reaped(int result);
    void AwaitEnd(std::chrono::milliseconds limit);

    int m_lastWait = 0;
    int m_pid = 0;
    int m_parentPid = 0;
    std::string m_program;
    std::string m_commandLine;
    char m_errorText[MAX_ERROR_TEXT + 1] = "No Error.";
    std::vector<std::string> m_arguments;
    UniqueFd m_endDescriptor;
    std::chrono::milliseconds m_nap{0};  // the last one of the wait that runs
};
