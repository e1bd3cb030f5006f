// What the tests of child programs share.
#pragma once

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <set>
#include <sstream>
#include <string>

#include "platform/file.h"
#include "platform/identitycalls.h"
#include "proc.h"
#include "testing/waiting.h"

inline std::string TextOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

struct TestPipe {
    TestPipe() {
        int ends[2] = {-1, -1};
        if (pipe2(ends, O_CLOEXEC) != 0)
            std::abort();
        readEnd.Reset(ends[0]);
        writeEnd.Reset(ends[1]);
    }
    // All up to the end of the other side.
    std::string ReadAll() const {
        std::string text;
        char block[4096];
        while (true) {
            const ssize_t count = read(readEnd.Get(), block, sizeof block);
            if (count > 0)
                text.append(block, static_cast<std::size_t>(count));
            else if (count == 0 || errno != EINTR)
                return text;
        }
    }
    UniqueFd readEnd;
    UniqueFd writeEnd;
};

// The process's standard error goes to a file while it lives.
class CapturedError {
public:
    CapturedError() : m_file(std::tmpfile()), m_before(fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3)) {
        if (m_file == nullptr || !m_before || !DuplicateOnto(fileno(m_file), STDERR_FILENO))
            std::abort();
    }
    ~CapturedError() {
        DuplicateOnto(m_before.Get(), STDERR_FILENO);
        std::fclose(m_file);
    }
    CapturedError(const CapturedError&) = delete;
    CapturedError& operator=(const CapturedError&) = delete;
    std::string Text() const {
        std::string text;
        char block[4096];
        off_t at = 0;
        for (ssize_t count; (count = pread(fileno(m_file), block, sizeof block, at)) > 0; at += count)
            text.append(block, static_cast<std::size_t>(count));
        return text;
    }

private:
    std::FILE* const m_file;
    UniqueFd m_before;
};

struct ProgramEnd {
    std::string output;  // of standard output
    int result = oxProc::STILL_RUNNING;
};

// Runs the program to its end.
inline ProgramEnd RunProgram(oxProc& proc, const char* program, const char* arguments,
                             unsigned priority = oxProc::PRIORITY_UNCHANGED, const char* directory = nullptr) {
    TestPipe pipe;
    proc.m_childStdout = pipe.writeEnd.Release();
    ProgramEnd end;
    if (proc.Spawn(program, arguments, directory, false, priority) == 0) {
        close(proc.m_childStdout);
        proc.m_childStdout = 0;
        return end;
    }
    end.output = pipe.ReadAll();
    end.result = proc.Wait(oxProc::NO_LIMIT);
    return end;
}

// "value" of the line "name:\tvalue" as in /proc/self/status, its white space single blanks.
inline std::string StatusLine(const std::string& status, const std::string& name) {
    std::istringstream lines(status);
    for (std::string line; std::getline(lines, line);) {
        if (line.rfind(name + ":", 0) != 0)
            continue;
        std::istringstream words(line.substr(name.size() + 1));
        std::string value;
        for (std::string word; words >> word;)
            value += (value.empty() ? "" : " ") + word;
        return value;
    }
    return "no line " + name;
}

// False while it still is the copy of the test program.
inline bool RunsProgram(int pid, const std::string& name) {
    return TextOf("/proc/" + std::to_string(pid) + "/comm") == name + "\n";
}

inline std::set<int> DescriptorsOf(int pid) {
    std::set<int> descriptors;
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/fd", error))
        descriptors.insert(std::stoi(entry.path().filename().string()));
    return descriptors;
}

// Runs the function in a forked copy of the test program and returns its result, or 1000 + the signal that ended it.
inline int InForkedCopy(const std::function<int()>& function) {
    std::fflush(nullptr);
    const pid_t child = fork();
    if (child == 0)
        _exit(function());
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
}

inline bool IsRoot() {
    return getuid() == 0 && geteuid() == 0;
}
