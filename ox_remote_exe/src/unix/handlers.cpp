#include "unix/handlers.h"

#include <unistd.h>

#include <cstdlib>
#include <exception>
#include <new>
#include <string_view>

#include "platform/file.h"
#include "unix/audit.h"

namespace {
std::new_handler previousNewHandler = nullptr;

void OutOfMemory() {
    theAudit().WriteFromHandler("Memory allocation failed.");
    throw std::bad_alloc();
}
}  // namespace

void InstallNewHandler() {
    theAudit();  // must exist before memory is short
    previousNewHandler = std::set_new_handler(&OutOfMemory);
    std::atexit([] { std::set_new_handler(previousNewHandler); });
}

void InstallTerminateHandler() {
    std::set_terminate(&AbnormalTermination);
}

void AbnormalTermination() noexcept {
    static constexpr std::string_view MESSAGE = "Abnormal program termination.\n";
    if (theAudit().GetStream() != nullptr)
        theAudit().WriteFromHandler(MESSAGE.substr(0, MESSAGE.size() - 1));
    else
        WriteAll(STDERR_FILENO, MESSAGE.data(), MESSAGE.size());
    _exit(EXIT_FAILURE);
}
