#include "remotescript/enginerun.h"

#include <fcntl.h>
#include <pthread.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <ctime>
#include <thread>

#include "platform/text.h"

namespace {

using std::chrono::milliseconds;

constexpr std::string_view EXIT_MESSAGE = "EXIT";
// Far more than any run, and small enough for the sum with the clock.
constexpr std::chrono::seconds LONGEST_RUN = std::chrono::hours(24 * 365 * 10);

// The numbers 0 to 2 stand for the standard streams, 0 in a child's settings even for none at all.
bool MoveAboveStandardStreams(UniqueFd& descriptor) {
    if (descriptor.Get() > STDERR_FILENO)
        return true;
    UniqueFd moved(fcntl(descriptor.Get(), F_DUPFD_CLOEXEC, STDERR_FILENO + 1));
    if (!moved)
        return false;
    descriptor = std::move(moved);
    return true;
}

bool MakePipe(UniqueFd& readEnd, UniqueFd& writeEnd) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0)
        return false;
    readEnd.Reset(ends[0]);
    writeEnd.Reset(ends[1]);
    return MoveAboveStandardStreams(readEnd) && MoveAboveStandardStreams(writeEnd);
}

bool SetNonBlocking(const UniqueFd& descriptor) {
    return fcntl(descriptor.Get(), F_SETFL, fcntl(descriptor.Get(), F_GETFL) | O_NONBLOCK) == 0;
}

void CloseChildEnd(int& descriptor) {
    if (descriptor > 0)
        UniqueFd(descriptor).Reset();
    descriptor = 0;
}

void ReportLostQuery(int error) {
    std::fprintf(stderr, "Unable to transmit query to the scripting engine %d: %s\n", error, GetLastErrorText(error));
}

sigset_t PipeSignal() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGPIPE);
    return signals;
}

}  // namespace

oxPipeSignalGuard::oxPipeSignalGuard() {
    const sigset_t pipe = PipeSignal();
    sigset_t before;
    sigemptyset(&before);
    pthread_sigmask(SIG_BLOCK, &pipe, &before);
    m_wasBlocked = sigismember(&before, SIGPIPE) == 1;
}

oxPipeSignalGuard::~oxPipeSignalGuard() {
    if (m_wasBlocked)
        return;
    const int savedError = errno;
    const sigset_t pipe = PipeSignal();
    const timespec noTime{};
    while (sigtimedwait(&pipe, nullptr, &noTime) > 0 || errno == EINTR) {
    }
    pthread_sigmask(SIG_UNBLOCK, &pipe, nullptr);
    errno = savedError;
}

void SendAnswer(int descriptor, std::string_view answer) {
    const oxPipeSignalGuard pipeSignal;
    while (!answer.empty()) {
        const ssize_t count = write(descriptor, answer.data(), answer.size());
        if (count > 0)
            answer.remove_prefix(static_cast<std::size_t>(count));
        else if (count == 0 || (errno == EAGAIN && WaitWritable(descriptor) != Readiness::Ready) ||
                 (errno != EAGAIN && errno != EINTR))
            return;
    }
}

oxEngineRun::oxEngineRun(const oxScriptLimits& limits) : m_limits(limits) {
    if (limits.time.count() > 0)
        m_deadline = Clock::now() + std::min(limits.time, LONGEST_RUN);
}

oxEngineRun::~oxEngineRun() {
    if (m_spawned && !HasEnded()) {
        m_proc.Kill();
        m_proc.Wait(oxProc::NO_LIMIT);
    }
    CloseChildEnd(m_proc.m_childStdin);
    CloseChildEnd(m_proc.m_childStdout);
}

bool oxEngineRun::MakePipes() {
    // The engine's ends block, as a program expects of its standard streams.
    return MakePipe(m_engineStdin, m_toEngine) && MakePipe(m_fromEngine, m_engineStdout) &&
           SetNonBlocking(m_toEngine) && SetNonBlocking(m_fromEngine);
}

bool oxEngineRun::Spawn(const char* program, const char* arguments) {
    m_proc.m_childStdin = m_engineStdin.Release();
    m_proc.m_childStdout = m_engineStdout.Release();
    m_spawned = m_proc.Spawn(program, arguments) != 0;
    return m_spawned;
}

void oxEngineRun::Serve(std::string_view data, const Answerer& answer) {
    bool talking = true;  // messages may still come
    while (Send(data) && (talking || !data.empty())) {
        if (HasEnded()) {
            // A child of the engine may hold the pipes open: nobody waits for it.
            if (!data.empty())
                ReportLostQuery(EPIPE);
            else
                ServeRest(answer);
            return;
        }
        KeepLimits();
        if (IsKillDue())
            return;
        const bool reading = talking && m_answers.size() < MAX_QUEUED_ANSWERS;
        WaitForEvent(!data.empty() || !m_answers.empty(), reading);
        if (reading && !TakeMessage(answer)) {
            talking = false;
            EndWithin(milliseconds(oxRemoteScript::END_WAIT));
        }
    }
}

int oxEngineRun::AwaitEnd() {
    m_toEngine.Reset();
    m_fromEngine.Reset();
    EndWithin(milliseconds(oxRemoteScript::END_WAIT));
    while (!HasEnded()) {
        KeepLimits();
        if (IsKillDue()) {
            m_proc.Kill();
            m_result = m_proc.Wait(oxProc::NO_LIMIT);
        } else {
            WaitForEvent(false, false);
        }
    }
    return m_interrupted ? oxRemoteScript::RESULT_ENDED : *m_result;
}

bool oxEngineRun::IsOver() {
    KeepLimits();
    return m_interrupted || HasEnded();
}

bool oxEngineRun::HasEnded() {
    if (!m_result) {
        const int result = m_proc.Wait(0);
        if (result != oxProc::STILL_RUNNING)
            m_result = result;
    }
    return m_result.has_value();
}

bool oxEngineRun::IsOverdue() const {
    return (m_limits.stop != nullptr && m_limits.stop->load()) || (m_deadline && Clock::now() >= *m_deadline);
}

void oxEngineRun::KeepLimits() {
    if (m_interrupted || !IsOverdue())
        return;
    m_interrupted = true;
    m_proc.Terminate(false);
    EndWithin(oxRemoteScript::END_GRACE);
}

// Sets the moment of the kill; an earlier one stays.
void oxEngineRun::EndWithin(milliseconds time) {
    const Clock::time_point end = Clock::now() + time;
    m_killAt = m_killAt ? std::min(*m_killAt, end) : end;
}

WaitLimit oxEngineRun::UntilNextLook() const {
    WaitLimit limit;
    const auto sooner = [&limit](milliseconds time) { limit = limit ? std::min(*limit, time) : time; };
    const auto until = [](Clock::time_point end) { return std::chrono::ceil<milliseconds>(end - Clock::now()); };
    if (m_proc.EndDescriptor() < 0 || m_endSeen)
        sooner(NAP);
    if (m_killAt)
        sooner(until(*m_killAt));
    if (m_limits.stop != nullptr && !m_interrupted)
        sooner(oxRemoteScript::STOP_TICK);
    if (m_deadline && !m_interrupted)
        sooner(until(*m_deadline));
    return limit ? std::max(*limit, milliseconds(0)) : limit;
}

void oxEngineRun::WaitForEvent(bool writing, bool reading) {
    // A number of -1 is passed over; an end that is not asked about would report its hang-up without end.
    std::array<pollfd, 3> entries{{{writing ? m_toEngine.Get() : -1, POLLOUT, 0},
                                   {reading ? m_fromEngine.Get() : -1, POLLIN, 0},
                                   {m_endSeen ? -1 : m_proc.EndDescriptor(), POLLIN, 0}}};
    if (PollAll(entries, UntilNextLook()) < 0)
        std::this_thread::sleep_for(NAP);  // no memory at the moment
    else if (entries[2].revents != 0)
        m_endSeen = true;
}

// Writes what there is room for, the data first. False when the data cannot be written.
bool oxEngineRun::Send(std::string_view& data) {
    while (!data.empty()) {
        const ssize_t count = write(m_toEngine.Get(), data.data(), data.size());
        if (count >= 0) {
            data.remove_prefix(static_cast<std::size_t>(count));
        } else if (errno == EAGAIN) {
            return true;
        } else if (errno != EINTR) {
            ReportLostQuery(errno);
            return false;
        }
    }
    while (!m_answers.empty()) {
        const ssize_t count = write(m_toEngine.Get(), m_answers.data(), m_answers.size());
        if (count >= 0) {
            m_answers.erase(0, static_cast<std::size_t>(count));
        } else if (errno == EAGAIN) {
            return true;
        } else if (errno != EINTR) {
            m_answersLost = true;
            m_answers.clear();
        }
    }
    return true;
}

ssize_t oxEngineRun::ReadMessage(char* message) const {
    ssize_t count = 0;
    do
        count = read(m_fromEngine.Get(), message, oxRemoteScript::MAX_MESSAGE);
    while (count < 0 && errno == EINTR);
    if (count > 0 && std::string_view(message, static_cast<std::size_t>(count)).starts_with(EXIT_MESSAGE))
        return 0;
    return count;
}

// Serves the message that is there, if one is. False when the engine has said its last word.
bool oxEngineRun::TakeMessage(const Answerer& answer) {
    char message[oxRemoteScript::MAX_MESSAGE];
    const ssize_t count = ReadMessage(message);
    if (count < 0 && errno == EAGAIN)
        return true;
    if (count <= 0)
        return false;
    const std::string text = answer(message, static_cast<int>(count));
    if (!m_answersLost)
        m_answers += text;
    return true;
}

// Serves what the engine left in the pipe when it ended, and nothing that comes later.
void oxEngineRun::ServeRest(const Answerer& answer) {
    int left = 0;
    if (ioctl(m_fromEngine.Get(), FIONREAD, &left) != 0)
        return;
    while (left > 0 && !IsOverdue()) {
        char message[oxRemoteScript::MAX_MESSAGE];
        const ssize_t count = ReadMessage(message);
        if (count <= 0)
            return;
        answer(message, static_cast<int>(count));
        left -= static_cast<int>(count);
    }
}
