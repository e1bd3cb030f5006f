// What the tests of process control share.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <string>
#include <vector>

#include "support/auditfile.h"
#include "testing/scratch.h"

// A scratch directory that is the working directory while it lives.
class ScratchDirectory : public Scratch {
public:
    ScratchDirectory() : m_previous(std::filesystem::current_path()) { std::filesystem::current_path(Path()); }
    ~ScratchDirectory() { std::filesystem::current_path(m_previous); }

private:
    std::filesystem::path m_previous;
};

inline void WriteText(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
}

inline std::string ReadText(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

// Keeps the lines instead of writing them, those with a level as "level|text".
class LinesAudit : public oxAuditFile {
public:
    void Printf(const char* format, ...) override __attribute__((format(printf, 2, 3))) {
        va_list arguments;
        va_start(arguments, format);
        lines.push_back(Text(format, arguments));
        va_end(arguments);
    }
    void Printf(int level, const char* format, ...) override __attribute__((format(printf, 3, 4))) {
        va_list arguments;
        va_start(arguments, format);
        lines.push_back(std::to_string(level) + "|" + Text(format, arguments));
        va_end(arguments);
    }
    std::vector<std::string> lines;

private:
    static std::string Text(const char* format, va_list arguments) {
        char text[4096];
        std::vsnprintf(text, sizeof text, format, arguments);
        return text;
    }
};

// A stream whose text can be read back.
class TextStream {
public:
    TextStream() : m_file(std::tmpfile()) {}
    ~TextStream() { std::fclose(m_file); }
    TextStream(const TextStream&) = delete;
    TextStream& operator=(const TextStream&) = delete;

    std::FILE* File() { return m_file; }
    std::string Text() {
        std::fflush(m_file);
        std::rewind(m_file);
        std::string text;
        char buffer[4096];
        for (std::size_t count; (count = std::fread(buffer, 1, sizeof buffer, m_file)) > 0;)
            text.append(buffer, count);
        return text;
    }

private:
    std::FILE* m_file;
};

// Starts a child that runs the function and exits with its result.
inline pid_t StartChild(const std::function<int()>& function) {
    std::fflush(nullptr);
    const pid_t child = fork();
    if (child == 0)
        _exit(function());
    return child;
}

// The child's exit status, or 1000 + the signal that ended it.
inline int Reap(pid_t child) {
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
}

inline int RunInChild(const std::function<int()>& function) {
    return Reap(StartChild(function));
}

// For children: their standard output or error goes to a file.
inline void RedirectTo(int descriptor, const std::string& path) {
    const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(file, descriptor);
    close(file);
}
