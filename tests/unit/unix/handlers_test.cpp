#include "unix/handlers.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <new>
#include <stdexcept>
#include <thread>

#include "unix/audit.h"
#include "unix/testtools.h"

namespace {
// Runs in a child whose audit log is a file; the log without its time stamps.
std::string LogOf(int wantedStatus, const std::function<void()>& function) {
    const ScratchDirectory scratch;
    EXPECT_EQ(RunInChild([&] {
                  theAudit().Open("./audit", "w+", stderr);
                  InstallNewHandler();
                  InstallTerminateHandler();
                  function();
                  return 0;
              }),
              wantedStatus);
    std::string text = ReadText("audit");
    constexpr std::size_t STAMP = sizeof "Jan-01-2001 00:00:00: " - 1;
    return text.size() < STAMP ? text : text.substr(STAMP);
}
}  // namespace

TEST(NewHandler, LogsAndThrows) {
    EXPECT_EQ(LogOf(0,
                    [] {
                        try {
                            std::get_new_handler()();
                        } catch (const std::bad_alloc&) {
                            return;
                        }
                        _exit(9);
                    }),
              "Memory allocation failed.\n");
}

TEST(NewHandler, TheOneBeforeItComesBackAtExit) {
    static const std::new_handler BEFORE = [] { throw std::bad_alloc(); };
    EXPECT_EQ(LogOf(7,
                    [] {
                        std::set_new_handler(BEFORE);
                        std::atexit([] { _exit(std::get_new_handler() == BEFORE ? 7 : 8); });
                        InstallNewHandler();
                        if (std::get_new_handler() == BEFORE)
                            _exit(9);
                        std::exit(10);
                    }),
              "");
}

TEST(TerminateHandler, AnUncaughtExceptionOfAThreadEndsTheProcess) {
    EXPECT_EQ(LogOf(1, [] { std::thread([] { throw std::runtime_error("x"); }).join(); }),
              "Abnormal program termination.\n");
}

TEST(AbnormalTermination, SaysSoOnStandardErrorWhileThereIsNoLog) {
    const ScratchDirectory scratch;
    EXPECT_EQ(RunInChild([] {
                  RedirectTo(2, "errors");
                  AbnormalTermination();
                  return 0;
              }),
              1);
    EXPECT_EQ(ReadText("errors"), "Abnormal program termination.\n");
}
