#include "app/appsetup.h"

#include <unistd.h>

#include <cstdlib>

#include "app/oxxhttpserver.h"
#include "platform/directory.h"
#include "platform/filename.h"

namespace {

constexpr std::size_t MAX_HOST_NAME = 259;
constexpr int DECIMAL = 10;

std::string OwnHostName() {
    char name[MAX_HOST_NAME + 1] = {};
    return ::gethostname(name, MAX_HOST_NAME) == 0 ? name : "localhost";
}

std::uint16_t PortNumber(const std::string& text) {
    const long value = std::strtol(text.c_str(), nullptr, DECIMAL);
    return value > 0 && value <= oxRemoteAddress::MAX_PORT ? static_cast<std::uint16_t>(value) : std::uint16_t{0};
}

std::string Absolute(const std::string& directory) {
    std::string full;
    return GetFullDirectoryName(directory, full) ? full : directory;
}

int AtLeastOne(int value, int otherwise) {
    return value < 1 ? otherwise : value;
}

}  // namespace

oxRemoteAddress oxRemoteAddress::Parse(const std::string& text) {
    const std::size_t colon = text.rfind(':');
    if (colon == std::string::npos)
        return {OwnHostName(), PortNumber(text)};
    return {text.substr(0, colon), PortNumber(text.substr(colon + 1))};
}

oxxSetup oxxSetup::Read(const oxConfig& config, const char* section, const std::string& homeDirectory,
                        const std::string& documentRoot, const std::string& remoteAddress) {
    oxxSetup setup;
    setup.homeDirectory = Absolute(homeDirectory);
    setup.documentRoot = Absolute(documentRoot);
    // Only what is put behind it needs normalising: the directory is as the system names it, and may hold a "\".
    const auto below = [&setup](const char* name) {
        return oxFilename::Join(setup.homeDirectory, oxFilename::NormalizePath(name));
    };
    setup.osAuthentication = config.GetBool(section, oxxHttpServer::sINI_KEY_OS_AUTHENTICATION, false);
    setup.ntDomain = config.GetText(section, sINI_KEY_NT_DOMAIN, "");
    setup.includeDirectory = below(oxxHttpServer::sSCRIPT_INC_DIR);
    setup.scriptsDirectory = below(oxxHttpServer::sSCRIPT_DIR);
    setup.dataDirectory = below(sDATA_DIR);
    setup.usersDirectory = config.GetText(section, sINI_KEY_USERS_PATH, below(oxxHttpServer::sUSERS_DIR));
    setup.mainSettingsFile = below(oxxHttpServer::sINI_OXM_LOG_INI_FILENAME);
    setup.remoteEnabled = !remoteAddress.empty();
    if (setup.remoteEnabled) {
        setup.remote = oxRemoteAddress::Parse(remoteAddress);
        setup.ersTimeout = AtLeastOne(config.GetInt(section, oxxHttpServer::sINI_ERS_TIMEOUT, DEFAULT_ERS_TIMEOUT),
                                      DEFAULT_ERS_TIMEOUT);
        setup.ersRetries = AtLeastOne(config.GetInt(section, oxxHttpServer::sINI_ERS_RETRIES, DEFAULT_ERS_RETRIES),
                                      DEFAULT_ERS_RETRIES);
    }
    return setup;
}
