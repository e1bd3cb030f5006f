#include "platform/poll.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>

namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

Readiness WaitFor(int descriptor, short events, WaitLimit limit) {
    pollfd entry{descriptor, events, 0};
    // poll passes over negative numbers and would wait for nothing.
    if (descriptor < 0) {
        errno = EBADF;
        return Readiness::Failed;
    }
    const int count = PollAll(std::span(&entry, 1), limit);
    if (count == 0)
        return Readiness::TimedOut;
    if (count > 0 && (entry.revents & POLLNVAL) == 0)
        return Readiness::Ready;
    if (count > 0)
        errno = EBADF;
    return Readiness::Failed;
}

}  // namespace

Readiness WaitReadable(int descriptor, WaitLimit limit) {
    return WaitFor(descriptor, POLLIN, limit);
}

Readiness WaitWritable(int descriptor, WaitLimit limit) {
    return WaitFor(descriptor, POLLOUT, limit);
}

int PollAll(std::span<pollfd> descriptors, WaitLimit limit) {
    constexpr milliseconds NO_WAIT(0);
    constexpr milliseconds LONGEST_POLL(INT_MAX);
    const steady_clock::time_point start = steady_clock::now();
    milliseconds left = limit.value_or(LONGEST_POLL);
    while (true) {
        const auto step = std::clamp(left, NO_WAIT, LONGEST_POLL);
        const int timeout = limit ? static_cast<int>(step.count()) : -1;
        const int count = poll(descriptors.data(), static_cast<nfds_t>(descriptors.size()), timeout);
        if (count > 0 || (count < 0 && errno != EINTR))
            return count;
        if (!limit)
            continue;
        left = *limit - std::chrono::floor<milliseconds>(steady_clock::now() - start);
        // An interrupted wait whose time is over still looks once more.
        if (count == 0 && left <= NO_WAIT)
            return 0;
    }
}

oxWakeup::oxWakeup() : m_descriptor(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

void oxWakeup::Wake() {
    const int savedError = errno;
    const std::uint64_t one = 1;
    // A full counter (EAGAIN) is readable already.
    while (write(m_descriptor.Get(), &one, sizeof(one)) < 0 && errno == EINTR) {
    }
    errno = savedError;
}

void oxWakeup::Clear() {
    const int savedError = errno;
    std::uint64_t count = 0;
    while (read(m_descriptor.Get(), &count, sizeof(count)) < 0 && errno == EINTR) {
    }
    errno = savedError;
}
