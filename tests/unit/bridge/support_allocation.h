// An allocator that fails, for tests.
#pragma once

// From now on, until it is called with false, operator new has no memory for this thread.
void FailAllocations(bool fail);
