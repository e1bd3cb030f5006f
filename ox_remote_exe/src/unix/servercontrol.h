// The few things that process control asks of the server.
#pragma once

#include <string>

// What the server is started with.
struct oxServerArguments {
    std::string ersAddress = {};  // address of the remote service
    std::string settingsFile = "./ox_remote.ini";
    std::string section = "RemoteConfiguration";
    std::string baseDirectory = ".";
    std::string documentRoot = "./wwwroot";
    int defaultPort = 80;
};

class oxServerControl {
public:
    static constexpr int START_GOOD = 0;
    static constexpr int START_ERROR = -1;   // no settings file, or the server is in error
    static constexpr int START_FAILED = -2;  // not started, and stopped
    static constexpr int STATUS_ACTIVE = 0;
    static constexpr int STATUS_STOPPED = -1;
    static constexpr int STATUS_ERROR = -2;

    virtual ~oxServerControl() = default;
    virtual int Start(const oxServerArguments& arguments) = 0;
    virtual void Stop() = 0;
    // The port is filled in when the server is active.
    virtual int Status(int& port) = 0;
};

class oxAuditFile;

// Controls `theServer()`, which its first start builds. Only for the server process.
class oxTheServerControl : public oxServerControl {
public:
    explicit oxTheServerControl(oxAuditFile& audit) : m_audit(audit) {}
    int Start(const oxServerArguments& arguments) override;
    void Stop() override;
    int Status(int& port) override;

private:
    oxAuditFile& m_audit;
};
