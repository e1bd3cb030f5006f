#include "http/httplog.h"

#include <cstdarg>
#include <cstdio>

#include "support/logtext.h"

namespace {

constexpr const char* MONTHS[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun", "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

// The C library rewrites `timezone` whenever a thread converts a time, so it is read once.
std::int32_t LocalZone() {
    static const auto zone = [] {
        tzset();
        return static_cast<std::int32_t>(timezone);
    }();
    return zone;
}

}  // namespace

oxHttpServerLog::oxHttpServerLog() {
    SetDebugLevel(1);  // the debug level of the other logs does not silence this one
}

const char* oxHttpServerLog::Stamp() {
    return "";
}

void oxHttpServerLog::LogRequest(const oxSockAddr& peer, const oxRequest& request, const oxReply* reply,
                                 std::time_t now) {
    Write(FormatLine(peer, request, reply, now, LocalZone()).c_str(), 1);
}

std::string oxHttpServerLog::FormatLine(const oxSockAddr& peer, const oxRequest& request, const oxReply* reply,
                                        std::time_t now, std::int32_t zone) {
    std::string line = peer.Dotted();
    line += " - ";
    line += request.GetUser().empty() ? "-" : AccessLogText(request.GetUser());

    std::tm local{};
    localtime_r(&now, &local);
    // Read as unsigned, and the remainder is in seconds: east of UTC, and in zones of half hours, odd numbers come
    // out. Log readers know the lines as they are.
    const auto west = static_cast<std::uint32_t>(zone);
    char stamp[80];
    std::snprintf(stamp, sizeof stamp, " [%u/%s/%u:%u:%02u:%02u %c%02u%02u] ", static_cast<unsigned>(local.tm_mday),
                  MONTHS[local.tm_mon], static_cast<unsigned>(local.tm_year + 1900),
                  static_cast<unsigned>(local.tm_hour), static_cast<unsigned>(local.tm_min),
                  static_cast<unsigned>(local.tm_sec), zone < 0 ? '+' : '-', west / 3600, west % 3600);
    line += stamp;

    line += '"';
    line += request.GetMethodName();
    line += ' ';
    line += AccessLogText(request.GetRawPath());
    line += ' ';
    line += AccessLogText(request.GetVersionText());
    line += "\" ";
    if (reply != nullptr) {
        line += reply->GetStatus().codeText;
        line += ' ';
        line += std::to_string(reply->GetBytesSent());
    } else {
        line += "400 0";
    }
    return line;
}

bool oxHttpErrorLog::Open(const char* fileName) {
    m_open = oxAuditFile::Open(fileName, "a");
    return m_open;
}

void oxHttpErrorLog::Close() {
    m_open = false;
    oxAuditFile::Close();
}

void oxHttpErrorLog::Error(const char* format, ...) {
    if (!m_open)
        return;
    va_list arguments;
    va_start(arguments, format);
    VPrintf(format, arguments);
    va_end(arguments);
}

void oxHttpErrorLog::Log(int level, const char* format, ...) {
    if (!m_open)
        return;
    va_list arguments;
    va_start(arguments, format);
    VPrintf(level, format, arguments);
    va_end(arguments);
}
