#include "unix/programpath.h"

#include <unistd.h>

#include <algorithm>
#include <string_view>

namespace {
constexpr std::size_t DIRECTORY_BUFFER = 4095;
}

oxFilename ProgramPath(const char* calledName) {
    oxFilename program(calledName != nullptr ? calledName : "");
    const std::string& directory = program.Directory();
    if (!directory.empty() && directory.front() == '/')
        return program;
    char buffer[DIRECTORY_BUFFER];
    // Without a readable working directory "." still leads there.
    const std::string working = getcwd(buffer, sizeof buffer) != nullptr ? buffer : ".";
    std::string_view relative = directory;
    while (relative == "." || relative.starts_with("./"))
        relative.remove_prefix(std::min<std::size_t>(2, relative.size()));
    program.SetDirectory(oxFilename::Join(working, relative));
    return program;
}

std::string BesideProgram(const oxFilename& program, const char* extension) {
    oxFilename beside(program);
    beside.SetExtension(extension);
    return beside.Path();
}
