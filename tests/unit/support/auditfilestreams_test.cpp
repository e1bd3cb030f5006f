// The streams that a log writes to: copies of it, the echo, and streams that are not files.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <regex>
#include <string>

#include "support/auditfile.h"
#include "testing/scratch.h"

namespace {

struct Closing {
    void operator()(std::FILE* stream) const { std::fclose(stream); }
};
using Stream = std::unique_ptr<std::FILE, Closing>;

Stream Create(const Scratch& dir, const char* name) {
    Stream stream(std::fopen(dir.File(name).c_str(), "w"));
    EXPECT_NE(stream, nullptr) << name;
    return stream;
}

// The text with each time stamp replaced by "@ ".
std::string Unstamped(const std::string& text) {
    static const std::regex STAMP("[A-Z][a-z]{2}-\\d{2}-\\d{4} \\d{2}:\\d{2}:\\d{2}: ");
    return std::regex_replace(text, STAMP, "@ ");
}

TEST(oxAuditFile, EachLineIsOnTheEchoAsSoonAsItIsWritten) {
    const Scratch dir;
    const Stream echo = Create(dir, "echo");
    oxAuditFile log(dir.File("log").c_str(), "a");
    log.SetEcho(echo.get());
    log.Write("one", 1);
    EXPECT_EQ(dir.Read("echo"), "one\n");
    log.Printf("two");
    EXPECT_EQ(dir.Read("echo"), "one\ntwo\n");
    log.Printf(1, "three");
    EXPECT_EQ(dir.Read("echo"), "one\ntwo\nthree\n");
    log.Printf(2, "above the level");
    EXPECT_EQ(dir.Read("echo"), "one\ntwo\nthree\n");
}

TEST(oxAuditFile, ACopyHasBothStreams) {
    const Scratch dir;
    const Stream echo = Create(dir, "echo");
    oxAuditFile log(dir.File("log").c_str(), "a");
    log.SetEcho(echo.get());
    oxAuditFile copy(log);
    copy.Printf("by the copy");
    oxAuditFile assigned;
    assigned = log;
    assigned.Printf("by the assigned");
    EXPECT_EQ(Unstamped(dir.Read("log")), "@ by the copy\n@ by the assigned\n");
    EXPECT_EQ(dir.Read("echo"), "by the copy\nby the assigned\n");
}

TEST(oxAuditFile, AHandlersLineIsOnTheEchoWithoutAStamp) {
    const Scratch dir;
    const Stream echo = Create(dir, "echo");
    oxAuditFile log(dir.File("log").c_str(), "a");
    log.SetEcho(echo.get());
    log.WriteFromHandler("Memory allocation failed.");
    EXPECT_EQ(Unstamped(dir.Read("log")), "@ Memory allocation failed.\n");
    EXPECT_EQ(dir.Read("echo"), "Memory allocation failed.\n");
}

TEST(oxAuditFile, AnEchoThatFailedIsTriedAgain) {
    struct Screen {
        bool fails = true;
        std::string text{};
    } screen;
    const cookie_io_functions_t functions{.read = nullptr,
                                          .write = [](void* cookie, const char* bytes, size_t count) -> ssize_t {
                                              auto& to = *static_cast<Screen*>(cookie);
                                              if (to.fails)
                                                  return 0;
                                              to.text.append(bytes, count);
                                              return static_cast<ssize_t>(count);
                                          },
                                          .seek = nullptr,
                                          .close = nullptr};
    const Scratch dir;
    const Stream echo(fopencookie(&screen, "w", functions));
    ASSERT_NE(echo, nullptr);
    oxAuditFile log(dir.File("log").c_str(), "a");
    log.SetEcho(echo.get());
    log.Printf("one");
    EXPECT_NE(std::ferror(echo.get()), 0);
    EXPECT_EQ(screen.text, "");
    screen.fails = false;
    log.Printf("two");
    EXPECT_TRUE(screen.text.ends_with("two\n")) << screen.text;
    EXPECT_EQ(Unstamped(dir.Read("log")), "@ one\n@ two\n");
}

TEST(oxAuditFile, AStreamInMemoryHasEachLineAtOnce) {
    char* text = nullptr;
    std::size_t size = 0;
    {
        oxAuditFile log;
        log.Attach(open_memstream(&text, &size));
        ASSERT_NE(log.GetStream(), nullptr);
        log.Printf("one");
        EXPECT_EQ(Unstamped({text, size}), "@ one\n");
        log.Write("two\n", 1);
        EXPECT_EQ(Unstamped({text, size}), "@ one\n@ two\n");
    }
    EXPECT_EQ(Unstamped({text, size}), "@ one\n@ two\n");
    std::free(text);
}

TEST(oxAuditFile, WhatOthersPutIntoTheStreamComesFirst) {
    const Scratch dir;
    char* text = nullptr;
    std::size_t size = 0;
    oxAuditFile inFile;
    oxAuditFile inMemory;
    inFile.Attach(Create(dir, "log").release());
    inMemory.Attach(open_memstream(&text, &size));
    for (oxAuditFile* log : {&inFile, &inMemory}) {
        ASSERT_NE(log->GetStream(), nullptr);
        std::fputs("before\n", log->GetStream());
        log->Printf("line");
        std::fputs("behind\n", log->GetStream());
        log->Printf("last");
    }
    const std::string expected = "before\n@ line\nbehind\n@ last\n";
    EXPECT_EQ(Unstamped(dir.Read("log")), expected);
    EXPECT_EQ(Unstamped({text, size}), expected);
    inMemory.Close();
    std::free(text);
}

TEST(oxAuditFile, AttachKeepsTheEchoWhereNothingWasOpen) {
    for (const bool open : {false, true}) {
        const Scratch dir;
        const Stream echo = Create(dir, "echo");
        oxAuditFile log;
        if (open) {
            ASSERT_TRUE(log.Open(dir.File("before").c_str(), "a"));
        }
        log.SetEcho(echo.get());
        log.Attach(Create(dir, "log").release());
        log.Printf("line");
        EXPECT_EQ(Unstamped(dir.Read("log")), "@ line\n");
        EXPECT_EQ(dir.Read("echo"), open ? "" : "line\n") << "closing forgets the echo";
    }
}

}  // namespace
