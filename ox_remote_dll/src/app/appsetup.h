// What the application server takes from its settings.
#pragma once

#include <cstdint>
#include <string>

#include "platform/config.h"

// The address of the remote service: "host:port", or a port alone on this machine.
struct oxRemoteAddress {
    static constexpr int MAX_PORT = 65535;

    std::string host;
    std::uint16_t port = 0;  // 0: none that could be reached

    static oxRemoteAddress Parse(const std::string& text);
};

// One value for all of it: a reset replaces it as a whole.
struct oxxSetup {
    static constexpr const char* sDATA_DIR = "oxm_oxx/datfiles";
    static constexpr const char* sINI_KEY_NT_DOMAIN = "NTAuthenticationDomain";
    static constexpr const char* sINI_KEY_USERS_PATH = "userspath";
    static constexpr int DEFAULT_ERS_TIMEOUT = 5;  // seconds
    static constexpr int DEFAULT_ERS_RETRIES = 3;

    // The remote service; off when no address was given.
    bool remoteEnabled = false;
    oxRemoteAddress remote;
    int ersTimeout = DEFAULT_ERS_TIMEOUT;
    int ersRetries = DEFAULT_ERS_RETRIES;
    // Absolute; the users directory as the settings name it.
    std::string homeDirectory;
    std::string documentRoot;
    std::string scriptsDirectory;
    std::string dataDirectory;
    std::string includeDirectory;
    std::string usersDirectory;
    std::string mainSettingsFile;
    std::string ntDomain;
    bool osAuthentication = true;

    // Reads the section of a loaded file. The directories may be relative; an empty remote address is none.
    static oxxSetup Read(const oxConfig& config, const char* section, const std::string& homeDirectory,
                         const std::string& documentRoot, const std::string& remoteAddress);
};
