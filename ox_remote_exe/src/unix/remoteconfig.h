// Starts, stops and queries the server for the start command.
#pragma once

#include <cstdint>

#include "unix/servercontrol.h"

// The destructor stops the server, if this object started it.
class oxRemoteConfig : public oxServerControl {
public:
    static constexpr int DEFAULT_PORT = 80;
    static constexpr int NO_PORT = -1;

    explicit oxRemoteConfig(oxServerControl& server) : m_server(server) {}
    ~oxRemoteConfig() override;
    oxRemoteConfig(const oxRemoteConfig&) = delete;
    oxRemoteConfig& operator=(const oxRemoteConfig&) = delete;

    // As the server's, with a base directory or document root that begins with "." made absolute first. After a good
    // start the stored port is the one that is listened on.
    int Start(const oxServerArguments& arguments) override;
    void Stop() override;
    int Status(int& port) override;

    void SetPort(int port) { m_port = port; }
    // NO_PORT while the server reports an error.
    int GetPort();

private:
    oxServerControl& m_server;
    int m_port = DEFAULT_PORT;
    [[maybe_unused]] std::uint32_t m_reserved[4] = {};  // kept; nothing reads them
    bool m_started = false;
};
