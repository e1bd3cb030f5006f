// The value of an Authorization header: a name and a password that fit, or none, and nothing of an earlier login.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "protocol/base64.h"
#include "protocol/credentials.h"

namespace {

void Require(bool holds) {
    if (!holds)
        std::abort();
}

void CheckHeader(std::string_view value) {
    oxCredentials credentials;
    credentials.SetUser("earlier user");
    credentials.SetPassword("earlier password");
    credentials.ParseBasic(value);
    const std::string& user = credentials.GetUser();
    const std::string& password = credentials.GetPassword();
    if (!value.starts_with(oxCredentials::m_sBasicAuthHeader)) {
        Require(user == "earlier user" && password == "earlier password");
        return;
    }
    Require(user.size() + password.size() <= oxCredentials::MAX_PAIR);
    Require(user.find(':') == std::string::npos);
    Require(user.find('\0') == std::string::npos && password.find('\0') == std::string::npos);

    // Sent again as a browser would, they are the same.
    oxCredentials again;
    if (user.size() + password.size() < oxCredentials::MAX_PAIR) {
        again.ParseBasic("Basic " + oxBase64::Encode(user + ":" + password));
        Require(again.GetUser() == user && again.GetPassword() == password);
    }
}

// A name and a password that browsers can send arrive as they are.
void CheckPair(std::string_view text) {
    const std::string user(text.substr(0, text.find_first_of(std::string_view(":\0", 2))));
    std::string password(text.substr(user.size()));
    password.resize(std::min(password.size(), password.find('\0')));
    oxCredentials credentials;
    credentials.ParseBasic("Basic " + oxBase64::Encode(user + ":" + password));
    const bool fits = user.size() + 1 + password.size() <= oxCredentials::MAX_PAIR;
    Require(credentials.GetUser() == (fits ? user : ""));
    Require(credentials.GetPassword() == (fits ? password : ""));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // A copy of exactly the size, so that a sanitizer sees every read behind it.
    const std::string input(reinterpret_cast<const char*>(data), size);
    CheckHeader(input);
    CheckHeader(std::string(oxCredentials::m_sBasicAuthHeader) + " " + input);
    CheckPair(input);
    return 0;
}
