// The handlers of last resort.
#pragma once

// Out of memory: one line in the audit log, then std::bad_alloc. The handler before it comes back at exit.
void InstallNewHandler();
// An exception that nobody caught ends the process by `AbnormalTermination`.
void InstallTerminateHandler();

// One line in the audit log (on standard error while there is none) and exit status 1, at once: exit handlers would
// take the server apart under its running threads.
[[noreturn]] void AbnormalTermination() noexcept;
