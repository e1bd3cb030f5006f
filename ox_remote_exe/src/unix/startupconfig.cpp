#include "unix/startupconfig.h"

#include <sys/stat.h>

#include <exception>
#include <stdexcept>

#include "platform/config.h"
#include "platform/filename.h"
#include "support/auditfile.h"

namespace {
// Where the message says that a failed reading was caught; people and scripts know it by this text.
constexpr const char* CAUGHT_IN = "./ox_remote_exe/src/unix/xmain";
constexpr int CAUGHT_AT_LINE = 607;

bool Exists(const std::string& path) {
    struct stat status;
    return stat(path.c_str(), &status) == 0;
}

void TakeText(const oxConfig& file, const char* section, const char* key, std::string& value) {
    value = file.GetText(section, key, value).substr(0, oxStartupConfig::MAX_TEXT);
}

void TakePath(const oxConfig& file, const char* section, const char* key, std::string& value) {
    TakeText(file, section, key, value);
    value = oxFilename::NormalizePath(value);
}

void Load(oxConfig& file, const std::string& path) {
    if (!file.Open(path))
        throw std::runtime_error(path);
}
}  // namespace

bool oxStartupConfig::Read(oxAuditFile& audit, std::FILE* errors) {
    // No file is loaded for this key, so its default always holds.
    TakePath(oxConfig(), "oxm_oxx", "configfile", mainSettingsFile);
    for (const std::string& path : {mainSettingsFile, std::string(SERVER_SETTINGS_FILE)}) {
        if (!Exists(path)) {
            audit.Printf("Warning: config file does not exist: %s.", path.c_str());
            return false;
        }
    }
    try {
        oxConfig mainFile;
        oxConfig serverFile;
        Load(mainFile, mainSettingsFile);
        Load(serverFile, SERVER_SETTINGS_FILE);
        TakeText(mainFile, "interface", "ersaddress", ersAddress);
        handles = serverFile.GetInt("unix", "handles", handles);
        gid = serverFile.GetInt("unix", "gid", gid);
        uid = serverFile.GetInt("unix", "uid", uid);
        debugLevel = serverFile.GetInt("Audit", "debuglevel", debugLevel);
        TakePath(serverFile, "Audit", "logfile", logFile);
        TakePath(serverFile, "Audit", "logdir", logDir);
        return true;
    } catch (const std::exception& failure) {
        std::fprintf(errors, "Exception caught in %s at ln. %d: %s\n", CAUGHT_IN, CAUGHT_AT_LINE, failure.what());
        audit.Printf("Failed to parse config file - %s.", failure.what());
        return false;
    }
}
