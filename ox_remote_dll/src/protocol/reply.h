// The one object through which an answer reaches a browser.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "net/socket.h"
#include "platform/clock.h"
#include "protocol/http.h"
#include "support/errorsink.h"

// A status, a content type, and optionally an open file that is the body and a block of extra header lines (each ended
// by CR LF). It owns the file from construction: sending closes it, and the destructor where nothing was sent. A reply
// is sent at most once, by one thread.
class oxReply {
public:
    static constexpr std::string_view m_sServerName = "Orvex HTTP Server";
    static constexpr std::string_view m_sServerVersion = "V3.5c";
    static constexpr std::string_view m_CRLF = "\r\n";
    static constexpr std::string_view m_sSpace = " ";
    static constexpr std::string_view m_sHeaderVersion = "HTTP/1.0 ";
    static constexpr std::string_view m_sHeaderAllow = "Allow: GET, POST\r\n";
    static constexpr std::string_view m_sHeaderCacheControlNoCache = "Cache-Control: no-cache\r\n";
    static constexpr std::string_view m_sHeaderPragmaNoCache = "Pragma: no-cache\r\n";
    // Added to a time in seconds, whatever its name says: thirty days.
    static constexpr std::int32_t m_nImageExpirationPeriod_msec = 2592000;

    static constexpr std::size_t FILE_BLOCK = 20480;      // bytes read and sent at a time
    static constexpr std::size_t META_SCAN_BYTES = 2000;  // of the first block, searched for meta tags
    static constexpr std::size_t DRAIN_BLOCK = 65535;
    static constexpr int MAX_DRAIN_READS = 11;

    explicit oxReply(const oxHttpStatus& status);
    oxReply(const oxHttpStatus& status, const oxHttpContentType& type, int file, std::uint32_t contentSize,
            const char* extraHeaders);
    oxReply(const oxHttpStatus& status, const oxHttpContentType& type, int file, std::uint32_t contentSize,
            const std::string& extraHeaders);
    ~oxReply();
    oxReply(const oxReply&) = delete;
    oxReply& operator=(const oxReply&) = delete;

    // Sends the whole reply. The time stamp is touched before every block of the file; failures are reported in the
    // log.
    void Send(oxSocket& socket, oxTimeStamp& lastActivity, oxErrorSink& log);

    const oxHttpStatus& GetStatus() const { return m_status; }
    std::uint32_t GetBytesSent() const { return m_bytesSent; }  // bytes of the file
    std::uint32_t GetContentSize() const { return m_contentSize; }

    // Closes the file. A handle of 0 counts as no file and is never closed.
    void CloseFile();
    // The status line, the headers and, for an error status, its page.
    std::string ComposeHeader() const;
    // Takes the content type that an HTML page declares in its head. Pages are scanned in lower case, so the declared
    // type goes out in lower case too.
    void ScanForMetaTags(const char* buffer, std::size_t length);
    const std::string& GetContentTypeOverride() const { return m_contentTypeOverride; }
    // Stands in for `now` in Date and Expires.
    void SetClock(const oxClock& clock) { m_clock = &clock; }

private:
    void SendHeader(oxSocket& socket, int flags);
    bool SendAll(oxSocket& socket, const char* data, std::size_t length, int flags);
    void Drain(oxSocket& socket);
    std::size_t ParseMetaTag(std::string_view text);
    void ApplyMetaHeader(std::string_view name, std::string_view value);
    void AppendContentLength(std::string& text, std::size_t length) const;
    void AppendDate(std::string& text) const;
    void AppendExpires(std::string& text, std::int32_t seconds) const;

    const oxHttpStatus& m_status;
    const oxHttpContentType& m_contentType;
    std::string m_extraHeaders;
    std::string m_contentTypeOverride;
    std::uint32_t m_bytesSent = 0;
    std::uint32_t m_contentSize;
    int m_fileHandle;
    const oxClock* m_clock;
};
