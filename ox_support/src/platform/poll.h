// Waiting for descriptors: the one readiness helper of the program, on poll(2), so any descriptor number works.
#pragma once

#include <poll.h>

#include <chrono>
#include <optional>
#include <span>

#include "platform/file.h"

enum class Readiness {
    Ready,  // readable or writable as asked, or at its end (hang-up, error): the next call tells
    TimedOut,
    Failed  // errno says why
};

// No value waits for ever.
using WaitLimit = std::optional<std::chrono::milliseconds>;

// Interrupted waits are resumed with what is left of the time (monotonic clock).
Readiness WaitReadable(int descriptor, WaitLimit limit = std::nullopt);
Readiness WaitWritable(int descriptor, WaitLimit limit = std::nullopt);
// poll(2) over several descriptors, resumed when interrupted: the count of ready ones, 0 at the time limit, -1 with
// errno.
int PollAll(std::span<pollfd> descriptors, WaitLimit limit = std::nullopt);

// A descriptor that another thread makes readable to end a wait. It stays readable until `Clear`.
class oxWakeup {
public:
    oxWakeup();  // a wake-up without a descriptor (none left) is never readable: give waits a limit
    void Wake();
    void Clear();
    int Descriptor() const { return m_descriptor.Get(); }

private:
    UniqueFd m_descriptor;
};
