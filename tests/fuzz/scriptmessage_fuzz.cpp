// The messages of the scripting engine: what is answered, and what the callback is given.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>

#include "platform/file.h"
#include "remotescript.h"

namespace {

constexpr std::size_t MAX = oxRemoteScript::MAX_MESSAGE;
// Only this many bytes of an input count: a message that is just too long must be among them.
constexpr std::size_t LONGEST_INPUT = MAX + 16;

void Check(bool holds) {
    if (!holds)
        std::abort();
}

// The line about each message that is not answered would bury all others. Only the stream is silent, not the
// descriptor: what a sanitizer finds is still told.
class Silence {
public:
    Silence() {
        static FILE* const nowhere = std::fopen("/dev/null", "we");
        Check(nowhere != nullptr);
        stderr = nowhere;
    }
    ~Silence() { stderr = m_stream; }
    Silence(const Silence&) = delete;
    Silence& operator=(const Silence&) = delete;

private:
    FILE* const m_stream = stderr;
};

struct Given {
    int calls = 0;
    std::string first;
    std::int32_t command = 0;
    std::string second;
};
Given given;

const char* Callback(void* context, const char* contextString, int command, char* argumentText, int* status) {
    Check(context == nullptr && *status == 0);
    ++given.calls;
    given.first = contextString;
    given.command = command;
    given.second = argumentText;
    // In place, as the decoding of arguments does.
    std::fill_n(argumentText, std::strlen(argumentText), 'x');
    *status = -2;
    return given.first.c_str();
}

std::int32_t Number(std::string_view bytes) {
    std::int32_t number = 0;
    std::memcpy(&number, bytes.data(), sizeof number);
    return number;
}

// What the lock commands take is asserted and not tried: all else is as for any command.
bool IsLockCommand(std::int32_t command) {
    return command == oxRemoteScript::COMMAND_READ_LOCK || command == oxRemoteScript::COMMAND_WRITE_LOCK;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    size = std::min(size, LONGEST_INPUT);
    const std::string_view message(reinterpret_cast<const char*>(data), size);
    if (size >= 4 && IsLockCommand(Number(message)))
        return 0;
    const auto exact = std::make_unique<char[]>(size);
    message.copy(exact.get(), size);

    given = {};
    int ends[2];
    Check(pipe2(ends, O_CLOEXEC) == 0);
    const UniqueFd reader(ends[0]);
    UniqueFd writer(ends[1]);
    {
        const Silence silence;
        oxRemoteScript().PerformCallback(writer.Get(), exact.get(), static_cast<int>(size), Callback);
    }
    writer.Reset();
    std::string answer(2 * LONGEST_INPUT, '\0');
    const ssize_t count = read(reader.Get(), answer.data(), answer.size());
    Check(count >= 0);
    answer.resize(static_cast<std::size_t>(count));

    // The same by the letter, in a buffer that ends in zeros.
    std::string padded(message);
    padded.resize(3 * MAX);
    const std::size_t n = std::strlen(padded.c_str() + 4);
    const std::size_t m = std::strlen(padded.c_str() + 4 + n + 1);
    const bool answered = size > 8 && size <= MAX && 4 + n + 1 <= MAX && 4 + n + m + 2 <= MAX;
    Check(given.calls == (answered ? 1 : 0));
    if (!answered) {
        Check(answer.empty());
        return 0;
    }
    Check(given.command == Number(message));
    Check(given.first == padded.c_str() + 4);
    Check(given.second == padded.c_str() + 4 + n + 1);
    Check(answer.size() == 8 + n + 1 && Number(answer) == -2);
    Check(Number(std::string_view(answer).substr(4)) == static_cast<std::int32_t>(n));
    Check(answer.substr(8) == given.first + '\0');
    return 0;
}
