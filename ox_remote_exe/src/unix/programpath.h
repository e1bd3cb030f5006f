// Where the program lies, and the files that lie beside it.
#pragma once

#include <string>

#include "platform/filename.h"

// The program's path from the name it was called by. A relative directory is taken against the working directory,
// without resolving links; a bare name (found through PATH) counts as lying in the working directory.
oxFilename ProgramPath(const char* calledName);

// The file beside the program that has its name and the extension: "pid", "startup".
std::string BesideProgram(const oxFilename& program, const char* extension);
