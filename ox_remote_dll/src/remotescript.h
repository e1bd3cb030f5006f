// One run of a script in the scripting engine, and the service of the engine's call-backs while it runs.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "rwlock.h"

// Serves one command of the engine: the context that the run was given, the message's first string, the command, the
// message's second string (may be changed in place) and the status to answer (0 at the call). Never returns null; the
// text is copied before the next call of the same thread.
using oxScriptCallback = const char* (*)(void* context, const char* contextString, int command, char* argumentText,
                                         int* status);

// What ends a run before its time. The engine is then interrupted, and killed after END_GRACE.
struct oxScriptLimits {
    const std::atomic<bool>* stop = nullptr;  // set by another thread; looked at at least once in STOP_TICK
    std::chrono::seconds time{0};             // for the whole run; 0: no limit
};

// Thread rules: an object belongs to one thread; the lock that scripts take with commands 60 and 61 is shared by all.
class oxRemoteScript {
public:
    enum LockState : std::uint32_t { rwUnlocked = 0, rwReading = 1, rwWriting = 2 };
    static constexpr const char* m_sENGINE_NAME = "ox_script.bin";
    static constexpr const char* m_sPipeNamePrefix = "./.oxscriptcallback:";  // kept; the pipes have no names
    static constexpr std::size_t MAX_ENGINE_PATH = 4094;
    static constexpr std::size_t MAX_DIRECTORY = 4096;
    static constexpr std::size_t MAX_MESSAGE = 4096;  // bytes of one message of the engine
    static constexpr std::size_t MIN_MESSAGE = 9;     // shorter ones are not answered
    static constexpr std::uint32_t END_WAIT = 10000;  // milliseconds for the engine to end by itself after its run
    static constexpr std::chrono::milliseconds END_GRACE{5000};  // between the interrupt and the kill
    static constexpr std::chrono::milliseconds STOP_TICK{250};
    static constexpr int COMMAND_READ_LOCK = 60;
    static constexpr int COMMAND_WRITE_LOCK = 61;
    static constexpr int RESULT_NOT_SPAWNED = -1;
    static constexpr int RESULT_ENDED = -1;  // stopped, or past the time limit

    oxRemoteScript();
    // The engine is directory + "/ox_script.bin".
    explicit oxRemoteScript(const char* directory);
    ~oxRemoteScript();
    oxRemoteScript(const oxRemoteScript&) = delete;
    oxRemoteScript& operator=(const oxRemoteScript&) = delete;

    void SetLimits(const oxScriptLimits& limits) { m_limits = limits; }

    // Runs the engine once with the arguments (a null or empty one becomes "NULL") and the data on its standard input,
    // and serves its messages until it says EXIT, closes its end or ends. 0 is success (also when no pipe could be
    // made); else the engine's exit code or signal number, or one of the results above.
    int Run(int argc, char** argv, void* context, oxScriptCallback callback, std::string_view data);
    // The same with a text that may be null.
    int Run(int argc, char** argv, void* context, oxScriptCallback callback, const char* data) {
        return Run(argc, argv, context, callback, data == nullptr ? std::string_view() : std::string_view(data));
    }
    // Serves one message and writes the answer to the descriptor. A message that breaks the bounds is not answered.
    void PerformCallback(int fd, char* message, int length, oxScriptCallback callback);
    // Serve the commands 60 and 61: the text to answer, and the status -1 when the lock is not to be had. The arguments
    // begin with the operation's digit; anything else is a programming error of the script and ends the process.
    const char* ServeReadLock(const char* pszArgs, int* status);
    const char* ServeWriteLock(const char* pszArgs, int* status);

    // For call-backs that wait: true when the run that the calling thread serves is over (stopped, past its time limit,
    // or without its engine), so that nobody wants the answer. False outside of a run.
    static bool IsCurrentRunOver();

    const char* EnginePath() const { return m_enginePath; }
    LockState GetLockState() const { return m_locked; }
    // Counts the constructions with a directory.
    static std::uint32_t PipeIDs() { return m_dwPipeID; }

private:
    // What a script asks of the lock.
    enum LockOperation : long { UNLOCK = 0, LOCK = 1, TRY_LOCK = 2 };

    std::string Answer(const char* message, int length, oxScriptCallback callback);
    const char* Dispatch(int command, char* first, char* second, int* status, oxScriptCallback callback);
    bool IsOver() const;
    void ReleaseLocks();

    char m_enginePath[MAX_ENGINE_PATH + 1] = {};
    char m_directory[MAX_DIRECTORY + 1] = {};
    LockState m_locked = rwUnlocked;
    oxScriptLimits m_limits;
    void* m_context = nullptr;
    // What this run holds of the lock; the lock state tells only what its last command did.
    int m_reads = 0;
    bool m_writing = false;

    static std::atomic<std::uint32_t> m_dwPipeID;
    static RWLock& m_rwLock;  // never destroyed
};
