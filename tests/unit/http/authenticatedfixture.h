// A server whose user check the test decides, with a clock that is moved by hand.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

#include "http/authenticatedserver.h"
#include "platform/mutex.h"
#include "testing/client.h"
#include "testing/manualclock.h"
#include "testing/scratch.h"
#include "testing/waiting.h"

class Credentials : public oxCredentials {
public:
    Credentials(const std::string& user, const std::string& password) {
        SetUser(user.c_str());
        SetPassword(password.c_str());
    }
};

class TestAuthenticatedServer : public oxAuthenticatedHttpServer {
public:
    explicit TestAuthenticatedServer(const oxClock& clock) : oxAuthenticatedHttpServer(clock) {
        SetGenerationSource([this] { return generation.load(); });
    }
    ~TestAuthenticatedServer() override { Close(); }

    // Asks `onCheck`, or accepts every user whose password is the name backwards, with the length as permissions.
    bool AuthenticateUser(oxUser& user, UserCheck check) override {
        (check == UserCheck::Full ? fullChecks : rememberedChecks)++;
        if (onCheck)
            return onCheck(user, check);
        const std::string& name = user.GetUser();
        user.SetPermissions(static_cast<std::uint32_t>(name.size()));
        return user.GetPassword() == std::string(name.rbegin(), name.rend());
    }
    bool Ask(const std::string& user, const std::string& password) {
        return AuthenticateRequest(Credentials(user, password), permissions);
    }
    // The numbers of full and of remembered checks so far.
    std::pair<int, int> Checks() const { return {fullChecks.load(), rememberedChecks.load()}; }

    std::function<bool(oxUser&, UserCheck)> onCheck;
    std::atomic<std::uint64_t> generation{1};
    std::atomic<int> fullChecks{0};
    std::atomic<int> rememberedChecks{0};
    std::uint32_t permissions = 0;  // of the last `Ask` that was accepted
};

// Lets threads pass one point one after the other.
class Gate {
public:
    void Open() {
        const std::scoped_lock lock(m_mutex);
        m_open = true;
        m_changed.Broadcast();
    }
    void Pass() {
        std::unique_lock lock(m_mutex);
        m_reached = true;
        m_changed.Broadcast();
        m_changed.Wait(lock, [this] { return m_open; });
    }
    void WaitUntilReached() {
        std::unique_lock lock(m_mutex);
        m_changed.Wait(lock, [this] { return m_reached; });
    }

private:
    MMutex m_mutex;
    MCondVar m_changed;
    bool m_open = false;
    bool m_reached = false;
};

class AuthenticatedFixture : public testing::Test {
protected:
    AuthenticatedFixture() {
        oxAuditFile::SetDefaultDebugLevel(9);
        settings.port = FreePort();
        settings.webAddress = "127.0.0.1";
        settings.homeDirectory = dir.Path();
        settings.documentRoot = dir.Path();
        settings.logFileName = oxHttpServer::m_sDEFAULT_LOG_FILE_NAME;
        settings.errorLogName = dir.File("errors");
        server->Configure(settings);
    }
    ~AuthenticatedFixture() override {
        server.reset();
        oxUser::m_nTimeout = oxUser::DEFAULT_TIMEOUT;
        oxAuditFile::SetDefaultDebugLevel(1);
    }
    int Count(const std::string& text) const {
        int count = 0;
        for (const std::string& line : dir.Lines("errors"))
            count += line.find(text) != std::string::npos;
        return count;
    }
    bool WaitUntilIdle() {
        return Eventually([this] { return server->IsTimeoutThreadIdle(); });
    }

    using Check = oxAuthenticatedHttpServer::UserCheck;
    Scratch dir;
    ManualClock clock;
    oxHttpSettings settings;
    std::unique_ptr<TestAuthenticatedServer> server = std::make_unique<TestAuthenticatedServer>(clock);
};
