#include "unix/programpath.h"

#include <unistd.h>

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
    program.SetDirectory(oxFilename::NormalizePath(oxFilename::Join(working, directory)));
    return program;
}

std::string BesideProgram(const oxFilename& program, const char* extension) {
    oxFilename beside(program);
    beside.SetExtension(extension);
    return beside.Path();
}
