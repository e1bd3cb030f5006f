// The constant tables of the protocol: statuses with their canned pages, header names, methods, content types.
#pragma once

#include <cstddef>
#include <string_view>

// A reply status. Handed around by address and compared by code: the two statuses with the code 500 differ only in
// their page.
struct oxHttpStatus {
    int code;
    const char* codeText;
    const char* reason;
    const char* body;  // the canned page; empty when the status has none
};

// A content type. Handed around by address and compared by id.
struct oxHttpContentType {
    int id;
    const char* mimeText;
    const char* extension;  // of the files served with this type
};

// Only static members, all constant.
class Http {
public:
    static constexpr std::size_t STATUS_COUNT = 36;
    // Code ascending, the script error right behind the plain 500.
    static const oxHttpStatus STATUSES[STATUS_COUNT];

    static const oxHttpStatus& OK_200;
    static const oxHttpStatus& CREATED_201;
    static const oxHttpStatus& ACCEPTED_202;
    static const oxHttpStatus& NON_AUTHORITATIVE_203;
    static const oxHttpStatus& NO_CONTENT_204;
    static const oxHttpStatus& RESET_CONTENT_205;
    static const oxHttpStatus& PARTIAL_CONTENT_206;
    static const oxHttpStatus& MULTIPLE_CHOICES_300;
    static const oxHttpStatus& MOVED_PERMANENTLY_301;
    static const oxHttpStatus& MOVED_TEMPORARILY_302;
    static const oxHttpStatus& SEE_OTHER_303;
    static const oxHttpStatus& NOT_MODIFIED_304;
    static const oxHttpStatus& USE_PROXY_305;
    static const oxHttpStatus& BAD_REQUEST_400;
    static const oxHttpStatus& UNAUTHORIZED_401;
    static const oxHttpStatus& PAYMENT_REQUIRED_402;
    static const oxHttpStatus& FORBIDDEN_403;
    static const oxHttpStatus& NOT_FOUND_404;
    static const oxHttpStatus& METHOD_NOT_ALLOWED_405;
    static const oxHttpStatus& NOT_ACCEPTABLE_406;
    static const oxHttpStatus& PROXY_AUTHENTICATION_REQUIRED_407;
    static const oxHttpStatus& REQUEST_TIME_OUT_408;
    static const oxHttpStatus& CONFLICT_409;
    static const oxHttpStatus& GONE_410;
    static const oxHttpStatus& LENGTH_REQUIRED_411;
    static const oxHttpStatus& PRECONDITION_FAILED_412;
    static const oxHttpStatus& REQUEST_ENTITY_TOO_LARGE_413;
    static const oxHttpStatus& REQUEST_URI_TOO_LONG_414;
    static const oxHttpStatus& UNSUPPORTED_MEDIA_TYPE_415;
    static const oxHttpStatus& INTERNAL_SERVER_ERROR_500;
    static const oxHttpStatus& INTERNAL_SERVER_ERROR_SCRIPT;
    static const oxHttpStatus& NOT_IMPLEMENTED_501;
    static const oxHttpStatus& BAD_GATEWAY_502;
    static const oxHttpStatus& SERVICE_UNAVAILABLE_503;
    static const oxHttpStatus& GATEWAY_TIMEOUT_504;
    static const oxHttpStatus& HTTP_VERSION_NOT_SUPPORTED_505;

    static const oxHttpContentType TYPE_NONE;
    static const oxHttpContentType TYPE_HTML;
    static const oxHttpContentType TYPE_GIF;
    // Carries the GIF type and extension, and so is never found by extension.
    static const oxHttpContentType TYPE_JPG;
    static const oxHttpContentType TYPE_EXCEL;
    static const oxHttpContentType TYPE_WORD;
    static const oxHttpContentType TYPE_NS_JAR;
    static const oxHttpContentType TYPE_OX_WORD;
    // Script output: served as HTML that must not be cached; never found by extension.
    static const oxHttpContentType TYPE_DYNAMIC;

    // The type whose extension (without the dot) equals the given one, case and all; TYPE_NONE when there is none.
    static const oxHttpContentType& TypeFromExtension(std::string_view extension);

    static constexpr const char* SZ_METHOD_GET = "GET";
    static constexpr const char* SZ_METHOD_HEAD = "HEAD";
    static constexpr const char* SZ_METHOD_POST = "POST";

    // Header names: bare (SZ_), to find a request's headers; with ": " (S_), to compose a reply's.
    static constexpr const char* SZ_ALLOW = "Allow";
    static constexpr const char* SZ_AUTHORIZATION = "Authorization";
    static constexpr const char* SZ_CONTENT_ENCODING = "Content-Encoding";
    static constexpr const char* SZ_CONTENT_LENGTH = "Content-Length";
    static constexpr const char* SZ_CONTENT_LENGTH2 = "Content-length";
    static constexpr const char* SZ_CONTENT_TYPE = "Content-Type";
    static constexpr const char* SZ_DATE = "Date";
    static constexpr const char* SZ_EXPIRES = "Expires";
    static constexpr const char* SZ_FROM = "From";
    static constexpr const char* SZ_IF_MODIFIED_SINCE = "If-Modified-Since";
    static constexpr const char* SZ_LAST_MODIFIED = "Last-Modified";
    static constexpr const char* SZ_LOCATION = "Location";
    static constexpr const char* SZ_PRAGMA = "Pragma";
    static constexpr const char* SZ_REFERER = "Referer";
    static constexpr const char* SZ_SERVER = "Server";
    static constexpr const char* SZ_USER_AGENT = "User-Agent";
    static constexpr const char* SZ_WWW_AUTHENTICATE = "WWW-Authenticate";

    static constexpr std::string_view S_ALLOW = "Allow: ";
    static constexpr std::string_view S_AUTHORIZATION = "Authorization: ";
    static constexpr std::string_view S_CONTENT_ENCODING = "Content-Encoding: ";
    static constexpr std::string_view S_CONTENT_LENGTH = "Content-Length: ";
    static constexpr std::string_view S_CONTENT_LENGTH2 = "Content-length: ";
    static constexpr std::string_view S_CONTENT_TYPE = "Content-Type: ";
    static constexpr std::string_view S_DATE = "Date: ";
    static constexpr std::string_view S_EXPIRES = "Expires: ";
    static constexpr std::string_view S_FROM = "From: ";
    static constexpr std::string_view S_IF_MODIFIED_SINCE = "If-Modified-Since: ";
    static constexpr std::string_view S_LAST_MODIFIED = "Last-Modified: ";
    static constexpr std::string_view S_LOCATION = "Location: ";
    static constexpr std::string_view S_PRAGMA = "Pragma: ";
    static constexpr std::string_view S_REFERER = "Referer: ";
    static constexpr std::string_view S_SERVER = "Server: ";
    static constexpr std::string_view S_USER_AGENT = "User-Agent: ";
    static constexpr std::string_view S_WWW_AUTHENTICATE = "WWW-Authenticate: ";
};
