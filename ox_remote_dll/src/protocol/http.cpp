#include "protocol/http.h"

namespace {
// The pages are as browsers have always been shown them, with their mixed case and their odd spellings.
constexpr char NO_BODY[] = "";
constexpr char BODY_400[] =
    "<html><HEAD><TITLE>400 Bad Request</TITLE></HEAD><BODY><H1>400 Bad Request</H1>\r\n"
    "The request could not be processed.<P></body></html>";
constexpr char BODY_401[] =
    "<html><HEAD><TITLE>401 Unauthorized</TITLE></HEAD><BODY><H1>401 Unauthorized</H1>\r\n"
    "Authentication required.<P></body></html>";
constexpr char BODY_403[] =
    "<html><HEAD><TITLE>403 Forbidden</TITLE></HEAD>\r\n"
    "<BODY><H1>403 Forbidden</H1>\r\n"
    "Access to the requested URL is restricted.<P></body></html>";
constexpr char BODY_404[] =
    "<html><HEAD><TITLE>404 Not Found</TITLE></HEAD>\r\n"
    "<BODY><H1>404 Not Found</H1>\r\n"
    "The requested URL was not found on this server.</body></html>";
constexpr char BODY_413[] =
    "<html><HEAD><TITLE>413 Server Error</TITLE></HEAD>\r\n"
    "<BODY><H2>413 Request Entity Too Large</H2>The server was unable to process your "
    "request.<P></body></html>";
constexpr char BODY_500[] =
    "<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n"
    "<BODY><H2>500 Server Error</H2>An error occurred processing your request.<P></body></html>";
constexpr char BODY_500_SCRIPT[] =
    "<html><HEAD><TITLE>500 Server Error</TITLE></HEAD>\r\n"
    "<BODY><H2>500 Server Error - Script Failed</H2>An error occured while processing a CGI script. The "
    "server was unable to continue processing your request.<P></body></html>";
constexpr char BODY_503[] =
    "<html><HEAD></HEAD>\r\n"
    "<BODY>The server is currently processing another request.<P></body></html>";
}  // namespace

const oxHttpStatus Http::STATUSES[Http::STATUS_COUNT] = {
    {200, "200", "OK", NO_BODY},
    {201, "201", "Created", NO_BODY},
    {202, "202", "Accepted", NO_BODY},
    {203, "203", "Non-Authoritative information", NO_BODY},
    {204, "204", "No Content", NO_BODY},
    {205, "205", "Reset Content", NO_BODY},
    {206, "206", "Partial Content", NO_BODY},
    {300, "300", "Multiple Choices", NO_BODY},
    {301, "301", "Moved Permanently", NO_BODY},
    {302, "302", "Moved Temporarily", NO_BODY},
    {303, "303", "See Other", NO_BODY},
    {304, "304", "Not Modified", NO_BODY},
    {305, "305", "Use Proxy", NO_BODY},
    {400, "400", "Bad Request", BODY_400},
    {401, "401", "Unauthorized", BODY_401},
    {402, "402", "Payment Required", NO_BODY},
    {403, "403", "Forbidden", BODY_403},
    {404, "404", "Not Found", BODY_404},
    {405, "405", "Method Not Allowed", NO_BODY},
    {406, "406", "Not Acceptable", NO_BODY},
    {407, "407", "Proxy Authentication Required", NO_BODY},
    {408, "408", "Request Time-Out", NO_BODY},
    {409, "409", "Conflict", NO_BODY},
    {410, "410", "Gone", NO_BODY},
    {411, "411", "Length Required", NO_BODY},
    {412, "412", "Precondition Failed", NO_BODY},
    {413, "413", "Request Entity Too Large", BODY_413},
    {414, "414", "Request URI Too Long", NO_BODY},
    {415, "415", "Unsupported Media Type", NO_BODY},
    {500, "500", "Internal Server Error", BODY_500},
    {500, "500", "Internal Server Error", BODY_500_SCRIPT},
    {501, "501", "Not Implemented", NO_BODY},
    {502, "502", "Bad Gateway", NO_BODY},
    {503, "503", "Service Unavailable", BODY_503},
    {504, "504", "Gateway Timeout", NO_BODY},
    {505, "505", "HTTP Version Not Supported", NO_BODY},
};

const oxHttpStatus& Http::OK_200 = Http::STATUSES[0];
const oxHttpStatus& Http::CREATED_201 = Http::STATUSES[1];
const oxHttpStatus& Http::ACCEPTED_202 = Http::STATUSES[2];
const oxHttpStatus& Http::NON_AUTHORITATIVE_203 = Http::STATUSES[3];
const oxHttpStatus& Http::NO_CONTENT_204 = Http::STATUSES[4];
const oxHttpStatus& Http::RESET_CONTENT_205 = Http::STATUSES[5];
const oxHttpStatus& Http::PARTIAL_CONTENT_206 = Http::STATUSES[6];
const oxHttpStatus& Http::MULTIPLE_CHOICES_300 = Http::STATUSES[7];
const oxHttpStatus& Http::MOVED_PERMANENTLY_301 = Http::STATUSES[8];
const oxHttpStatus& Http::MOVED_TEMPORARILY_302 = Http::STATUSES[9];
const oxHttpStatus& Http::SEE_OTHER_303 = Http::STATUSES[10];
const oxHttpStatus& Http::NOT_MODIFIED_304 = Http::STATUSES[11];
const oxHttpStatus& Http::USE_PROXY_305 = Http::STATUSES[12];
const oxHttpStatus& Http::BAD_REQUEST_400 = Http::STATUSES[13];
const oxHttpStatus& Http::UNAUTHORIZED_401 = Http::STATUSES[14];
const oxHttpStatus& Http::PAYMENT_REQUIRED_402 = Http::STATUSES[15];
const oxHttpStatus& Http::FORBIDDEN_403 = Http::STATUSES[16];
const oxHttpStatus& Http::NOT_FOUND_404 = Http::STATUSES[17];
const oxHttpStatus& Http::METHOD_NOT_ALLOWED_405 = Http::STATUSES[18];
const oxHttpStatus& Http::NOT_ACCEPTABLE_406 = Http::STATUSES[19];
const oxHttpStatus& Http::PROXY_AUTHENTICATION_REQUIRED_407 = Http::STATUSES[20];
const oxHttpStatus& Http::REQUEST_TIME_OUT_408 = Http::STATUSES[21];
const oxHttpStatus& Http::CONFLICT_409 = Http::STATUSES[22];
const oxHttpStatus& Http::GONE_410 = Http::STATUSES[23];
const oxHttpStatus& Http::LENGTH_REQUIRED_411 = Http::STATUSES[24];
const oxHttpStatus& Http::PRECONDITION_FAILED_412 = Http::STATUSES[25];
const oxHttpStatus& Http::REQUEST_ENTITY_TOO_LARGE_413 = Http::STATUSES[26];
const oxHttpStatus& Http::REQUEST_URI_TOO_LONG_414 = Http::STATUSES[27];
const oxHttpStatus& Http::UNSUPPORTED_MEDIA_TYPE_415 = Http::STATUSES[28];
const oxHttpStatus& Http::INTERNAL_SERVER_ERROR_500 = Http::STATUSES[29];
const oxHttpStatus& Http::INTERNAL_SERVER_ERROR_SCRIPT = Http::STATUSES[30];
const oxHttpStatus& Http::NOT_IMPLEMENTED_501 = Http::STATUSES[31];
const oxHttpStatus& Http::BAD_GATEWAY_502 = Http::STATUSES[32];
const oxHttpStatus& Http::SERVICE_UNAVAILABLE_503 = Http::STATUSES[33];
const oxHttpStatus& Http::GATEWAY_TIMEOUT_504 = Http::STATUSES[34];
const oxHttpStatus& Http::HTTP_VERSION_NOT_SUPPORTED_505 = Http::STATUSES[35];

const oxHttpContentType Http::TYPE_NONE = {0, "", ""};
const oxHttpContentType Http::TYPE_HTML = {1, "text/html", "htm"};
const oxHttpContentType Http::TYPE_GIF = {2, "image/gif", "gif"};
const oxHttpContentType Http::TYPE_JPG = {3, "image/gif", "gif"};
const oxHttpContentType Http::TYPE_EXCEL = {4, "application/msexcel", "xls"};
const oxHttpContentType Http::TYPE_WORD = {5, "application/msword", "doc"};
const oxHttpContentType Http::TYPE_NS_JAR = {6, "application/java-archive", "jar"};
const oxHttpContentType Http::TYPE_OX_WORD = {7, "application/ox-docutil", "oxw"};
const oxHttpContentType Http::TYPE_DYNAMIC = {8, "text/html", "htm"};

const oxHttpContentType& Http::TypeFromExtension(std::string_view extension) {
    static constexpr const oxHttpContentType* BY_EXTENSION[] = {&TYPE_HTML, &TYPE_GIF,    &TYPE_JPG,    &TYPE_EXCEL,
                                                                &TYPE_WORD, &TYPE_NS_JAR, &TYPE_OX_WORD};
    for (const oxHttpContentType* type : BY_EXTENSION)
        if (extension == type->extension)
            return *type;
    return TYPE_NONE;
}
