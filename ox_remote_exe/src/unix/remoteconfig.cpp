#include "unix/remoteconfig.h"

#include "platform/directory.h"

namespace {
std::string FullName(const std::string& directory) {
    std::string full;
    if (directory.starts_with('.') && GetFullDirectoryName(directory, full))
        return full;
    return directory;
}
}  // namespace

oxRemoteConfig::~oxRemoteConfig() {
    oxRemoteConfig::Stop();
}

int oxRemoteConfig::Start(const oxServerArguments& arguments) {
    m_port = arguments.defaultPort;
    oxServerArguments full = arguments;
    full.baseDirectory = FullName(arguments.baseDirectory);
    full.documentRoot = FullName(arguments.documentRoot);
    // Also a failed start may have begun something that a stop has to end.
    m_started = true;
    const int result = m_server.Start(full);
    if (result == START_GOOD)
        m_server.Status(m_port);
    return result;
}

void oxRemoteConfig::Stop() {
    if (!m_started)
        return;
    m_started = false;
    m_server.Stop();
}

int oxRemoteConfig::Status(int& port) {
    return m_server.Status(port);
}

int oxRemoteConfig::GetPort() {
    int port = 0;
    return m_server.Status(port) == STATUS_ERROR ? NO_PORT : m_port;
}
