// Any path under any login: no answer comes from outside of the web root, the scripts and the reports, and no report
// goes to somebody who may not see it.
//
// The first byte of the input chooses the login, the others are the target of the request.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <iterator>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>

#include "../unit/protocol/testsockets.h"
#include "../unit/testing/manualclock.h"
#include "../unit/testing/scratch.h"
#include "app/oxxhttpserver.h"
#include "platform/encrypt.h"
#include "platform/text.h"

namespace {

// Longer than any failed login counts, or any login is remembered: no input meets what another one left.
constexpr int SECONDS_BETWEEN_INPUTS = 4000;

struct Account {
    std::string password;
    int permissions;
    std::set<std::string> profiles;
};

const std::map<std::string, Account> ACCOUNTS = {
    {"admin", {"root", 1, {}}},
    {"alice", {"wonder", 2, {}}},
    {"anonymous", {"", 0, {"open"}}},
    {"bob", {"builder", 0, {"sales", "open"}}},
};

// "name:password" in Base64.
constexpr const char* LOGINS[] = {
    "",                  // none
    "YWRtaW46cm9vdA==",  // admin
    "YWxpY2U6d29uZGVy",  // alice
    "YW5vbnltb3VzOg==",  // anonymous
    "Ym9iOmJ1aWxkZXI=",  // bob
    "Ym9iOndyb25n",      // bob, with a wrong password
    "bm9ib2R5Ong=",      // nobody
};

void Require(bool holds) {
    if (!holds)
        std::abort();
}

// Every file tells where it lies: "W:" the web root, "R:<profile>:" a report; all others are secrets.
class Installation {
public:
    Installation() {
        SetEncryptionKeyFile(m_dir.File("key"));
        for (const char* page : {"index.html", "default.htm", "reports.htm", "images/x.gif", "a/b.htm", "cgi-bin/x.htm",
                                 "reports/sales/x.htm", "reportsX/x.htm"})
            m_dir.Write(std::string("wwwroot/") + page, "W:");
        for (const char* profile : {"sales", "support", "open"})
            for (const char* page : {"x.htm", "default.htm", "deep/x.htm", "run.pl"})
                m_dir.Write(std::string("oxm_oxx/datfiles/reports/") + profile + "/" + page,
                            "R:" + std::string(profile) + ":");
        m_dir.Write("oxm_oxx/datfiles/reports/x.htm", "R::");
        for (const char* secret : {"secret.htm", "x.htm", "scripts/x.htm", "scripts/run.pl", "profiles/x.htm",
                                   "ox_script/x.htm", "oxm_oxx/x.htm", "oxm_oxx/datfiles/x.htm",
                                   "oxm_oxx/datfiles/images/x.gif", "oxm_oxx/datfiles/users/x.htm", "wwwrootX/x.htm"})
            m_dir.Write(secret, "secret");
        m_dir.Write("oxm_oxx/oxm_oxx.ini", "[defaults]\nprofilesdir=./profiles\n");
        for (const char* profile : {"sales", "support", "open"})
            m_dir.Write(std::string("profiles/") + profile + ".wlp", "[Profile]\nUsers=" + Users(profile) + "\n");
        for (const auto& [name, account] : ACCOUNTS)
            m_dir.Write("oxm_oxx/datfiles/users/" + name + ".usr",
                        "[UserInfo]\nusername=" + name + "\nPlaintextPassword=" + account.password +
                            "\npermissions=" + IntToText(account.permissions) + "\n");
        oxConfig config;
        Require(config.OpenText("[Web]\n"));
        oxHttpSettings web = oxHttpSettings::Read(config, "Web", m_dir.Path(), m_dir.File("wwwroot"), 1);
        web.errorLogName = m_dir.File("errors");
        m_server.SetUp(config, "Web", web, "");
    }

    void Check(std::string_view target, const char* login) {
        m_clock.Advance(SECONDS_BETWEEN_INPUTS);
        Connection connection;
        LineLog log;
        oxRequest request;
        const std::string header = *login == '\0' ? "" : std::string("Authorization: Basic ") + login + "\r\n";
        connection.PeerSend("GET " + std::string(target) + " HTTP/1.0\r\n" + header + "\r\n");
        connection.PeerEnd();
        if (!request.Read(connection.Server(), log) || !request.Parse())
            return;
        const auto resource = m_server.CreateResource(request);
        if (const auto* script = dynamic_cast<const oxResource_Script*>(resource.get()))
            CheckScript(*script, request);
        else
            CheckAnswer(*resource->GetReply(request), request, connection);
    }

private:
    static std::string Users(const std::string& profile) {
        std::string users;
        for (const auto& [name, account] : ACCOUNTS)
            users += account.profiles.count(profile) != 0 ? name + "," : "";
        return users;
    }
    // The account whose name and password the request brings, or null.
    static const Account* AccountOf(const oxRequest& request) {
        const auto found = ACCOUNTS.find(request.GetUser());
        const bool good = found != ACCOUNTS.end() && found->second.password == request.GetPassword();
        return good ? &found->second : nullptr;
    }
    static bool IsBelowTop(const oxRequest& request) {
        return std::count(request.GetPath().begin(), request.GetPath().end(), '/') > 1;
    }
    bool IsBelow(const std::string& path, const std::string& directory) const {
        const std::string place = std::filesystem::path(path).lexically_normal().string();
        return place.starts_with(m_dir.File(directory) + "/");
    }

    void CheckScript(const oxResource_Script& script, const oxRequest& request) const {
        Require(IsBelow(script.Script(), "wwwroot") || IsBelow(script.Script(), "scripts"));
        Require(script.Script().ends_with(".pl"));
        Require(script.Script().find_first_of(" \t\r\n\v\f") == std::string::npos);
        if (!IsBelowTop(request)) {
            Require(script.Parameters().empty());
            return;
        }
        const Account* account = AccountOf(request);
        Require(account != nullptr);
        Require(script.Parameters() ==
                "username=" + request.GetUser() + "&permissions=" + IntToText(account->permissions));
    }
    static void CheckAnswer(oxReply& reply, const oxRequest& request, Connection& connection) {
        const int status = reply.GetStatus().code;
        Require(status == 200 || status == 304 || status == 401 || status == 403 || status == 404);
        if (status != 200)
            return;
        LineLog log;
        const ManualClock clock;
        oxTimeStamp stamp(clock);
        reply.Send(connection.Server(), stamp, log);
        connection.Server().Shutdown(SHUT_WR);
        const std::string sent = connection.PeerReadAll();
        if (sent.empty())
            return;  // a directory: nothing of it can be read
        const std::string content = sent.substr(sent.find("\r\n\r\n") + 4);
        const Account* account = AccountOf(request);
        if (content == "W:") {
            Require(account != nullptr || !IsBelowTop(request));
            return;
        }
        Require(content.starts_with("R:") && content.ends_with(":"));
        const std::string profile = content.substr(2, content.size() - 3);
        Require(ACCOUNTS.at("anonymous").profiles.count(profile) != 0 ||
                (account != nullptr && (account->permissions == 1 || account->profiles.count(profile) != 0)));
    }

    Scratch m_dir;
    ManualClock m_clock;
    oxxHttpServer m_server{nullptr, m_clock};
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static Installation installation;
    if (size == 0)
        return 0;
    const std::string_view target = std::string_view(reinterpret_cast<const char*>(data), size).substr(1);
    installation.Check(target, LOGINS[data[0] % std::size(LOGINS)]);
    return 0;
}
