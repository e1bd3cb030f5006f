// Directories: listing, creating, full names.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>
#include <vector>

#include "platform/file.h"

// The longest path, with its NUL, that the program works with.
inline constexpr std::size_t MAX_PATH_BYTES = 4096;

// The absolute form of a path, against the working directory where it is relative, with links resolved where it exists.
// When it does not exist its text is joined to the working directory. False with errno when the working directory
// cannot be read or the result is longer than MAX_PATH_BYTES - 1 characters.
bool GetFullDirectoryName(const std::string& directory, std::string& full);

// Creates the directory with the mode, and those above it that are missing with DIRECTORY_MODE. True when it exists
// afterwards; false with errno (ENOTDIR when something else has the name).
bool CreateDir(const std::string& directory, mode_t mode = DIRECTORY_MODE);

// The names in a directory that match a shell pattern ("*.usr"), sorted, so that every listing has one order.
// Names that begin with a dot match only a pattern that begins with one.
class oxDirIterator {
public:
    oxDirIterator(const std::string& directory, const std::string& pattern);

    // False when the directory could not be listed completely; `Error` is the errno.
    bool IsValid() const { return m_error == 0; }
    int Error() const { return m_error; }
    // The next name, or null at the end. It lives as long as the iterator.
    const std::string* Next();

private:
    std::vector<std::string> m_names;
    std::size_t m_next = 0;
    int m_error = 0;
};
