#include "moves.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>

extern char** environ;

namespace {

constexpr int FAILED = 90;  // the exit code of a move that failed
constexpr std::size_t SHORTEST_MESSAGE = 9;
constexpr std::size_t OUTPUT_ARGUMENT = 4;
constexpr std::size_t LENGTH_ARGUMENT = 7;
constexpr std::int32_t FLOOD_COMMAND = 99;

}  // namespace

void Fail(const std::string& what) {
    std::fprintf(stderr, "ox_test_engine: %s\n", what.c_str());
    std::exit(FAILED);
}

void Moves::Send(std::int32_t command, const std::string& first, const std::string& second) {
    std::string message(sizeof command, '\0');
    std::memcpy(message.data(), &command, sizeof command);
    message.append(first).append(1, '\0').append(second).append(1, '\0');
    message.resize(std::max(message.size(), SHORTEST_MESSAGE));
    Raw(message);
}

void Moves::Raw(std::string_view bytes) {
    // One write is one message.
    if (write(STDOUT_FILENO, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()))
        Fail(std::string("write: ") + std::strerror(errno));
}

void Moves::Flood(std::size_t count, std::size_t size) {
    std::string message(size, '\0');
    std::memcpy(message.data(), &FLOOD_COMMAND, std::min(size, sizeof FLOOD_COMMAND));
    for (std::size_t i = 0; i < count; ++i)
        Raw(message);
}

std::string Moves::ReadInput(std::size_t count) {
    std::string bytes(count, '\0');
    std::size_t have = 0;
    while (have < count) {
        const ssize_t got = read(STDIN_FILENO, bytes.data() + have, count - have);
        if (got <= 0)
            Fail("the input ended after " + std::to_string(have) + " of " + std::to_string(count) + " bytes");
        have += static_cast<std::size_t>(got);
    }
    return bytes;
}

Answer Moves::ReadAnswer() {
    Answer answer;
    std::int32_t length = 0;
    const std::string head = ReadInput(sizeof answer.status + sizeof length);
    std::memcpy(&answer.status, head.data(), sizeof answer.status);
    std::memcpy(&length, head.data() + sizeof answer.status, sizeof length);
    if (length < 0)
        Fail("an answer of " + std::to_string(length) + " bytes");
    answer.text = ReadInput(static_cast<std::size_t>(length) + 1);
    if (answer.text.back() != '\0')
        Fail("an answer that does not end in a zero byte");
    answer.text.pop_back();
    return answer;
}

std::size_t Moves::AnnouncedLength() const {
    return std::strtoul(Argument(LENGTH_ARGUMENT).c_str(), nullptr, 10);
}

const std::string& Moves::Argument(std::size_t index) const {
    if (index >= m_arguments.size())
        Fail("there is no argument " + std::to_string(index));
    return m_arguments[index];
}

void Moves::WriteOutput(std::string_view text) const {
    const std::string& path = Argument(OUTPUT_ARGUMENT);
    const int file = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0666);
    if (file < 0)
        Fail(path + ": " + std::strerror(errno));
    while (!text.empty()) {
        const ssize_t count = write(file, text.data(), text.size());
        if (count <= 0)
            Fail(path + ": " + std::strerror(errno));
        text.remove_prefix(static_cast<std::size_t>(count));
    }
    close(file);
}

std::string Moves::Status() const {
    std::string report;
    const auto line = [&report](const std::string& kind, const std::string& text) {
        report.append(kind).append(" ").append(text).append("\n");
    };
    for (std::size_t i = 0; i < m_arguments.size(); ++i)
        line("argument", std::to_string(i) + " " + m_arguments[i]);
    // Listed first, looked at afterwards: the listing's own descriptor is gone by then.
    std::vector<std::string> descriptors;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
        descriptors.push_back(entry.path());
    std::sort(descriptors.begin(), descriptors.end());
    for (const std::string& path : descriptors) {
        std::error_code error;
        const std::filesystem::path target = std::filesystem::read_symlink(path, error);
        if (!error)
            line("descriptor", std::filesystem::path(path).filename().string() + " " + target.string());
    }
    const mode_t mask = umask(0);
    umask(mask);
    char octal[16];
    std::snprintf(octal, sizeof octal, "%03o", static_cast<unsigned>(mask));
    line("umask", octal);
    rlimit limit{};
    getrlimit(RLIMIT_NOFILE, &limit);
    line("files", std::to_string(limit.rlim_cur) + " " + std::to_string(limit.rlim_max));
    line("nice", std::to_string(getpriority(PRIO_PROCESS, 0)));
    line("directory", std::filesystem::current_path().string());
    for (char** variable = environ; *variable != nullptr; ++variable)
        line("environment", *variable);
    std::ifstream status("/proc/self/status");
    for (std::string text; std::getline(status, text);)
        line("status", text);
    return report;
}

void Moves::ForkSleep(double seconds) const {
    const pid_t child = fork();
    if (child < 0)
        Fail(std::string("fork: ") + std::strerror(errno));
    if (child == 0) {
        // Only the pipes stay open: the test itself is not to wait for this one.
        const int nowhere = open("/dev/null", O_RDWR);
        dup2(nowhere, STDERR_FILENO);
        close(nowhere);
        SleepFor(seconds);
        _exit(0);
    }
    WriteOutput("child " + std::to_string(child) + "\n");
}

void SleepFor(double seconds) {
    timespec left{};
    left.tv_sec = static_cast<time_t>(seconds);
    left.tv_nsec = static_cast<long>((seconds - static_cast<double>(left.tv_sec)) * 1e9);
    while (nanosleep(&left, &left) != 0 && errno == EINTR) {
    }
}
