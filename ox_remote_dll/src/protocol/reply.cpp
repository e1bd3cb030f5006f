#include "protocol/reply.h"

#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "protocol/httptime.h"

namespace {

constexpr int NO_FILE = -1;

// Repeated when interrupted.
ssize_t ReadFile(int file, char* buffer, std::size_t length) {
    ssize_t count;
    do
        count = ::read(file, buffer, length);
    while (count < 0 && errno == EINTR);
    return count;
}

}  // namespace

oxReply::oxReply(const oxHttpStatus& status) : oxReply(status, Http::TYPE_NONE, NO_FILE, 0, std::string()) {}

oxReply::oxReply(const oxHttpStatus& status, const oxHttpContentType& type, int file, std::uint32_t contentSize,
                 const char* extraHeaders)
    : oxReply(status, type, file, contentSize, std::string(extraHeaders == nullptr ? "" : extraHeaders)) {}

oxReply::oxReply(const oxHttpStatus& status, const oxHttpContentType& type, int file, std::uint32_t contentSize,
                 const std::string& extraHeaders)
    : m_status(status),
      m_contentType(type),
      m_extraHeaders(extraHeaders),
      m_contentSize(contentSize),
      m_fileHandle(file),
      m_clock(&oxClock::System()) {}

oxReply::~oxReply() {
    CloseFile();
}

void oxReply::CloseFile() {
    if (m_fileHandle == NO_FILE || m_fileHandle == 0)
        return;
    ::close(m_fileHandle);
    m_fileHandle = NO_FILE;
}

void oxReply::Send(oxSocket& socket, oxTimeStamp& lastActivity, oxErrorSink& log) {
    if (m_status.code != Http::OK_200.code) {
        SendHeader(socket, 0);
        return;
    }
    if (m_fileHandle == NO_FILE)
        return;
    Drain(socket);
    char block[FILE_BLOCK];
    for (bool first = true;; first = false) {
        lastActivity.Touch();
        const ssize_t count = ReadFile(m_fileHandle, block, sizeof block);
        if (count < 0) {
            log.Error("Reply error reading file - handle = %u", static_cast<unsigned>(m_fileHandle));
            break;
        }
        const auto length = static_cast<std::size_t>(count);
        m_bytesSent += static_cast<std::uint32_t>(length);
        if (first) {
            ScanForMetaTags(block, length);
            SendHeader(socket, length > 0 ? MSG_MORE : 0);
        }
        if (length == 0)
            break;
        if (!SendAll(socket, block, length, 0)) {
            const int error = socket.GetLastError();
            log.Error("Reply error writing to socket - socket error = %d", error);
            break;
        }
    }
    CloseFile();
}

// A failure shows when the body is sent, if there is one.
void oxReply::SendHeader(oxSocket& socket, int flags) {
    const std::string text = ComposeHeader();
    SendAll(socket, text.data(), text.size(), flags);
}

// False with the reason in errno.
bool oxReply::SendAll(oxSocket& socket, const char* data, std::size_t length, int flags) {
    while (length > 0) {
        const int sent = socket.Send(data, static_cast<int>(length), flags);
        if (sent >= 0) {
            data += sent;
            length -= static_cast<std::size_t>(sent);
        } else if (errno != EINTR &&
                   (errno != EAGAIN || socket.WaitWritable() == Readiness::Failed || socket.GetHandle() == -1)) {
            return false;
        }
    }
    return true;
}

// Drops what came in and was not read, so that closing the connection does not reset it before the reply arrives.
void oxReply::Drain(oxSocket& socket) {
    constexpr int block = static_cast<int>(DRAIN_BLOCK);
    char scratch[DRAIN_BLOCK];
    for (int reads = 0; reads < MAX_DRAIN_READS; ++reads)
        if (socket.Recv(scratch, block, MSG_DONTWAIT) != block)
            return;
}

std::string oxReply::ComposeHeader() const {
    const bool isImage = m_contentType.id == Http::TYPE_GIF.id || m_contentType.id == Http::TYPE_JPG.id;
    const std::string_view body = m_status.body;
    std::string server(Http::S_SERVER);
    server.append(m_sServerName).append(m_sSpace).append(m_sServerVersion).append(m_CRLF);

    std::string text(m_sHeaderVersion);
    text.append(m_status.codeText).append(m_sSpace).append(m_status.reason).append(m_CRLF);
    if (m_status.code == Http::OK_200.code) {
        text.append(server).append(m_sHeaderAllow).append(Http::S_CONTENT_TYPE);
        text.append(m_contentTypeOverride.empty() ? m_contentType.mimeText : m_contentTypeOverride).append(m_CRLF);
        if (m_contentType.id == Http::TYPE_DYNAMIC.id)
            text.append(m_sHeaderCacheControlNoCache).append(m_sHeaderPragmaNoCache);
        AppendDate(text);
        if (isImage)
            AppendExpires(text, m_nImageExpirationPeriod_msec);
    } else if (m_status.code == Http::NOT_MODIFIED_304.code) {
        AppendDate(text);
        if (isImage)
            AppendExpires(text, m_nImageExpirationPeriod_msec);
        text.append(server);
    }
    text.append(m_extraHeaders);
    if (m_status.code == Http::OK_200.code || body.empty())
        return text.append(m_CRLF);
    AppendContentLength(text, body.size());
    return text.append(m_CRLF).append(body);
}

void oxReply::AppendContentLength(std::string& text, std::size_t length) const {
    text.append(Http::S_CONTENT_LENGTH).append(std::to_string(length)).append(m_CRLF);
}

void oxReply::AppendDate(std::string& text) const {
    text.append(Http::S_DATE);
    oxHttpTime(m_clock->Now()).Format(text);
    text.append(m_CRLF);
}

void oxReply::AppendExpires(std::string& text, std::int32_t seconds) const {
    text.append(Http::S_EXPIRES);
    oxHttpTime(m_clock->Now() + seconds).Format(text);
    text.append(m_CRLF);
}
