#include "platform/filename.h"

#include <algorithm>

namespace {

constexpr char SLASH = '/';

// Without final slashes, but the root keeps one.
std::string_view WithoutFinalSlashes(std::string_view path) {
    while (path.size() > 1 && path.back() == SLASH)
        path.remove_suffix(1);
    return path;
}

}  // namespace

oxFilename::oxFilename(std::string_view path) {
    std::string_view fileName = path;
    if (const auto slash = path.rfind(SLASH); slash != std::string_view::npos) {
        m_directory = WithoutFinalSlashes(path.substr(0, slash + 1));
        fileName = path.substr(slash + 1);
    }
    const auto dot = fileName.rfind('.');
    m_hasDot = dot != std::string_view::npos;
    m_name = fileName.substr(0, dot);
    if (m_hasDot)
        m_extension = fileName.substr(dot + 1);
}

oxFilename::oxFilename(std::string_view directory, std::string_view fileName) : oxFilename(Join(directory, fileName)) {}

std::string oxFilename::FileName() const {
    std::string fileName = m_name;
    if (m_hasDot)
        fileName.append(1, '.').append(m_extension);
    return fileName;
}

std::string oxFilename::Path() const {
    return Join(m_directory, FileName());
}

void oxFilename::SetDirectory(std::string_view directory) {
    m_directory = WithoutFinalSlashes(directory);
}

void oxFilename::SetExtension(std::string_view extension) {
    m_extension = extension;
    m_hasDot = !extension.empty();
}

std::string oxFilename::Join(std::string_view directory, std::string_view name) {
    if (directory.empty())
        return std::string(name);
    directory = WithoutFinalSlashes(directory);
    name.remove_prefix(std::min(name.find_first_not_of(SLASH), name.size()));
    std::string path(directory);
    if (path.back() != SLASH)
        path += SLASH;
    return path.append(name);
}

std::string oxFilename::NormalizePath(std::string_view path) {
    std::string slashed(path);
    std::replace(slashed.begin(), slashed.end(), '\\', SLASH);
    std::string_view rest = slashed;
    std::string normal;
    if (rest.starts_with(SLASH))
        normal = SLASH;
    while (!rest.empty()) {
        const std::string_view part = rest.substr(0, rest.find(SLASH));
        rest.remove_prefix(std::min(part.size() + 1, rest.size()));
        if (part.empty() || (part == "." && !normal.empty()))
            continue;
        if (!normal.empty() && normal.back() != SLASH)
            normal += SLASH;
        normal += part;
    }
    return normal;
}
