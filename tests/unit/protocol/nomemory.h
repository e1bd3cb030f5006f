// A stretch of a test without memory.
#pragma once

#include "bridge/support_allocation.h"

// While it lives, operator new has no memory for this thread.
class NoMemory {
public:
    NoMemory() { FailAllocations(true); }
    ~NoMemory() { FailAllocations(false); }
    NoMemory(const NoMemory&) = delete;
    NoMemory& operator=(const NoMemory&) = delete;
};
