// A server on loopback in a scratch installation, with a clock that is moved by hand.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "http/httpserver.h"
#include "testing/client.h"
#include "testing/manualclock.h"
#include "testing/scratch.h"
#include "testing/waiting.h"

class TestServer : public oxHttpServer {
public:
    explicit TestServer(const oxClock& clock) : oxHttpServer(clock) {
        m_makeSession = [this, make = m_makeSession] {
            if (onMakeSession)
                onMakeSession();
            auto session = make();
            const std::scoped_lock lock(m_made);
            m_sessions.push_back(session.get());
            return session;
        };
    }
    ~TestServer() override { Close(); }

    std::unique_ptr<oxResource> CreateResource(const oxRequest& request) override {
        return onRequest ? onRequest(request) : oxHttpServer::CreateResource(request);
    }

    // Whether the session that was made as the n-th (from 0) has finished. Only while the server still lists it.
    bool IsFinished(std::size_t n) {
        const std::scoped_lock lock(m_made);
        return n < m_sessions.size() && m_sessions[n]->GetState() == oxHttpSession::STATE_FINISHED;
    }

    std::function<std::unique_ptr<oxResource>(const oxRequest&)> onRequest;
    std::function<void()> onMakeSession;

private:
    MMutex m_made;
    std::vector<const oxHttpSession*> m_sessions;
};

class ServerFixture : public testing::Test {
protected:
    ServerFixture() {
        oxAuditFile::SetDefaultDebugLevel(9);
        dir.Write("www/default.htm", "<html>home</html>\n");
        settings.port = FreePort();
        settings.webAddress = "127.0.0.1";
        settings.homeDirectory = dir.Path();
        settings.documentRoot = dir.File("www");
        settings.logFileName = oxHttpServer::m_sDEFAULT_LOG_FILE_NAME;
        settings.errorLogName = dir.File("errors");
    }
    ~ServerFixture() override {
        server.reset();
        oxAuditFile::SetDefaultDebugLevel(1);
    }

    bool Start() {
        server->Configure(settings);
        return server->Start();
    }
    // The message log without time stamps.
    std::vector<std::string> Messages() const {
        std::vector<std::string> lines;
        for (const std::string& line : dir.Lines("errors"))
            lines.push_back(line.substr(line.find(": ") + 2));
        return lines;
    }
    int Count(const std::string& text) const {
        int count = 0;
        for (const std::string& line : Messages())
            count += line.find(text) != std::string::npos;
        return count;
    }
    bool WaitForMessage(const std::string& text, int times = 1) const {
        return Eventually([&] { return Count(text) >= times; });
    }
    // Makes the listener sweep, as every new connection does.
    void Poke() const { Ask(settings.port, "GET / HTTP/1.0\r\n\r\n"); }
    // Moves the clock on until a session that is not served in that time is dropped.
    bool AdvanceUntilTimedOut() {
        return Eventually([&] {
            clock.Advance(settings.sessionTimeout + 1);
            return WaitForMessageFor("has timed-out -- removing.", std::chrono::seconds(3));
        });
    }
    bool WaitForMessageFor(const std::string& text, std::chrono::milliseconds limit) const {
        return Eventually([&] { return Count(text) > 0; }, limit);
    }

    Scratch dir;
    ManualClock clock;
    oxHttpSettings settings;
    std::unique_ptr<TestServer> server = std::make_unique<TestServer>(clock);
};
