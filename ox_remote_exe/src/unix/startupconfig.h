// The process-wide start-up values.
#pragma once

#include <cstddef>
#include <cstdio>
#include <string>

class oxAuditFile;

// Read once, before any command runs, from two settings files that must both exist. A missing key leaves the value as
// it is, so a second reading takes the first one's results as its defaults.
struct oxStartupConfig {
    static constexpr const char* SERVER_SETTINGS_FILE = "./ox_remote.ini";
    static constexpr std::size_t MAX_TEXT = 4095;
    static constexpr int HANDLES_NOT_SET = -1;

    std::string mainSettingsFile = "./oxm_oxx/oxm_oxx.ini";
    std::string ersAddress = "9999";  // of the remote service
    int handles = HANDLES_NOT_SET;    // wanted open-files limit
    int gid = 1;                      // to run as, when started by root
    int uid = 1;
    int debugLevel = 1;
    std::string logFile = "oxinterface.audit";  // the status log
    std::string logDir = "./oxm_oxx/datfiles/statuslogs";

    // False when a file is missing (a line in the audit log) or does not load (also a line on `errors`).
    bool Read(oxAuditFile& audit, std::FILE* errors = stderr);
};
