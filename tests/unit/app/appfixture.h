// The reporting server in a scratch installation, asked without a connection of its own.
#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "app/oxxhttpserver.h"
#include "platform/encrypt.h"
#include "platform/text.h"
#include "protocol/base64.h"
#include "protocol/testsockets.h"
#include "testing/manualclock.h"
#include "testing/scratch.h"

class AppFixture : public testing::Test {
protected:
    AppFixture() {
        oxAuditFile::SetDefaultDebugLevel(3);
        SetEncryptionKeyFile(dir.File("key"));
        dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=./profiles\n");
        dir.Write("profiles/sales.wlp", "[Profile]\nUsers=bob,anonymous\n");
        dir.Write("profiles/support.wlp", "[Profile]\nUsers=bob\n");
        dir.Write("profiles/.hidden.wlp", "[Profile]\nUsers=bob\n");
        AddUser("admin", "root", 1);
        AddUser("alice", "wonder", 2);
        AddUser("bob", "builder", 0);
    }
    ~AppFixture() override {
        server.reset();
        oxAuditFile::SetDefaultDebugLevel(1);
    }

    void AddUser(const std::string& name, const std::string& password, int permissions) const {
        dir.Write("oxm_oxx/datfiles/users/" + name + ".usr", "[UserInfo]\nusername=" + name +
                                                                 "\nPlaintextPassword=" + password +
                                                                 "\npermissions=" + IntToText(permissions) + "\n");
    }
    void RemoveUser(const std::string& name) const {
        std::filesystem::remove(dir.File("oxm_oxx/datfiles/users/" + name + ".usr"));
    }
    // Settings of the section [RemoteConfiguration]; without a remote address the remote service is off.
    void SetUp(const std::string& settings, const std::string& remoteAddress) {
        oxConfig config;
        ASSERT_TRUE(config.OpenText("[RemoteConfiguration]\n" + settings));
        oxHttpSettings web = oxHttpSettings::Read(config, "RemoteConfiguration", dir.Path(), dir.File("wwwroot"), 1);
        web.errorLogName = dir.File("errors");
        server->SetUp(config, "RemoteConfiguration", web, remoteAddress);
    }
    void SetUp() override { SetUp("", ""); }

    // The message log without time stamps.
    std::vector<std::string> Messages() const {
        std::vector<std::string> lines;
        for (const std::string& line : dir.Lines("errors"))
            lines.push_back(line.substr(line.find(": ") + 2));
        return lines;
    }
    std::string LastMessage() const { return Messages().empty() ? "" : Messages().back(); }
    void ForgetMessages() const { dir.Write("errors", ""); }

    // "name:password", or nothing for a request without a login.
    std::unique_ptr<oxRequest> Request(const std::string& path, const std::string& login = {}) const {
        Connection connection;
        LineLog log;
        auto request = std::make_unique<oxRequest>();
        const std::string header = login.empty() ? "" : "Authorization: Basic " + Encoded(login) + "\r\n";
        connection.PeerSend("GET " + path + " HTTP/1.0\r\n" + header + "\r\n");
        EXPECT_TRUE(request->Read(connection.Server(), log) && request->Parse()) << path;
        return request;
    }
    // What a request resolves to, in words: "file <content>", "404", "401 realm", "403", "403 locked out", or
    // "script <file> <parameters>".
    std::string Ask(const std::string& path, const std::string& login = {}) {
        const auto request = Request(path, login);
        const auto resource = server->CreateResource(*request);
        if (const auto* script = dynamic_cast<const oxResource_Script*>(resource.get()))
            return "script " + Below(script->Script()) + " " + script->Parameters();
        const auto reply = resource->GetReply(*request);
        const std::string header = reply->ComposeHeader();
        if (reply->GetStatus().code == 200)
            return "file " + Sent(*reply);
        std::string words = IntToText(reply->GetStatus().code);
        if (header.find("\r\nWWW-Authenticate: Basic realm=\"Orvex Reporting Server\r\n") != std::string::npos)
            words += " realm";
        if (&reply->GetStatus() == &oxxHttpServer::httpStatus_OXX_FORBIDDEN_403)
            words += " locked out";
        return words;
    }
    std::string Below(const std::string& path) const {
        return path.starts_with(dir.Path()) ? path.substr(dir.Path().size()) : path;
    }

    Scratch dir;
    ManualClock clock;
    std::unique_ptr<oxxHttpServer> server = std::make_unique<oxxHttpServer>(nullptr, clock);

private:
    static std::string Encoded(const std::string& text) {
        constexpr std::string_view ALPHABET = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
        std::string encoded;
        for (std::size_t at = 0; at < text.size(); at += 3) {
            std::uint32_t bits = 0;
            for (std::size_t i = 0; i < 3; ++i)
                bits = bits << 8 | (at + i < text.size() ? static_cast<unsigned char>(text[at + i]) : 0U);
            for (std::size_t i = 0; i < 4; ++i)
                encoded += at + i > text.size() ? '=' : ALPHABET[bits >> (18 - 6 * i) & 63];
        }
        return encoded;
    }
    static std::string Sent(oxReply& reply) {
        Connection connection;
        LineLog log;
        const ManualClock clock;
        oxTimeStamp stamp(clock);
        std::string text;
        std::jthread peer([&] { text = connection.PeerReadAll(); });
        reply.Send(connection.Server(), stamp, log);
        connection.Server().Shutdown(SHUT_WR);
        peer.join();
        return text.substr(text.find("\r\n\r\n") + 4);
    }
};
