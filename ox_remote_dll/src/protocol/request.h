// One HTTP/1.0 request: read from a socket, then taken apart.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "net/socket.h"
#include "protocol/credentials.h"
#include "support/errorsink.h"

// The largest requests that are taken.
struct oxRequestLimits {
    static constexpr std::size_t INLINE_BUFFER = 32767;  // bytes; also the room kept for the header block
    static constexpr std::int64_t MAX_GROWN = 2097151;   // content length + INLINE_BUFFER must not exceed it
    static constexpr std::size_t PATH_BUFFER = 8192;     // a path of this many characters or more is refused
    static constexpr int MAX_DRAIN_READS = 11;           // reads that empty the socket behind a body that is too long
};

// A request belongs to one session thread. `Read` fills its buffer, `Parse` fills the fields; the session answers by
// `GetStatus`. It is large (the buffer for usual requests lies inside it) and lives on the session's stack.
class oxRequest : public oxCredentials {
public:
    enum Method { METHOD_NONE = 0, METHOD_GET = 1, METHOD_HEAD = 2, METHOD_POST = 3 };
    enum Status {
        STATUS_GOOD = 0,
        STATUS_ABORTED = -1,       // the peer aborted or reset the connection
        STATUS_SOCKET_ERROR = -2,  // reported in the log
        STATUS_TOO_LARGE = -3,     // answered with 413
        STATUS_BAD = -4            // answered with 400
    };

    oxRequest();
    oxRequest(const oxRequest&) = delete;
    oxRequest& operator=(const oxRequest&) = delete;

    // Reads one request, waiting as long as it takes; another thread ends it by closing the socket. False when the
    // status says why not, or with status 0 when the socket was closed by another thread; failures are reported in the
    // log.
    bool Read(oxSocket& socket, oxErrorSink& log);
    // Takes the buffer apart. False, with a status, when the request is bad.
    bool Parse();
    // True when everything that belongs to the request has been read from the socket, as far as the request tells: the
    // body of a POST that announced none in the way that is looked for may still be on its way.
    bool IsComplete() const {
        return m_complete && (m_method != METHOD_POST || m_body != NOWHERE || m_announcedLength == 0);
    }

    Method GetMethod() const { return m_method; }
    const char* GetMethodName() const;  // empty when unknown
    Status GetStatus() const { return m_status; }
    int GetVersionMajor() const { return m_versionMajor; }
    int GetVersionMinor() const { return m_versionMinor; }
    // The URL as it stood, up to any "?": empty when the request has no URL that begins with "/".
    std::string_view GetRawPath() const;
    const std::string& GetPath() const { return m_path; }                // decoded
    const std::string& GetExtension() const { return m_extension; }      // behind the last "." anywhere in the path
    const std::string& GetQueryString() const { return m_queryString; }  // not decoded; may hold NUL bytes of a body
    const std::string& GetIfModifiedSince() const { return m_ifModifiedSince; }
    const std::string& GetUserAgent() const { return m_userAgent; }
    const std::string& GetVersionText() const { return m_versionText; }
    std::string_view GetBody() const;
    std::uint32_t GetContentLength() const { return m_contentLength; }

private:
    // Offsets into the buffer instead of pointers: the buffer may be exchanged while reading.
    static constexpr std::size_t NOWHERE = static_cast<std::size_t>(-1);

    enum class Step { More, Done, Failed };
    void Reset();
    Step TakeArrived(oxSocket& socket, std::size_t arrived);
    void FindHeaderEnd(std::size_t arrived);
    bool FindAnnouncedLength();
    bool BodyNamesLength(std::size_t arrived);
    bool Grow();
    void Drain(oxSocket& socket);
    void Cut();
    bool FailTimedOut(oxErrorSink& log);
    bool FailRead(int error, oxErrorSink& log);
    std::size_t BodyStart() const;
    std::string_view Text() const;
    bool ParseRequestLine(std::string_view text, std::string_view& headers);
    bool TakeUrl(std::string_view url);
    void TakeVersion(std::string_view token);
    void ParseHeaders(std::string_view headers);

    int m_versionMajor = 0;
    int m_versionMinor = 0;
    std::uint32_t m_contentLength = 0;
    std::size_t m_pathLength = 0;
    Status m_status = STATUS_GOOD;
    Method m_method = METHOD_NONE;
    std::size_t m_rawUrl = NOWHERE;
    std::size_t m_body = NOWHERE;
    std::size_t m_count = 0;              // bytes of the buffer that belong to the request; a NUL stands behind them
    std::size_t m_limit = 0;              // the count at which the buffer is full
    std::size_t m_headerEnd = NOWHERE;    // of the blank line that ends the header block
    std::int64_t m_announcedLength = -1;  // of the body; -1 until the header block is complete
    bool m_watchBody = false;
    bool m_complete = false;
    char* m_buffer;
    std::unique_ptr<char[]> m_largeBuffer;
    std::string m_path;
    std::string m_queryString;
    std::string m_ifModifiedSince;
    std::string m_versionText;
    std::string m_extension;
    std::string m_userAgent;
    char m_inlineBuffer[oxRequestLimits::INLINE_BUFFER];
};
