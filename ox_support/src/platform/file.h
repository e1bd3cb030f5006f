// Descriptors that close themselves and files that are opened with an explicit mode, closed on exec.
#pragma once

#include <sys/types.h>

#include <string>
#include <utility>

// Owns one descriptor; -1 is none. Closing keeps errno.
class UniqueFd {
public:
    constexpr UniqueFd() = default;
    constexpr explicit UniqueFd(int descriptor) : m_descriptor(descriptor) {}
    UniqueFd(UniqueFd&& other) noexcept : m_descriptor(other.Release()) {}
    UniqueFd& operator=(UniqueFd&& other) noexcept;
    ~UniqueFd() { Reset(); }

    int Get() const { return m_descriptor; }
    explicit operator bool() const { return m_descriptor >= 0; }
    int Release() { return std::exchange(m_descriptor, -1); }
    void Reset(int descriptor = -1);

private:
    int m_descriptor = -1;
};

// The daemon runs with a file-creation mask of 0, so whatever creates a file says its mode.
inline constexpr mode_t LOG_FILE_MODE = 0644;
inline constexpr mode_t PRIVATE_FILE_MODE = 0600;
inline constexpr mode_t PID_FILE_MODE = 0664;
inline constexpr mode_t DIRECTORY_MODE = 0755;
inline constexpr mode_t PRIVATE_DIRECTORY_MODE = 0700;

// open(2) with O_CLOEXEC and O_NOCTTY added, repeated when interrupted. An empty result leaves errno set.
UniqueFd OpenFile(const std::string& path, int flags, mode_t mode = PRIVATE_FILE_MODE);
// dup2(2), repeated where it has to be: makes `to` another number of the same open file, without close-on-exec. False
// with errno.
bool DuplicateOnto(int from, int to);
// Reads the whole of a regular file. False with errno on failure; a directory fails with EISDIR, a pipe or device with
// EINVAL.
bool ReadWholeFile(const std::string& path, std::string& content);
// Writes all of the text to the descriptor, through short writes and interruptions. False with errno.
bool WriteAll(int descriptor, const char* text, std::size_t length);
