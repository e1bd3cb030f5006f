// What the test engine can do on its pipes, its output file and its process. A move that fails ends the engine.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

[[noreturn]] void Fail(const std::string& what);

struct Answer {
    std::int32_t status = 0;
    std::string text;
};

class Moves {
public:
    explicit Moves(std::vector<std::string> arguments) : m_arguments(std::move(arguments)) {}

    void Send(std::int32_t command, const std::string& first, const std::string& second);
    void Raw(std::string_view bytes);
    void Flood(std::size_t count, std::size_t size);
    Answer ReadAnswer();
    std::string ReadInput(std::size_t count);
    std::size_t AnnouncedLength() const;
    void WriteOutput(std::string_view text) const;
    // The engine as the system sees it: arguments, /proc/self/status, descriptors, file-creation mask, limits,
    // directory, environment; each line begins with its kind.
    std::string Status() const;
    // A child that keeps both pipes open; the output file gets its pid.
    void ForkSleep(double seconds) const;
    const std::string& Argument(std::size_t index) const;

private:
    std::vector<std::string> m_arguments;
};

void SleepFor(double seconds);
