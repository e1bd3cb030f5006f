#include "unix/servercontrol.h"

#include <cstdint>

#include "http/httpsettings.h"
#include "platform/config.h"
#include "support/auditfile.h"
#include "unix/theserver.h"

int oxTheServerControl::Start(const oxServerArguments& arguments) {
    oxxHttpServer& server = theServer();
    oxConfig config;
    if (!config.Open(arguments.settingsFile)) {
        m_audit.Printf("Error: can't read %s: %s", arguments.settingsFile.c_str(), config.ErrorText().c_str());
        return START_ERROR;
    }
    const char* const section = arguments.section.c_str();
    server.SetUp(config, section,
                 oxHttpSettings::Read(config, section, arguments.baseDirectory, arguments.documentRoot,
                                      static_cast<std::uint32_t>(arguments.defaultPort)),
                 arguments.ersAddress);
    if (server.StartAuthenticated(server.Setup()->osAuthentication))
        return START_GOOD;
    return server.GetState() != oxHttpServer::STATE_STOPPED ? START_ERROR : START_FAILED;
}

void oxTheServerControl::Stop() {
    theServer().Stop();
}

int oxTheServerControl::Status(int& port) {
    switch (theServer().GetState()) {
        case oxHttpServer::STATE_RUNNING:
            port = static_cast<int>(theServer().GetListenPort());
            return STATUS_ACTIVE;
        case oxHttpServer::STATE_STOPPED:
            return STATUS_STOPPED;
        default:
            return STATUS_ERROR;
    }
}
