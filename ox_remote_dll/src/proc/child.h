// The child's side of oxProc: what runs until the program starts.
#pragma once

#include <sys/resource.h>
#include <sys/types.h>

#include <array>

#include "proc.h"

// Everything that the child needs, made ready before the fork. The texts belong to others, which outlive the fork.
struct oxChildPlan {
    // The program, its arguments and a null in every case.
    std::array<char*, oxProc::MAX_ARGUMENTS + 2> arguments{};
    const char* program = nullptr;
    const char* directory = nullptr;  // null: the server's
    unsigned priority = oxProc::PRIORITY_UNCHANGED;
    bool runAsRealUser = false;
    int standardInput = 0;  // 0: as the server's; so the next two
    int standardOutput = 0;
    int standardError = 0;
    const rlimit* fileLimit = nullptr;  // null: as the server's
    pid_t parent = 0;
};

// Becomes the program, or says on standard error why it cannot, and ends the process with the error number. The child
// has one thread, perhaps in the memory of its parent, whose other threads run on and hold whatever locks they hold:
// only system calls are made here, nothing is allocated, written to or printed through a stream. Expects all signals
// blocked.
[[noreturn]] void RunChild(const oxChildPlan& plan) noexcept;
