#include "protocol/credentials.h"

#include <algorithm>

#include "protocol/base64.h"

void oxCredentials::ParseBasic(std::string_view headerValue) {
    if (!headerValue.starts_with(m_sBasicAuthHeader))
        return;
    std::string pair = oxBase64::Decode(headerValue.substr(m_sBasicAuthHeader.size()));
    // A zero byte ends the text, so that no later reader can take the name for another one.
    pair.resize(std::min(pair.size(), pair.find('\0')));
    if (pair.size() > MAX_PAIR)
        pair.clear();
    const std::size_t colon = pair.find(':');
    m_user = pair.substr(0, colon);
    m_password = colon == std::string::npos ? std::string() : pair.substr(colon + 1);
}
