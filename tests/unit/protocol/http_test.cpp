#include "protocol/http.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>

namespace {
constexpr char B400[] =
    "<html><HEAD><TITLE>400 Bad Request</TITLE></HEAD><BODY><H1>400 Bad Request</H1>\r\nThe request could not be "
    "processed.<P></body></html>";
constexpr char B401[] =
    "<html><HEAD><TITLE>401 Unauthorized</TITLE></HEAD><BODY><H1>401 Unauthorized</H1>\r\nAuthentication "
    "required.<P></body></html>";
constexpr char B403[] =
    "<html><HEAD><TITLE>403 Forbidden</TITLE></HEAD>\r\n<BODY><H1>403 Forbidden</H1>\r\nAccess to the requested URL is "
    "restricted.<P></body></html>";
constexpr char B404[] =
    "<html><HEAD><TITLE>404 Not Found</TITLE></HEAD>\r\n<BODY><H1>404 Not Found</H1>\r\nThe requested URL was not "
    "found "
    "on this server.</body></html>";
constexpr char B413[] =
    "<html><HEAD><TITLE>413 Server Error</TITLE></HEAD>\r\n<BODY><H2>413 Request Entity Too Large</H2>The server was "
    "unable to process your request.<P></body></html>";
constexpr char B500[] =
    "<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n<BODY><H2>500 Server Error</H2>An error occurred processing "
    "your request.<P></body></html>";
constexpr char B500S[] =
    "<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n<BODY><H2>500 Server Error - Script Failed</H2>An error "
    "occured while processing a CGI script. The server was unable to continue processing your "
    "request.<P></body></html>";
constexpr char B503[] =
    "<html><HEAD></HEAD>\r\n<BODY>The server is currently processing another request.<P></body></html>";

const struct {
    const oxHttpStatus& status;
    int code;
    const char* reason;
    const char* body;
    std::size_t length;
} STATUSES[] = {
    {Http::OK_200, 200, "OK", "", 0},
    {Http::CREATED_201, 201, "Created", "", 0},
    {Http::ACCEPTED_202, 202, "Accepted", "", 0},
    {Http::NON_AUTHORITATIVE_203, 203, "Non-Authoritative information", "", 0},
    {Http::NO_CONTENT_204, 204, "No Content", "", 0},
    {Http::RESET_CONTENT_205, 205, "Reset Content", "", 0},
    {Http::PARTIAL_CONTENT_206, 206, "Partial Content", "", 0},
    {Http::MULTIPLE_CHOICES_300, 300, "Multiple Choices", "", 0},
    {Http::MOVED_PERMANENTLY_301, 301, "Moved Permanently", "", 0},
    {Http::MOVED_TEMPORARILY_302, 302, "Moved Temporarily", "", 0},
    {Http::SEE_OTHER_303, 303, "See Other", "", 0},
    {Http::NOT_MODIFIED_304, 304, "Not Modified", "", 0},
    {Http::USE_PROXY_305, 305, "Use Proxy", "", 0},
    {Http::BAD_REQUEST_400, 400, "Bad Request", B400, 133},
    {Http::UNAUTHORIZED_401, 401, "Unauthorized", B401, 124},
    {Http::PAYMENT_REQUIRED_402, 402, "Payment Required", "", 0},
    {Http::FORBIDDEN_403, 403, "Forbidden", B403, 138},
    {Http::NOT_FOUND_404, 404, "Not Found", B404, 140},
    {Http::METHOD_NOT_ALLOWED_405, 405, "Method Not Allowed", "", 0},
    {Http::NOT_ACCEPTABLE_406, 406, "Not Acceptable", "", 0},
    {Http::PROXY_AUTHENTICATION_REQUIRED_407, 407, "Proxy Authentication Required", "", 0},
    {Http::REQUEST_TIME_OUT_408, 408, "Request Time-Out", "", 0},
    {Http::CONFLICT_409, 409, "Conflict", "", 0},
    {Http::GONE_410, 410, "Gone", "", 0},
    {Http::LENGTH_REQUIRED_411, 411, "Length Required", "", 0},
    {Http::PRECONDITION_FAILED_412, 412, "Precondition Failed", "", 0},
    {Http::REQUEST_ENTITY_TOO_LARGE_413, 413, "Request Entity Too Large", B413, 158},
    {Http::REQUEST_URI_TOO_LONG_414, 414, "Request URI Too Long", "", 0},
    {Http::UNSUPPORTED_MEDIA_TYPE_415, 415, "Unsupported Media Type", "", 0},
    {Http::INTERNAL_SERVER_ERROR_500, 500, "Internal Server Error", B500, 142},
    {Http::INTERNAL_SERVER_ERROR_SCRIPT, 500, "Internal Server Error", B500S, 222},
    {Http::NOT_IMPLEMENTED_501, 501, "Not Implemented", "", 0},
    {Http::BAD_GATEWAY_502, 502, "Bad Gateway", "", 0},
    {Http::SERVICE_UNAVAILABLE_503, 503, "Service Unavailable", B503, 95},
    {Http::GATEWAY_TIMEOUT_504, 504, "Gateway Timeout", "", 0},
    {Http::HTTP_VERSION_NOT_SUPPORTED_505, 505, "HTTP Version Not Supported", "", 0},
};
}  // namespace

TEST(Http, StatusesHaveTheirTextsAndPages) {
    for (const auto& c : STATUSES) {
        EXPECT_EQ(c.code, c.status.code);
        EXPECT_EQ(std::to_string(c.code), c.status.codeText);
        EXPECT_STREQ(c.reason, c.status.reason);
        EXPECT_STREQ(c.body, c.status.body);
        EXPECT_EQ(c.length, std::strlen(c.status.body)) << c.code;
    }
}

TEST(Http, StatusesStandInOneArrayInOrder) {
    ASSERT_EQ(Http::STATUS_COUNT, std::size(STATUSES));
    for (std::size_t i = 0; i < Http::STATUS_COUNT; ++i)
        EXPECT_EQ(&Http::STATUSES[i], &STATUSES[i].status) << i;
}

TEST(Http, ScriptErrorDiffersFromThePlainOneInItsPageOnly) {
    EXPECT_EQ(Http::INTERNAL_SERVER_ERROR_500.code, Http::INTERNAL_SERVER_ERROR_SCRIPT.code);
    EXPECT_STREQ(Http::INTERNAL_SERVER_ERROR_500.codeText, Http::INTERNAL_SERVER_ERROR_SCRIPT.codeText);
    EXPECT_STREQ(Http::INTERNAL_SERVER_ERROR_500.reason, Http::INTERNAL_SERVER_ERROR_SCRIPT.reason);
    EXPECT_STRNE(Http::INTERNAL_SERVER_ERROR_500.body, Http::INTERNAL_SERVER_ERROR_SCRIPT.body);
}

TEST(Http, ContentTypesHaveTheirTexts) {
    static const struct {
        const oxHttpContentType& type;
        int id;
        const char* mimeText;
        const char* extension;
    } CASES[] = {
        {Http::TYPE_NONE, 0, "", ""},
        {Http::TYPE_HTML, 1, "text/html", "htm"},
        {Http::TYPE_GIF, 2, "image/gif", "gif"},
        {Http::TYPE_JPG, 3, "image/gif", "gif"},
        {Http::TYPE_EXCEL, 4, "application/msexcel", "xls"},
        {Http::TYPE_WORD, 5, "application/msword", "doc"},
        {Http::TYPE_NS_JAR, 6, "application/java-archive", "jar"},
        {Http::TYPE_OX_WORD, 7, "application/ox-docutil", "oxw"},
        {Http::TYPE_DYNAMIC, 8, "text/html", "htm"},
    };
    for (const auto& c : CASES) {
        EXPECT_EQ(c.id, c.type.id);
        EXPECT_STREQ(c.mimeText, c.type.mimeText);
        EXPECT_STREQ(c.extension, c.type.extension);
    }
}

TEST(Http, TypeFromExtensionIsExact) {
    static const struct {
        const char* extension;
        const oxHttpContentType& type;
    } CASES[] = {
        {"htm", Http::TYPE_HTML},   {"gif", Http::TYPE_GIF},     {"xls", Http::TYPE_EXCEL}, {"doc", Http::TYPE_WORD},
        {"jar", Http::TYPE_NS_JAR}, {"oxw", Http::TYPE_OX_WORD}, {"", Http::TYPE_NONE},     {"html", Http::TYPE_NONE},
        {"HTM", Http::TYPE_NONE},   {"Gif", Http::TYPE_NONE},    {"ht", Http::TYPE_NONE},   {"jpg", Http::TYPE_NONE},
        {"css", Http::TYPE_NONE},   {"js", Http::TYPE_NONE},     {"txt", Http::TYPE_NONE},  {".htm", Http::TYPE_NONE},
        {"htm ", Http::TYPE_NONE},  {"png", Http::TYPE_NONE},    {"pl", Http::TYPE_NONE},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(&c.type, &Http::TypeFromExtension(c.extension)) << c.extension;
}

TEST(Http, HeaderNamesHaveTwoForms) {
    static const struct {
        const char* bare;
        std::string_view composing;
        const char* name;
    } CASES[] = {
        {Http::SZ_ALLOW, Http::S_ALLOW, "Allow"},
        {Http::SZ_AUTHORIZATION, Http::S_AUTHORIZATION, "Authorization"},
        {Http::SZ_CONTENT_ENCODING, Http::S_CONTENT_ENCODING, "Content-Encoding"},
        {Http::SZ_CONTENT_LENGTH, Http::S_CONTENT_LENGTH, "Content-Length"},
        {Http::SZ_CONTENT_LENGTH2, Http::S_CONTENT_LENGTH2, "Content-length"},
        {Http::SZ_CONTENT_TYPE, Http::S_CONTENT_TYPE, "Content-Type"},
        {Http::SZ_DATE, Http::S_DATE, "Date"},
        {Http::SZ_EXPIRES, Http::S_EXPIRES, "Expires"},
        {Http::SZ_FROM, Http::S_FROM, "From"},
        {Http::SZ_IF_MODIFIED_SINCE, Http::S_IF_MODIFIED_SINCE, "If-Modified-Since"},
        {Http::SZ_LAST_MODIFIED, Http::S_LAST_MODIFIED, "Last-Modified"},
        {Http::SZ_LOCATION, Http::S_LOCATION, "Location"},
        {Http::SZ_PRAGMA, Http::S_PRAGMA, "Pragma"},
        {Http::SZ_REFERER, Http::S_REFERER, "Referer"},
        {Http::SZ_SERVER, Http::S_SERVER, "Server"},
        {Http::SZ_USER_AGENT, Http::S_USER_AGENT, "User-Agent"},
        {Http::SZ_WWW_AUTHENTICATE, Http::S_WWW_AUTHENTICATE, "WWW-Authenticate"},
    };
    for (const auto& c : CASES) {
        EXPECT_STREQ(c.name, c.bare);
        EXPECT_EQ(std::string(c.name) + ": ", c.composing);
    }
    EXPECT_STREQ("GET", Http::SZ_METHOD_GET);
    EXPECT_STREQ("HEAD", Http::SZ_METHOD_HEAD);
    EXPECT_STREQ("POST", Http::SZ_METHOD_POST);
}
