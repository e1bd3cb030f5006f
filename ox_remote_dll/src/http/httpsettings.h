// The settings of the web side, as one value.
#pragma once

#include <cstdint>
#include <string>

#include "platform/config.h"

// Read from the settings file at every start, so a reset takes changed values. A server replaces them as a whole: what
// reads them at that moment sees the old ones or the new ones.
struct oxHttpSettings {
    static constexpr const char* m_sINI_KEY_WEB_ADDRESS = "WebAddress";
    static constexpr const char* m_sINI_KEY_WEB_PORT = "WebPort";
    static constexpr const char* m_sINI_KEY_LOG_FILE_NAME = "WebLogFileName";
    static constexpr const char* m_sINI_KEY_WEB_LOGGING = "WebLogging";
    static constexpr const char* m_sINI_KEY_USER_TIMEOUT = "WebUserTimeout";
    static constexpr const char* m_sINI_KEY_LOG_ERRORS = "WebLogErrors";
    static constexpr const char* m_sINI_KEY_LOG_ERROR_FILE = "WebErrorLog";
    static constexpr const char* m_sINI_KEY_MAX_SESSIONS_PER_ADDRESS = "WebMaxConnectionsPerAddress";
    static constexpr const char* m_sINI_KEY_NO_CACHE = "WebNoCache";
    static constexpr const char* m_sINI_KEY_SCRIPT_TIMEOUT = "WebScriptTimeout";
    static constexpr const char* m_sDEFAULT_LOG_FILE_NAME = "ox_remote.log";
    static constexpr const char* m_sERROR_LOG_NAME = "ox_remote.err";
    static constexpr const char* m_sDEFAULT_WEB_ADDRESS = "";  // every local address
    // Long enough for a report that takes minutes; its session counts as idle while its script runs.
    static constexpr int DEFAULT_USER_TIMEOUT = 600;
    static constexpr int MIN_USER_TIMEOUT = 30;
    static constexpr int MAX_PORT = 65535;
    // A proxy in front of the server, or an office behind one address, opens many at once.
    static constexpr int DEFAULT_MAX_SESSIONS_PER_ADDRESS = 256;

    std::string webAddress;
    std::uint32_t port = 0;                     // 0: none was given
    int sessionTimeout = DEFAULT_USER_TIMEOUT;  // seconds, at least MIN_USER_TIMEOUT
    bool logErrors = true;
    std::string errorLogName = m_sERROR_LOG_NAME;
    bool logging = true;
    std::string logFileName = m_sDEFAULT_LOG_FILE_NAME;
    bool noCache = false;
    int maxSessionsPerAddress = DEFAULT_MAX_SESSIONS_PER_ADDRESS;  // 0 or less: no limit
    int scriptTimeout = 0;                                         // seconds for one script run; 0: no limit
    std::string homeDirectory;                                     // the access log lies here
    std::string documentRoot;                                      // what browsers see

    // Reads the section of a loaded file; directories are taken as they are given.
    static oxHttpSettings Read(const oxConfig& config, const char* section, const std::string& homeDirectory,
                               const std::string& documentRoot, std::uint32_t defaultPort);
};
