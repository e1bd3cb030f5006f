// A directory with the engine of the tests in it, and what a run must not leave behind.
#pragma once

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <set>
#include <sstream>
#include <string>

#include "testing/scratch.h"

class EngineHome {
public:
    EngineHome() { std::filesystem::create_symlink(OX_TEST_ENGINE, Engine()); }

    const std::string& Path() const { return m_scratch.Path(); }
    const Scratch& Files() const { return m_scratch; }
    std::string File(const std::string& name) const { return m_scratch.File(name); }
    std::string Engine() const { return File("ox_script.bin"); }
    // A script of these moves (tests/engine/engine.cpp tells them).
    std::string Script(const std::string& name, const std::string& moves) const { return m_scratch.Write(name, moves); }

private:
    const Scratch m_scratch;
};

// The open descriptors, each with what it is. The standard input is left out: every run puts the standard error there.
inline std::set<std::string> OpenDescriptors() {
    std::set<std::string> open;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code error;
        const auto target = std::filesystem::read_symlink(entry.path(), error);
        // The listing's own descriptor is the only directory.
        const std::string number = entry.path().filename();
        if (number != "0" && !error && !std::filesystem::is_directory(target, error))
            open.insert(number + " " + target.string());
    }
    return open;
}

// A running one or a zombie.
inline bool HasChildren() {
    siginfo_t info{};
    return waitid(P_ALL, 0, &info, WEXITED | WNOHANG | WNOWAIT) == 0;
}

// The text behind a word that begins a line; empty when no line begins so.
inline std::string LineAfter(const std::string& text, const std::string& word) {
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);)
        if (line.starts_with(word))
            return line.substr(word.size());
    return {};
}

// Ends the child that a "fork-sleep" move left behind, when the test is over.
class LeftBehind {
public:
    explicit LeftBehind(const std::string& output) : m_pid(std::atoi(LineAfter(output, "child ").c_str())) {}
    ~LeftBehind() {
        if (m_pid > 0)
            kill(m_pid, SIGKILL);
    }
    LeftBehind(const LeftBehind&) = delete;
    LeftBehind& operator=(const LeftBehind&) = delete;
    bool IsAlive() const { return m_pid > 0 && kill(m_pid, 0) == 0; }

private:
    pid_t m_pid;
};
