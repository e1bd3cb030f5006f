// The second half of oxRequest: the buffer taken apart.
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "platform/text.h"
#include "protocol/http.h"
#include "protocol/request.h"

namespace {

constexpr std::string_view TOKEN_END = " \r\n";
constexpr std::string_view LINE_END = "\r\n";
constexpr std::string_view VERSION_PREFIX = "http/";
constexpr std::size_t VERSION_LENGTH = 8;
constexpr std::size_t VERSION_MAJOR_AT = 5;
constexpr std::size_t VERSION_MINOR_AT = 7;

std::string_view SkipSpaces(std::string_view text) {
    text.remove_prefix(std::min(text.find_first_not_of(' '), text.size()));
    return text;
}

// Takes the beginning of a text, up to any of the characters or the end, off it.
std::string_view TakeToken(std::string_view& text, std::string_view endCharacters) {
    const std::string_view token = text.substr(0, text.find_first_of(endCharacters));
    text.remove_prefix(token.size());
    return token;
}

// A token that only begins a method's name counts as that method, even an empty one.
oxRequest::Method MethodOf(std::string_view token) {
    if (StartsWithNoCase(Http::SZ_METHOD_GET, token))
        return oxRequest::METHOD_GET;
    if (StartsWithNoCase(Http::SZ_METHOD_POST, token))
        return oxRequest::METHOD_POST;
    if (StartsWithNoCase(Http::SZ_METHOD_HEAD, token))
        return oxRequest::METHOD_HEAD;
    return oxRequest::METHOD_NONE;
}

int HexDigit(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    const char lower = ToLower(c);
    return lower >= 'a' && lower <= 'f' ? lower - 'a' + 10 : -1;
}

// A path ends at a NUL, written as an escape too: all who look at the path must see the one that is opened.
std::string DecodePath(std::string_view raw) {
    std::string path;
    path.reserve(raw.size());
    for (std::size_t i = 0; i < raw.size(); ++i) {
        char c = raw[i];
        if (c == '%' && raw.size() - i > 2 && HexDigit(raw[i + 1]) >= 0 && HexDigit(raw[i + 2]) >= 0) {
            c = static_cast<char>(HexDigit(raw[i + 1]) * 16 + HexDigit(raw[i + 2]));
            i += 2;
        }
        if (c == '\0')
            break;
        path += c;
    }
    return path;
}

// Only the first place that holds the name is looked at, even when the name is the tail of another one.
bool FindHeader(std::string_view headers, std::string_view name, std::string_view& value) {
    const std::size_t at = headers.find(name);
    if (at == std::string_view::npos)
        return false;
    value = headers.substr(at + name.size());
    if (!value.starts_with(':'))
        return false;
    value.remove_prefix(1);
    if (value.starts_with(' '))
        value.remove_prefix(1);
    value = value.substr(0, value.find_first_of(LINE_END));
    return true;
}

}  // namespace

bool oxRequest::Parse() {
    if (m_status != STATUS_GOOD)
        return false;
    const std::string_view text = Text();
    std::string_view headers;
    if (text.empty() || !ParseRequestLine(text, headers)) {
        m_status = STATUS_BAD;
        return false;
    }
    ParseHeaders(headers);
    return true;
}

// The request line and the headers: up to the blank line, as far as it was read, or to the first NUL.
std::string_view oxRequest::Text() const {
    const std::size_t length = m_headerEnd == NOWHERE ? m_count : BodyStart();
    return {m_buffer, strnlen(m_buffer, length)};
}

bool oxRequest::ParseRequestLine(std::string_view text, std::string_view& headers) {
    m_path.clear();
    m_queryString.clear();
    text = SkipSpaces(text);
    m_method = MethodOf(TakeToken(text, " "));
    if (m_method == METHOD_NONE)
        return false;
    text = SkipSpaces(text);
    if (!TakeUrl(TakeToken(text, TOKEN_END)))
        return false;
    // One character ends the URL, a line end too: a line without a version is good only at the end of the text.
    if (!text.empty())
        text.remove_prefix(1);
    TakeVersion(TakeToken(text, TOKEN_END));
    if (text.empty())
        return Text().size() == m_count;  // a NUL in the line is no end of input
    text = SkipSpaces(text);
    if (!text.starts_with(LINE_END))
        return false;
    headers = text.substr(LINE_END.size());
    return true;
}

bool oxRequest::TakeUrl(std::string_view url) {
    if (!url.starts_with('/'))
        return false;
    m_rawUrl = static_cast<std::size_t>(url.data() - m_buffer);
    const std::string_view raw = url.substr(0, url.find('?'));
    m_pathLength = raw.size();
    if (raw.size() != url.size())
        m_queryString = url.substr(raw.size() + 1);
    else if (m_method == METHOD_POST)
        m_queryString = GetBody();
    if (raw.size() >= oxRequestLimits::PATH_BUFFER)
        return false;
    m_path = DecodePath(raw);
    const std::size_t dot = m_path.rfind('.');
    m_extension = dot == std::string::npos ? std::string() : m_path.substr(dot + 1);
    return true;
}

// Anything else than a version of this length is passed over.
void oxRequest::TakeVersion(std::string_view token) {
    if (token.size() != VERSION_LENGTH || !StartsWithNoCase(token, VERSION_PREFIX))
        return;
    m_versionText = token;
    m_versionMajor = static_cast<int>(std::strtol(m_versionText.c_str() + VERSION_MAJOR_AT, nullptr, 10));
    m_versionMinor = static_cast<int>(std::strtol(m_versionText.c_str() + VERSION_MINOR_AT, nullptr, 10));
}

void oxRequest::ParseHeaders(std::string_view headers) {
    std::string_view value;
    if (FindHeader(headers, Http::SZ_IF_MODIFIED_SINCE, value))
        m_ifModifiedSince = value;
    if (FindHeader(headers, Http::SZ_USER_AGENT, value))
        m_userAgent = value;
    if (FindHeader(headers, Http::SZ_AUTHORIZATION, value))
        ParseBasic(value);
}
