// The settings of the web side, as one value.
#pragma once

#include <cstdint>
#include <string>

#include "platform/config.h"

// Read from the settings file at every start, under the keys of `oxHttpServer`, so a reset takes changed values. A
// server replaces them as a whole: what reads them at that moment sees the old ones or the new ones.
struct oxHttpSettings {
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
    std::string errorLogName;
    bool logging = true;
    std::string logFileName;
    bool noCache = false;
    int maxSessionsPerAddress = DEFAULT_MAX_SESSIONS_PER_ADDRESS;  // 0 or less: no limit
    int scriptTimeout = 0;                                         // seconds for one script run; 0: no limit
    std::string homeDirectory;                                     // the access log lies here
    std::string documentRoot;                                      // what browsers see

    // Reads the section of a loaded file; directories are taken as they are given.
    static oxHttpSettings Read(const oxConfig& config, const char* section, const std::string& homeDirectory,
                               const std::string& documentRoot, std::uint32_t defaultPort);
};
