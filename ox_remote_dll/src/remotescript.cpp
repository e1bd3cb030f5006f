#include "remotescript.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "platform/assertion.h"
#include "platform/file.h"
#include "platform/text.h"
#include "remotescript/enginerun.h"

namespace {

// Where the assertions say they stand.
constexpr const char* ASSERTED_IN = "./ox_remote_dll/src/remotescript";
constexpr const char* READ_LOCK_SIGNATURE = "const char * oxRemoteScript::ServeReadLock(const char *, int *)";
constexpr const char* WRITE_LOCK_SIGNATURE = "const char * oxRemoteScript::ServeWriteLock(const char *, int *)";
constexpr const char* CALLBACK_SIGNATURE =
    "void oxRemoteScript::PerformCallback(int, char *, int, const char *(*)(void *, const char *, int, char *, int *))";
constexpr const char* RUN_SIGNATURE =
    "int oxRemoteScript::Run(int, char **, void *, const char *(*)(void *, const char *, int, char *, int *), "
    "const char *)";
// The digit test as the C library's header once spelt it out.
constexpr const char* DIGIT_TEXT = "(__ctype_b[(int) ((*pszArgs))] & (unsigned short int) _ISdigit)";

constexpr int STATUS_FAILED = -1;
constexpr const char* READ_TOKEN_TEXT = "TOKEN RETREIVED SUCCESSFULLY";  // scripts compare it: spelt so
constexpr const char* WRITE_TOKEN_TEXT = "OK";
constexpr const char* ERROR_TEXT = "ERROR";
constexpr const char* NULL_ARGUMENT = "NULL";

thread_local oxEngineRun* currentRun = nullptr;

bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

// Every argument keeps its position, also an empty one. Nothing is quoted: one with blanks becomes several.
std::string CommandLine(int argc, char** argv) {
    std::string line;
    for (int i = 0; i < argc; ++i) {
        const bool isEmpty = argv[i] == nullptr || *argv[i] == '\0';
        line.append(isEmpty ? NULL_ARGUMENT : argv[i]).append(1, ' ');
    }
    return line;
}

void AppendNumber(std::string& text, std::int32_t number) {
    char bytes[sizeof number];
    std::memcpy(bytes, &number, sizeof number);
    text.append(bytes, sizeof bytes);
}

std::string ComposeAnswer(std::int32_t status, const char* text) {
    const std::size_t length = std::strlen(text);
    std::string answer;
    answer.reserve(sizeof status + sizeof status + length + 1);
    AppendNumber(answer, status);
    AppendNumber(answer, static_cast<std::int32_t>(length));
    answer.append(text, length + 1);
    return answer;
}

// A message of the engine, taken apart. The strings end inside the buffer.
struct Message {
    char bytes[oxRemoteScript::MAX_MESSAGE] = {};
    std::int32_t command = 0;
    char* first = nullptr;
    char* second = nullptr;

    // Null, or what is wrong with it.
    const char* Take(const char* message, int length) {
        if (length < static_cast<int>(oxRemoteScript::MIN_MESSAGE))
            return "it is too short";
        if (length > static_cast<int>(sizeof bytes))
            return "it is too long";
        std::memcpy(bytes, message, static_cast<std::size_t>(length));
        std::memcpy(&command, bytes, sizeof command);
        const std::size_t firstLength = strnlen(bytes + sizeof command, sizeof bytes - sizeof command);
        const std::size_t secondStart = sizeof command + firstLength + 1;
        if (secondStart > sizeof bytes)
            return "its first text has no end";
        const std::size_t secondLength = strnlen(bytes + secondStart, sizeof bytes - secondStart);
        if (secondStart + secondLength + 1 > sizeof bytes)
            return "its second text has no end";
        first = bytes + sizeof command;
        second = bytes + secondStart;
        return nullptr;
    }
};

}  // namespace

std::atomic<std::uint32_t> oxRemoteScript::m_dwPipeID{0};
RWLock& oxRemoteScript::m_rwLock = *new RWLock;

oxRemoteScript::oxRemoteScript() = default;

oxRemoteScript::oxRemoteScript(const char* directory) {
    ++m_dwPipeID;
    const std::string_view text = directory == nullptr ? "" : directory;
    CopyText(m_directory, sizeof m_directory, text);
    // A path that was cut would name another program: rather none.
    if (!CopyText(m_enginePath, sizeof m_enginePath, std::string(text) + "/" + m_sENGINE_NAME))
        m_enginePath[0] = '\0';
}

oxRemoteScript::~oxRemoteScript() {
    ReleaseLocks();
}

int oxRemoteScript::Run(int argc, char** argv, void* context, oxScriptCallback callback, std::string_view data) {
    OX_ASSERT_AT(m_locked == rwUnlocked, "m_locked == rwUnlocked", ASSERTED_IN, 364, RUN_SIGNATURE);

    // What the run must not leave behind, in the order of its undoing: the engine first, then what it has locked.
    struct Release {
        oxRemoteScript& script;
        ~Release() {
            currentRun = nullptr;
            script.ReleaseLocks();
        }
    };
    const Release release{*this};
    oxEngineRun run(m_limits);

    const std::string commandLine = CommandLine(argc, argv);
    if (!run.MakePipes()) {
        const int error = errno;
        std::fprintf(stderr, "pipe() error %d: %s\n", error, GetLastErrorText(error));
        return 0;
    }
    // The server's own standard input becomes its standard error: nothing that it starts waits for a terminal.
    DuplicateOnto(STDERR_FILENO, STDIN_FILENO);
    if (!run.Spawn(m_enginePath, commandLine.c_str()))
        return RESULT_NOT_SPAWNED;
    m_context = context;
    currentRun = &run;
    run.Serve(data, [&](const char* message, int length) { return Answer(message, length, callback); });
    return run.AwaitEnd();
}

void oxRemoteScript::PerformCallback(int fd, char* message, int length, oxScriptCallback callback) {
    SendAnswer(fd, Answer(message, length, callback));
}

// The bytes to answer; none when the message breaks the bounds.
std::string oxRemoteScript::Answer(const char* message, int length, oxScriptCallback callback) {
    Message taken;
    if (const char* fault = taken.Take(message, length); fault != nullptr) {
        std::fprintf(stderr, "A message of the scripting engine (%d bytes) is not answered: %s.\n", length, fault);
        return {};
    }
    int status = 0;
    const char* pszResult = Dispatch(taken.command, taken.first, taken.second, &status, callback);
    OX_ASSERT_AT(pszResult != nullptr, "pszResult", ASSERTED_IN, 311, CALLBACK_SIGNATURE);
    return ComposeAnswer(status, pszResult);
}

const char* oxRemoteScript::Dispatch(int command, char* first, char* second, int* status, oxScriptCallback callback) {
    if (command == COMMAND_READ_LOCK)
        return ServeReadLock(first, status);
    if (command == COMMAND_WRITE_LOCK)
        return ServeWriteLock(first, status);
    return callback(m_context, first, command, second, status);
}

// A lock that the run does not hold is given back with the same words, and stays as it is: it may be another script's.
// A wait that the run itself would never let end is refused at once.
const char* oxRemoteScript::ServeWriteLock(const char* pszArgs, int* status) {
    OX_ASSERT_AT(pszArgs != nullptr, "pszArgs", ASSERTED_IN, 242, WRITE_LOCK_SIGNATURE);
    OX_ASSERT_AT(IsDigit(*pszArgs), DIGIT_TEXT, ASSERTED_IN, 243, WRITE_LOCK_SIGNATURE);
    bool granted = false;
    switch (std::strtol(pszArgs, nullptr, 10)) {
        case UNLOCK:
            if (!m_writing)
                return WRITE_TOKEN_TEXT;
            if (m_rwLock.WriteUnlock() != 0)
                break;
            m_writing = false;
            m_locked = rwUnlocked;
            return WRITE_TOKEN_TEXT;
        case LOCK:
            granted = m_reads == 0 && !m_writing && m_rwLock.WriteLock([this] { return IsOver(); }) == 0;
            break;
        case TRY_LOCK:
            granted = m_rwLock.WriteTryLock() == 0;
            break;
        default:
            OX_ASSERT_AT(false, "0", ASSERTED_IN, 265, WRITE_LOCK_SIGNATURE);
    }
    if (!granted) {
        *status = STATUS_FAILED;
        return ERROR_TEXT;
    }
    m_writing = true;
    m_locked = rwWriting;
    return WRITE_TOKEN_TEXT;
}

const char* oxRemoteScript::ServeReadLock(const char* pszArgs, int* status) {
    OX_ASSERT_AT(pszArgs != nullptr, "pszArgs", ASSERTED_IN, 274, READ_LOCK_SIGNATURE);
    OX_ASSERT_AT(IsDigit(*pszArgs), DIGIT_TEXT, ASSERTED_IN, 275, READ_LOCK_SIGNATURE);
    bool granted = false;
    switch (std::strtol(pszArgs, nullptr, 10)) {
        case UNLOCK:
            if (m_reads == 0)
                return READ_TOKEN_TEXT;
            if (m_rwLock.ReadUnlock() != 0)
                break;
            --m_reads;
            m_locked = rwUnlocked;
            return READ_TOKEN_TEXT;
        case LOCK:
            granted = !m_writing && m_rwLock.ReadLock([this] { return IsOver(); }) == 0;
            break;
        case TRY_LOCK:
            granted = m_rwLock.ReadTryLock() == 0;
            break;
        default:
            OX_ASSERT_AT(false, "0", ASSERTED_IN, 297, READ_LOCK_SIGNATURE);
    }
    if (!granted) {
        *status = STATUS_FAILED;
        return ERROR_TEXT;
    }
    ++m_reads;
    m_locked = rwReading;
    return READ_TOKEN_TEXT;
}

bool oxRemoteScript::IsCurrentRunOver() {
    return currentRun != nullptr && currentRun->IsOver();
}

bool oxRemoteScript::IsOver() const {
    return currentRun != nullptr ? currentRun->IsOver() : m_limits.stop != nullptr && m_limits.stop->load();
}

void oxRemoteScript::ReleaseLocks() {
    for (; m_reads > 0; --m_reads)
        m_rwLock.ReadUnlock();
    if (m_writing)
        m_rwLock.WriteUnlock();
    m_writing = false;
    m_locked = rwUnlocked;
}
