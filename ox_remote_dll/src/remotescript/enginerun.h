// The engine of one script run: its process, the two pipes to it, and the traffic on them.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "platform/file.h"
#include "platform/poll.h"
#include "proc.h"
#include "remotescript.h"

// Writes an answer to a pipe of the engine, waiting for room where the pipe is full. An engine that is gone is no
// error: the next read of its messages tells.
void SendAnswer(int descriptor, std::string_view answer);

// Blocks SIGPIPE for the calling thread while it lives, and swallows the one that a write raised meanwhile.
class oxPipeSignalGuard {
public:
    oxPipeSignalGuard();
    ~oxPipeSignalGuard();
    oxPipeSignalGuard(const oxPipeSignalGuard&) = delete;
    oxPipeSignalGuard& operator=(const oxPipeSignalGuard&) = delete;

private:
    bool m_wasBlocked;
};

// Belongs to one thread. However it is left, no process, zombie or descriptor of the run stays behind.
class oxEngineRun {
public:
    // Serves one message; an empty result is no answer.
    using Answerer = std::function<std::string(const char* message, int length)>;

    // While more answer bytes than this wait for the engine to read them, its messages wait too.
    static constexpr std::size_t MAX_QUEUED_ANSWERS = std::size_t{4} * 1024 * 1024;
    // Between two looks at an engine whose end no descriptor tells.
    static constexpr std::chrono::milliseconds NAP{20};

    // The time limit begins to run here.
    explicit oxEngineRun(const oxScriptLimits& limits);
    ~oxEngineRun();
    oxEngineRun(const oxEngineRun&) = delete;
    oxEngineRun& operator=(const oxEngineRun&) = delete;

    bool MakePipes();  // false with errno
    bool Spawn(const char* program, const char* arguments);
    // Writes the data to the engine and serves its messages at the same time, until the engine says EXIT, closes its
    // end or ends, or the data cannot be written.
    void Serve(std::string_view data, const Answerer& answer);
    // Closes the pipes, waits for the engine's end, and ends it when it takes too long: the run's result.
    int AwaitEnd();
    // True when nobody waits for an answer any more: stopped, past the time limit, or the engine has ended.
    bool IsOver();

private:
    using Clock = std::chrono::steady_clock;

    bool HasEnded();
    bool IsOverdue() const;
    bool IsKillDue() const { return m_killAt && Clock::now() >= *m_killAt; }
    void KeepLimits();
    void EndWithin(std::chrono::milliseconds time);
    WaitLimit UntilNextLook() const;
    void WaitForEvent(bool writing, bool reading);
    bool Send(std::string_view& data);
    ssize_t ReadMessage(char* message) const;
    bool TakeMessage(const Answerer& answer);
    void ServeRest(const Answerer& answer);

    const oxPipeSignalGuard m_pipeSignal;
    const oxScriptLimits m_limits;
    std::optional<Clock::time_point> m_deadline;
    std::optional<Clock::time_point> m_killAt;
    oxProc m_proc;
    bool m_spawned = false;
    bool m_interrupted = false;   // by a limit
    std::optional<int> m_result;  // of the engine, once it is reaped
    bool m_endSeen = false;       // its end was told; a traced one cannot be reaped at once all the same
    UniqueFd m_toEngine;
    UniqueFd m_fromEngine;
    UniqueFd m_engineStdin;
    UniqueFd m_engineStdout;
    std::string m_answers;       // not yet written
    bool m_answersLost = false;  // the engine reads no more
};
