// The failing allocator of the scripts' tests, for this program too.
#include "bridge/support_allocation.cpp"  // NOLINT(bugprone-suspicious-include): replaced operators are one program's
