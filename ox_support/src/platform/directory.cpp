#include "platform/directory.h"

#include <dirent.h>
#include <fnmatch.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdlib>
#include <memory>

#include "platform/filename.h"

namespace {

struct FreeMemory {
    void operator()(char* memory) const { std::free(memory); }
};

struct CloseDirectory {
    void operator()(DIR* directory) const { closedir(directory); }
};

bool IsDirectory(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

// True when the directory exists afterwards.
bool CreateOne(const std::string& path, mode_t mode) {
    if (mkdir(path.c_str(), mode) == 0)
        return true;
    // It may be there already, or be made by somebody else at this moment. The look comes second and for any error:
    // a read-only disk, for one, is reported before the existing name.
    const int error = errno;
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) {
        errno = error;
        return false;
    }
    if (S_ISDIR(status.st_mode))
        return true;
    errno = ENOTDIR;
    return false;
}

std::unique_ptr<DIR, CloseDirectory> OpenDirectory(const std::string& path) {
    DIR* directory = nullptr;
    do {
        directory = opendir(path.c_str());
    } while (directory == nullptr && errno == EINTR);
    return std::unique_ptr<DIR, CloseDirectory>(directory);
}

bool IsSelfOrParent(std::string_view name) {
    return name == "." || name == "..";
}

}  // namespace

bool GetFullDirectoryName(const std::string& directory, std::string& full) {
    full.clear();
    if (const std::unique_ptr<char, FreeMemory> real(realpath(directory.c_str(), nullptr)); real) {
        full = real.get();
    } else if (directory.starts_with('/')) {
        full = directory;
    } else {
        std::array<char, MAX_PATH_BYTES> current;
        if (getcwd(current.data(), current.size()) == nullptr) {
            if (errno == ERANGE)
                errno = ENAMETOOLONG;
            return false;
        }
        std::string_view rest = directory;
        while (rest.starts_with("./"))
            rest.remove_prefix(2);
        full = rest.empty() ? std::string(current.data()) : oxFilename::Join(current.data(), rest);
    }
    if (full.size() < MAX_PATH_BYTES)
        return true;
    full.clear();
    errno = ENAMETOOLONG;
    return false;
}

bool CreateDir(const std::string& directory, mode_t mode) {
    if (IsDirectory(directory))
        return true;
    const auto last = directory.find_last_not_of('/');
    const auto end = last == std::string::npos ? directory.size() : last + 1;
    for (auto slash = directory.find('/', 1); slash < end; slash = directory.find('/', slash + 1)) {
        const std::string above = directory.substr(0, slash);
        if (!IsDirectory(above) && !CreateOne(above, DIRECTORY_MODE))
            return false;
    }
    return CreateOne(directory.substr(0, end), mode);
}

oxDirIterator::oxDirIterator(const std::string& directory, const std::string& pattern) {
    const auto handle = OpenDirectory(directory);
    if (!handle) {
        m_error = errno;
        return;
    }
    while (true) {
        errno = 0;
        const dirent* entry = readdir(handle.get());
        if (entry == nullptr)
            break;
        if (!IsSelfOrParent(entry->d_name) && fnmatch(pattern.c_str(), entry->d_name, FNM_PERIOD) == 0)
            m_names.emplace_back(entry->d_name);
    }
    m_error = errno;
    // Nobody shall take a part of the names for all of them.
    if (m_error != 0)
        m_names.clear();
    std::sort(m_names.begin(), m_names.end());
}

const std::string* oxDirIterator::Next() {
    return m_next < m_names.size() ? &m_names[m_next++] : nullptr;
}
