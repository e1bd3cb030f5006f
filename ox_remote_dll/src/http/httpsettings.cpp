#include "http/httpsettings.h"

#include <algorithm>

#include "http/httpserver.h"

oxHttpSettings oxHttpSettings::Read(const oxConfig& config, const char* section, const std::string& homeDirectory,
                                    const std::string& documentRoot, std::uint32_t defaultPort) {
    oxHttpSettings settings;
    settings.webAddress =
        config.GetText(section, oxHttpServer::m_sINI_KEY_WEB_ADDRESS, oxHttpServer::m_sDEFAULT_WEB_ADDRESS);
    // What is no port number counts as none given.
    const int port = config.GetInt(section, oxHttpServer::m_sINI_KEY_WEB_PORT, static_cast<int>(defaultPort));
    settings.port = port > 0 && port <= MAX_PORT ? static_cast<std::uint32_t>(port) : 0;
    settings.sessionTimeout =
        std::max(MIN_USER_TIMEOUT, config.GetInt(section, oxHttpServer::m_sINI_KEY_USER_TIMEOUT, DEFAULT_USER_TIMEOUT));
    settings.logErrors = config.GetBool(section, oxHttpServer::m_sINI_KEY_LOG_ERRORS, settings.logErrors);
    settings.errorLogName =
        config.GetText(section, oxHttpServer::m_sINI_KEY_LOG_ERROR_FILE, oxHttpServer::m_sERROR_LOG_NAME);
    if (settings.errorLogName.empty())
        settings.errorLogName = oxHttpServer::m_sERROR_LOG_NAME;
    settings.noCache = config.GetBool(section, oxHttpServer::m_sINI_KEY_NO_CACHE, settings.noCache);
    settings.maxSessionsPerAddress =
        config.GetInt(section, oxHttpServer::m_sINI_KEY_MAX_SESSIONS_PER_ADDRESS, DEFAULT_MAX_SESSIONS_PER_ADDRESS);
    settings.logging = config.GetBool(section, oxHttpServer::m_sINI_KEY_WEB_LOGGING, settings.logging);
    settings.logFileName =
        config.GetText(section, oxHttpServer::m_sINI_KEY_LOG_FILE_NAME, oxHttpServer::m_sDEFAULT_LOG_FILE_NAME);
    settings.scriptTimeout =
        std::max(0, config.GetInt(section, oxHttpServer::m_sINI_KEY_SCRIPT_TIMEOUT, settings.scriptTimeout));
    settings.homeDirectory = homeDirectory;
    settings.documentRoot = documentRoot;
    return settings;
}
