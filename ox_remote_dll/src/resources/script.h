// A script that the scripting engine runs.
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

#include "platform/file.h"
#include "platform/mutex.h"
#include "remotescript.h"
#include "resources/resource.h"

// Runs the script of a URL in the engine, which writes the page into an output file of its own, and answers with that
// file. At most MAX_ENGINES scripts run at once in the whole server; further ones wait for their turn.
//
// Whoever stops the session (`SetStopFlag`) ends the wait or the run; the answer is then an error page that nobody
// reads. The output file is removed with the resource.
class oxResource_Script : public oxResource {
public:
    static constexpr unsigned MAX_ENGINES = 16;
    static constexpr const char* m_sPipeNamePrefix = "./.oxscript:";
    static constexpr const char* m_sMARKER = "OX_WEBSERVER";    // tells the engine that the web server runs it
    static constexpr std::chrono::milliseconds SLOT_TICK{250};  // how often a waiting request looks at its stop flag

    // The third text is the engine's fifth argument (the include directory), the fourth its last (the parameters).
    oxResource_Script(std::string directory, std::string script, std::string third, std::string fourth,
                      oxScriptCallback callback);
    ~oxResource_Script() override;

    // For the whole run; 0 is no limit.
    void SetTimeLimit(std::chrono::seconds limit) { m_timeLimit = limit; }
    std::unique_ptr<oxReply> GetReply(const oxRequest& request) override;

    const std::string& OutputFile() const { return m_outputFile; }  // empty before GetReply
    const std::string& Script() const { return m_script; }
    const std::string& Parameters() const { return m_fourth; }
    std::uint32_t PipeID() const { return m_pipeID; }

private:
    const oxHttpStatus& RunEngine(const std::string& argumentText, UniqueFd& output);

    oxScriptCallback m_callback;
    std::string m_outputFile;
    std::string m_directory;
    std::string m_script;
    std::string m_third;
    std::string m_fourth;
    std::uint32_t m_pipeID;
    std::chrono::seconds m_timeLimit{0};

    static std::uint32_t m_dwPipeID;
    static MMutex m_PipeMutex;
    static MSemaphore& m_PerlEngineSem;  // never destroyed
};
