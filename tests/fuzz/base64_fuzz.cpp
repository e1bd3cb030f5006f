// Base64: what is encoded decodes to itself, and any text decodes without harm to the bytes that its whole groups stand
// for.
#include <algorithm>
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

void CheckRoundTrip(std::string_view bytes) {
    std::string encoded = oxBase64::Encode(bytes);
    Require(encoded.size() == (bytes.size() + 2) / 3 * 4);
    Require(oxBase64::Decode(encoded) == bytes);
    Require(oxBase64::Decode(" \t" + encoded) == bytes);
    while (encoded.ends_with('='))
        encoded.pop_back();
    Require(oxBase64::Decode(encoded) == bytes);
}

void CheckText(std::string_view text) {
    std::string_view body = text.substr(0, text.find('\0'));
    body.remove_prefix(std::min(body.find_first_not_of(" \t"), body.size()));
    body = body.substr(0, body.find_first_not_of(oxBase64::base_64_encode_table));

    const std::string decoded = oxBase64::Decode(text);
    const std::size_t whole = body.size() / 4 * 4;
    Require(decoded.size() >= whole / 4 * 3);
    Require(decoded.size() <= (body.size() + 3) / 4 * 3);
    Require(oxBase64::Encode(std::string_view(decoded).substr(0, whole / 4 * 3)) == body.substr(0, whole));
}

void CheckCredentials(std::string_view text) {
    oxCredentials credentials;
    credentials.ParseBasic(std::string(oxCredentials::m_sBasicAuthHeader) + oxBase64::Encode(text));
    const std::string_view pair = text.substr(0, text.find('\0'));
    const std::size_t colon = pair.find(':');
    if (pair.size() > oxCredentials::MAX_PAIR) {
        Require(credentials.GetUser().empty() && credentials.GetPassword().empty());
    } else if (colon == std::string_view::npos) {
        Require(credentials.GetUser() == pair && credentials.GetPassword().empty());
    } else {
        Require(credentials.GetUser() == pair.substr(0, colon) && credentials.GetPassword() == pair.substr(colon + 1));
    }
}
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // A copy of exactly the size, so that a sanitizer sees every read behind it.
    const std::string input(reinterpret_cast<const char*>(data), size);
    CheckRoundTrip(input);
    CheckText(input);
    CheckCredentials(input);
    return 0;
}
