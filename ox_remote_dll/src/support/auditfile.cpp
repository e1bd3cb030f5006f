#include "support/auditfile.h"

#include <fcntl.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <mutex>
#include <thread>

#include "platform/file.h"
#include "platform/text.h"

namespace {

// Holds a mutex that is initialised before any code runs and never destroyed.
union Undying {
    constexpr Undying() : mutex() {}
    ~Undying() {}
    MMutex mutex;
};
constinit Undying logLock;

constexpr std::chrono::seconds OPEN_PAUSE{1};
constexpr std::chrono::milliseconds HANDLER_LOCK_LIMIT{200};

int OpenFlags(const char* mode) {
    const bool update = std::strchr(mode, '+') != nullptr;
    switch (mode[0]) {
        case 'w':
            return (update ? O_RDWR : O_WRONLY) | O_CREAT | O_TRUNC;
        case 'a':
            return (update ? O_RDWR : O_WRONLY) | O_CREAT | O_APPEND;
        default:
            return update ? O_RDWR : O_RDONLY;
    }
}

// Makes the stream write to the file of the descriptor. A freopen that fails would close the stream's descriptor and
// leave its number to the next file or connection, so the open file is moved onto the descriptor instead.
bool Redirect(std::FILE* stream, UniqueFd file) {
    std::fflush(stream);
    const int target = fileno(stream);
    if (file.Get() == target)  // the stream's descriptor was closed and the file took its number
        return fcntl(file.Release(), F_SETFD, 0) == 0;
    return DuplicateOnto(file.Get(), target);
}

void WriteVector(int descriptor, iovec* parts, int count) {
    while (count > 0) {
        const ssize_t written = writev(descriptor, parts, count);
        if (written < 0) {
            if (errno == EINTR)
                continue;
            return;  // write errors of a log are not reported: there is nowhere to
        }
        auto left = static_cast<std::size_t>(written);
        while (count > 0 && left >= parts->iov_len) {
            left -= parts->iov_len;
            ++parts;
            --count;
        }
        if (count > 0) {
            parts->iov_base = static_cast<char*>(parts->iov_base) + left;
            parts->iov_len -= left;
        }
    }
}

void WriteParts(std::FILE* stream, iovec* parts, int count) {
    std::fflush(stream);  // what others have put into it comes first
    const int descriptor = fileno(stream);
    if (descriptor >= 0) {
        WriteVector(descriptor, parts, count);
        return;
    }
    for (const iovec* part = parts; part != parts + count; ++part)
        std::fwrite(part->iov_base, 1, part->iov_len, stream);
    std::fflush(stream);
}

iovec Part(std::string_view text) {
    return {const_cast<char*>(text.data()), text.size()};
}

bool EndsLine(std::string_view text) {
    return !text.empty() && text.back() == '\n';
}

}  // namespace

char oxAuditFile::m_defPath[MAX_PATH_TEXT + 1] = {};
int oxAuditFile::m_defDebugLevel = 1;
oxAuditFile* oxAuditFile::m_pDefaultAudit = nullptr;
constinit MMutex& oxAuditFile::m_wrLock = logLock.mutex;

oxAuditFile::oxAuditFile() : m_level(m_defDebugLevel) {}

oxAuditFile::oxAuditFile(const char* name, const char* mode) : oxAuditFile() {
    oxAuditFile::Open(name, mode);
}

oxAuditFile::oxAuditFile(const oxAuditFile& other) : oxAuditFile() {
    CopyFrom(other);
}

oxAuditFile::~oxAuditFile() {
    oxAuditFile::Close();
}

bool oxAuditFile::Open(const char* name, const char* mode, std::FILE* stream) {
    if (IsOpen())
        Close();
    std::string path;
    {
        const std::scoped_lock lock(m_wrLock);
        if (m_defPath[0] == '\0') {
            const std::unique_ptr<char, decltype(&std::free)> full(realpath("./", nullptr), &std::free);
            CopyText(m_defPath, sizeof m_defPath, full ? full.get() : "./");
        }
        path = std::strchr(name, '/') != nullptr ? name : std::string(m_defPath) + "/" + name;
    }
    // The lock is not held while trying: a log that cannot be opened delays nobody who writes to another.
    int error = 0;
    for (int attempt = 0; attempt < (stream != nullptr ? 1 : OPEN_TRIES); ++attempt) {
        UniqueFd file = OpenFile(path, OpenFlags(mode), LOG_FILE_MODE);
        if (file && stream != nullptr) {
            if (Redirect(stream, std::move(file)))
                return Store(stream, path);
        } else if (file) {
            if (std::FILE* opened = fdopen(file.Get(), mode)) {
                file.Release();
                return Store(opened, path);
            }
        }
        error = errno;
        if (stream == nullptr)
            std::this_thread::sleep_for(OPEN_PAUSE);
    }
    {
        const std::scoped_lock lock(m_wrLock);
        m_stream = nullptr;  // it may have been standard error
    }
    Error(error);
    errno = error;
    return false;
}

bool oxAuditFile::Store(std::FILE* stream, const std::string& path) {
    const std::scoped_lock lock(m_wrLock);
    m_stream = stream;
    m_shared = false;
    CopyText(m_path, sizeof m_path, path);
    return true;
}

void oxAuditFile::Close() {
    std::FILE* closing = nullptr;
    {
        const std::scoped_lock lock(m_wrLock);
        if (m_stream != nullptr)
            std::fflush(m_stream);
        if (m_stream != stderr && !m_shared)
            closing = m_stream;
        m_stream = nullptr;
        m_echo = nullptr;
        m_shared = false;
    }
    if (closing != nullptr)
        std::fclose(closing);
}

bool oxAuditFile::Admits(int msgLevel) const {
    const int level = m_level.load(std::memory_order_relaxed);
    return level != 0 && msgLevel <= level;
}

void oxAuditFile::Write(const char* text, int msgLevel) {
    if (Admits(msgLevel))
        WriteLine(text);
}

void oxAuditFile::Printf(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    VPrintf(format, arguments);
    va_end(arguments);
}

void oxAuditFile::Printf(int msgLevel, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    VPrintf(msgLevel, format, arguments);
    va_end(arguments);
}

void oxAuditFile::VPrintf(const char* format, va_list arguments) {
    if (m_level.load(std::memory_order_relaxed) != 0)
        FormatLine(format, arguments);
}

void oxAuditFile::VPrintf(int msgLevel, const char* format, va_list arguments) {
    if (Admits(msgLevel))
        FormatLine(format, arguments);
}

void oxAuditFile::FormatLine(const char* format, va_list arguments) {
    char text[MAX_TEXT + 1];
    if (std::vsnprintf(text, sizeof text, format, arguments) >= 0)
        WriteLine(text);
}

// Writes one line with one system call and without allocating: the out-of-memory handler writes here too.
void oxAuditFile::WriteLine(std::string_view text) {
    const std::scoped_lock lock(m_wrLock);
    if (m_stream == nullptr)
        return;
    iovec parts[] = {Part(Stamp()), Part(text), Part("\n")};
    WriteParts(m_stream, parts, EndsLine(text) ? 2 : 3);
    if (m_echo != nullptr) {
        std::fwrite(text.data(), 1, text.size(), m_echo);
        std::fputc('\n', m_echo);
        std::fflush(m_echo);
    }
}

void oxAuditFile::WriteFromHandler(std::string_view text) noexcept {
    if (m_level.load(std::memory_order_relaxed) == 0 || !m_wrLock.try_lock_for(HANDLER_LOCK_LIMIT))
        return;
    const std::unique_lock lock(m_wrLock, std::adopt_lock);
    if (m_stream == nullptr)
        return;
    iovec parts[] = {Part(Stamp()), Part(text), Part("\n")};
    WriteVector(fileno(m_stream), parts, 3);
    if (m_echo == nullptr)
        return;
    iovec copy[] = {Part(text), Part("\n")};  // past the echo's stream, which has a lock of its own
    WriteVector(fileno(m_echo), copy, 2);
}

void oxAuditFile::Error(int errnum) {
    std::fprintf(stderr, "oxAuditFile error: %s\n", GetLastErrorText(errnum));
    const std::scoped_lock lock(m_wrLock);
    if (m_stream != nullptr)
        std::clearerr(m_stream);
}

const char* oxAuditFile::Stamp() {
    const std::time_t now = std::time(nullptr);
    std::tm local{};
    localtime_r(&now, &local);
    if (std::strftime(m_stamp, sizeof m_stamp, "%b-%d-%Y %H:%M:%S: ", &local) == 0)
        m_stamp[0] = '\0';
    return m_stamp;
}

bool oxAuditFile::IsOpen() {
    const std::scoped_lock lock(m_wrLock);
    return m_stream != nullptr && m_stream != stderr;
}

oxAuditFile& oxAuditFile::operator=(const oxAuditFile& other) {
    if (this != &other) {
        oxAuditFile::Close();
        CopyFrom(other);
    }
    return *this;
}

void oxAuditFile::CopyFrom(const oxAuditFile& other) {
    const std::scoped_lock lock(m_wrLock);
    std::memcpy(m_path, other.m_path, sizeof m_path);
    std::memcpy(m_stamp, other.m_stamp, sizeof m_stamp);
    m_stream = other.m_stream;
    m_echo = other.m_echo;
    m_level = other.m_level.load();
    m_echoLevel = other.m_echoLevel;
    m_shared = true;
}

void oxAuditFile::Attach(std::FILE* stream) {
    if (IsOpen())
        Close();
    const std::scoped_lock lock(m_wrLock);
    m_stream = stream;
}

void oxAuditFile::SetDebugLevel(int level) {
    m_level = level;
    Printf(9, "Debug level is now %d.", level);
}

void oxAuditFile::SetEcho(std::FILE* echo) {
    const std::scoped_lock lock(m_wrLock);
    m_echo = echo;
}

void oxAuditFile::SetDefaultPath(const char* directory) {
    const std::unique_ptr<char, decltype(&std::free)> full(realpath(directory, nullptr), &std::free);
    const std::scoped_lock lock(m_wrLock);
    CopyText(m_defPath, sizeof m_defPath, full ? full.get() : directory);
}
