#include "resources/script.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <mutex>
#include <utility>

#include "platform/file.h"
#include "platform/filename.h"
#include "platform/text.h"

namespace {

constexpr mode_t OUTPUT_FILE_MODE = 0664;
constexpr int OUTPUT_NUMBER_RADIX = 16;

// A file of an earlier server may have the name. Nothing that somebody put there is written to or followed.
UniqueFd OpenNewFile(const std::string& path) {
    constexpr int TRIES = 2;
    UniqueFd file;
    for (int i = 0; i < TRIES && !file; ++i) {
        unlink(path.c_str());
        file = OpenFile(path, O_RDWR | O_CREAT | O_APPEND | O_EXCL | O_NOFOLLOW, OUTPUT_FILE_MODE);
        if (!file && errno != EEXIST)
            break;
    }
    return file;
}

// One of the places of the engines that run at once.
class Slot {
public:
    explicit Slot(MSemaphore& semaphore) : m_semaphore(semaphore) {}
    ~Slot() {
        if (m_taken)
            m_semaphore.Signal();
    }
    Slot(const Slot&) = delete;
    Slot& operator=(const Slot&) = delete;
    bool TakeWithin(std::chrono::milliseconds time) {
        m_taken = m_semaphore.WaitFor(time);
        return m_taken;
    }

private:
    MSemaphore& m_semaphore;
    bool m_taken = false;
};

}  // namespace

std::uint32_t oxResource_Script::m_dwPipeID = 0;
MMutex oxResource_Script::m_PipeMutex;
MSemaphore& oxResource_Script::m_PerlEngineSem = *new MSemaphore(MAX_ENGINES);

oxResource_Script::oxResource_Script(std::string directory, std::string script, std::string third, std::string fourth,
                                     oxScriptCallback callback)
    : m_callback(callback),
      m_directory(std::move(directory)),
      m_script(std::move(script)),
      m_third(std::move(third)),
      m_fourth(std::move(fourth)) {
    const std::scoped_lock lock(m_PipeMutex);
    m_pipeID = ++m_dwPipeID;
}

oxResource_Script::~oxResource_Script() {
    if (!m_outputFile.empty())
        unlink(m_outputFile.c_str());
}

std::unique_ptr<oxReply> oxResource_Script::GetReply(const oxRequest& request) {
    if (m_script.empty() && m_directory.empty())
        return std::make_unique<oxReply>(Http::BAD_REQUEST_400);
    if (m_script.empty())
        m_script = m_directory + request.GetPath();
    struct stat status;
    if (stat(m_script.c_str(), &status) != 0)
        return std::make_unique<oxReply>(Http::NOT_FOUND_404, Http::TYPE_NONE, -1, 0, nullptr);
    if (m_directory.empty())
        m_directory = oxFilename(m_script).Directory();
    if (m_directory.empty())
        return std::make_unique<oxReply>(Http::BAD_REQUEST_400);

    UniqueFd output;
    const oxHttpStatus& outcome = RunEngine(request.GetQueryString(), output);
    if (&outcome != &Http::OK_200)
        return std::make_unique<oxReply>(outcome);
    // The descriptor stands at the file's start still: the engine opened the file by its name.
    const std::uint32_t size = fstat(output.Get(), &status) == 0 ? static_cast<std::uint32_t>(status.st_size) : 0;
    auto reply = std::make_unique<oxReply>(Http::OK_200, Http::TYPE_DYNAMIC, output.Get(), size, nullptr);
    output.Release();
    return reply;
}

// Waits for a place, and runs the script in it. The status to answer with; the page is in the output file then.
const oxHttpStatus& oxResource_Script::RunEngine(const std::string& argumentText, UniqueFd& output) {
    Slot slot(m_PerlEngineSem);
    do {
        if (IsStopped())
            return Http::INTERNAL_SERVER_ERROR_SCRIPT;
    } while (!slot.TakeWithin(SLOT_TICK));

    m_outputFile = m_sPipeNamePrefix + IntToText(m_pipeID, OUTPUT_NUMBER_RADIX);
    output = OpenNewFile(m_outputFile);
    if (!output)
        return Http::INTERNAL_SERVER_ERROR_500;

    // The length is that of the bytes that the engine finds on its standard input, NULs included.
    std::string length = std::to_string(argumentText.size());
    std::string marker = m_sMARKER;
    std::array<char*, 8> arguments{marker.data(),  m_script.data(),    nullptr,       m_outputFile.data(),
                                   m_third.data(), m_directory.data(), length.data(), m_fourth.data()};
    oxRemoteScript script(m_directory.c_str());
    script.SetLimits({m_stop, m_timeLimit});
    if (script.Run(static_cast<int>(arguments.size()), arguments.data(), nullptr, m_callback, argumentText) == 0)
        return Http::OK_200;
    output.Reset();
    unlink(m_outputFile.c_str());
    return Http::INTERNAL_SERVER_ERROR_SCRIPT;
}
