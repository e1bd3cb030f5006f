#include "platform/file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>

UniqueFd& UniqueFd::operator=(UniqueFd&& other) noexcept {
    if (this != &other)
        Reset(other.Release());
    return *this;
}

void UniqueFd::Reset(int descriptor) {
    const int old = std::exchange(m_descriptor, descriptor);
    if (old < 0 || old == descriptor)
        return;
    const int savedError = errno;
    // Not repeated when interrupted: Linux has given the number back by then.
    close(old);
    errno = savedError;
}

UniqueFd OpenFile(const std::string& path, int flags, mode_t mode) {
    int descriptor = -1;
    do {
        descriptor = open(path.c_str(), flags | O_CLOEXEC | O_NOCTTY, mode);
    } while (descriptor < 0 && errno == EINTR);
    return UniqueFd(descriptor);
}

bool DuplicateOnto(int from, int to) {
    int result;
    do
        result = dup2(from, to);
    while (result < 0 && (errno == EINTR || errno == EBUSY));
    return result >= 0;
}

bool ReadWholeFile(const std::string& path, std::string& content) {
    constexpr std::size_t BLOCK_BYTES = 16384;
    content.clear();
    const UniqueFd file = OpenFile(path, O_RDONLY | O_NONBLOCK);
    struct stat status;
    if (!file || fstat(file.Get(), &status) != 0)
        return false;
    // A pipe that nobody writes to would hold up the reader, a device may have no end.
    if (!S_ISREG(status.st_mode)) {
        errno = S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
        return false;
    }
    std::array<char, BLOCK_BYTES> block;
    while (true) {
        const ssize_t count = read(file.Get(), block.data(), block.size());
        if (count > 0)
            content.append(block.data(), static_cast<std::size_t>(count));
        else if (count == 0)
            return true;
        else if (errno != EINTR)
            return false;
    }
}

bool WriteAll(int descriptor, const char* text, std::size_t length) {
    while (length > 0) {
        const ssize_t count = write(descriptor, text, length);
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return false;
        if (count == 0) {
            errno = EIO;
            return false;
        }
        text += count;
        length -= static_cast<std::size_t>(count);
    }
    return true;
}
