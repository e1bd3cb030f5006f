// A server that only remembers what was asked of it.
#pragma once

#include <string>
#include <vector>

#include "unix/servercontrol.h"

class FakeControl : public oxServerControl {
public:
    int Start(const oxServerArguments& arguments) override {
        calls.push_back("start");
        started = arguments;
        return startResult;
    }
    void Stop() override { calls.push_back("stop"); }
    int Status(int& port) override {
        if (status == STATUS_ACTIVE)
            port = listenPort;
        return status;
    }

    std::vector<std::string> calls;
    oxServerArguments started;
    int startResult = START_GOOD;
    int status = STATUS_ACTIVE;
    int listenPort = 8081;
};
