// The arguments of a program, sorted by their form.
#pragma once

#include <cstddef>
#include <map>
#include <string>
#include <vector>

#include "platform/filename.h"

// An argument with a "-" anywhere is a switch, one with "=" or ":" a pair, any other a plain argument.
class oxCommandLine {
public:
    // Longer arguments are cut without a word.
    static constexpr std::size_t MAX_ARGUMENT = 79;

    // False when the program's own name is missing.
    bool Parse(int argc, const char* const* argv);

    // The switches in their order; null at the end. They live as long as the object.
    const std::string* First();
    const std::string* Next();
    // The equal entry of the switches or of the plain arguments, or null.
    const std::string* Find(const std::string& text) const;

    int ArgumentCount() const { return m_argumentCount; }
    const char* const* Arguments() const { return m_arguments; }
    const oxFilename& ProgramPath() const { return m_programPath; }
    const std::vector<std::string>& Switches() const { return m_switches; }
    const std::map<std::string, std::string>& Pairs() const { return m_pairs; }
    const std::vector<std::string>& PlainArguments() const { return m_plainArguments; }

private:
    void AddArgument(const std::string& argument);

    std::vector<std::string> m_switches;
    std::map<std::string, std::string> m_pairs;
    std::vector<std::string> m_plainArguments;
    oxFilename m_programPath;
    int m_argumentCount = 0;
    const char* const* m_arguments = nullptr;
    std::size_t m_cursor = 0;
};
