#include "unix/commandline.h"

#include <algorithm>
#include <cstring>

namespace {
// The non-empty pieces between the delimiters.
std::vector<std::string> Split(const std::string& text, const char* delimiters) {
    std::vector<std::string> pieces;
    std::size_t begin = text.find_first_not_of(delimiters);
    while (begin != std::string::npos) {
        const std::size_t end = text.find_first_of(delimiters, begin);
        pieces.push_back(text.substr(begin, end == std::string::npos ? end : end - begin));
        begin = text.find_first_not_of(delimiters, end);
    }
    return pieces;
}
}  // namespace

bool oxCommandLine::Parse(int argc, const char* const* argv) {
    if (argc < 1 || argv == nullptr || argv[0] == nullptr)
        return false;
    m_argumentCount = argc;
    m_arguments = argv;
    m_programPath = oxFilename(argv[0]);
    for (int i = 1; i < argc && argv[i] != nullptr; ++i)
        AddArgument(std::string(argv[i], strnlen(argv[i], MAX_ARGUMENT)));
    return true;
}

void oxCommandLine::AddArgument(const std::string& argument) {
    if (argument.find('-') != std::string::npos) {
        const auto pieces = Split(argument, "-");
        if (!pieces.empty())
            m_switches.push_back(pieces.front());
    } else if (argument.find_first_of("=:") == std::string::npos) {
        m_plainArguments.push_back(argument);
    } else {
        const auto pieces = Split(argument, "=:");
        if (!pieces.empty())
            m_pairs[pieces[0]] = pieces.size() > 1 ? pieces[1] : std::string();
    }
}

const std::string* oxCommandLine::First() {
    m_cursor = 0;
    return Next();
}

const std::string* oxCommandLine::Next() {
    return m_cursor < m_switches.size() ? &m_switches[m_cursor++] : nullptr;
}

const std::string* oxCommandLine::Find(const std::string& text) const {
    for (const auto* list : {&m_switches, &m_plainArguments}) {
        const auto found = std::find(list->begin(), list->end(), text);
        if (found != list->end())
            return &*found;
    }
    return nullptr;
}
